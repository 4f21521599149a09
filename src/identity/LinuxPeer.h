// SPDX-License-Identifier: Apache-2.0
// One connected process, pinned: the descriptor of its /proc directory stays with that very process, so nobody who is
// given its pid later is taken for it.
//
// Per message, while nothing changed: one look whether the process has left its address space, as it does to execute
// another program (AddressSpace.h), and a few comparisons. Each time that it may have, that the registry has changed,
// and that `examineEveryMilliseconds` are over, which bounds what an address space that is shared can hide: one statx
// of "exe" (which file the process runs now). When the registry has changed, it is judged anew. A process that has
// executed another file since it was accepted is granted nothing, and never again: what it sends now may have been
// begun by the program of before. The same file executed again changes nothing, unless it has a set-ID bit and gives a
// user or group that the process did not connect with; that is looked at for such files alone, and there it tells also
// of a program that was executed between the connect and the accept. A process that cannot be examined (it has
// ended, or belongs to somebody whom a daemon that is not root may not look at) is granted nothing.
//
// Not told apart: a program without set-ID bits that is executed before the accept, and one that executes another,
// which executes it again, between two messages. Both run under the uid that connected, and to whoever has that uid
// their powers are open anyway. One thread at a time.
#pragma once

#include "identity/AddressSpace.h"
#include "identity/IdentityRegistry.h"
#include "os/FileDescriptor.h"
#include "platform/Errno.h"
#include "platform/Service.h"

#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace zor::platform {

class LinuxPeer final : public Peer {
public:
    /// A file that a process runs.
    struct Executable {
        FileId id;
        bool givesUser = false;
        bool givesGroup = false;
        uid_t uid = 0;
        gid_t gid = 0;
    };
    /// The program that a process runs, by its /proc directory; or the error of the look.
    [[nodiscard]] static ErrnoOr<Executable> executableOf(int process);

    /// The kernel's words when the connection was accepted.
    struct Accepted {
        pid_t pid = 0;
        // Effective ones, of the moment of the connect.
        uid_t uid = 0;
        gid_t gid = 0;
        /// The uid as the daemon reports it.
        std::uint32_t reportedUserId = 0;
        /// /proc/PID, certain to be the process that connected; invalid when that one had ended.
        FileDescriptor process;
        /// Its own, opened before `executable` was looked at.
        AddressSpace addressSpace;
        /// Absent when it could not be examined.
        std::optional<FileId> executable;
        std::optional<std::string> securityLabel;
    };
    LinuxPeer(Accepted accepted, IdentityRegistry& registry) : accepted_(std::move(accepted)), registry_(registry) {}

    [[nodiscard]] Identity identify(Explain explain) override;
    [[nodiscard]] pid_t pid() const override { return accepted_.pid; }
    [[nodiscard]] uid_t kernelUserId() const override { return accepted_.uid; }

private:
    /// Whether this is what it ran when it was accepted, with the user and group that it connected with.
    [[nodiscard]] bool isAsAccepted(const Executable& now) const;
    struct Judgement {
        std::shared_ptr<const IdentityGrant> grant;
        /// An entry names the executable, whether it matched or not.
        bool named = false;
        /// False when it could not be told whether an entry matches: nothing is granted, and it is judged again.
        bool decided = true;
        std::string explanation;
    };
    [[nodiscard]] Judgement judge(const IdentityRegistry::Snapshot& snapshot, const FileId& executable) const;
    /// In words, what keeps the peer from being the one that the entry means; empty: nothing does. An error when there
    /// was no descriptor or no memory to look.
    [[nodiscard]] ErrnoOr<std::string> mismatch(const RegistryEntry& entry) const;
    /// Empty when it is in none; the same errors.
    [[nodiscard]] ErrnoOr<std::string> unit() const;
    [[nodiscard]] std::string executableName() const;

    const Accepted accepted_;
    IdentityRegistry& registry_;
    bool hasExecutedAnother_ = false;
    /// Until then, by the coarse clock, the last judgement may hold without a look at the executable.
    std::int64_t examineAtMilliseconds_ = 0;
    // The last judgement, and the generation that it rests on.
    std::uint64_t judgedGeneration_ = 0;
    std::shared_ptr<const IdentityGrant> judgedGrant_;
};

// The process behind a connected socket: what the kernel recorded when it connected, and the process itself. Any
// thread.

/// The first name in the process's path that is no slice: units of the system manager lie in slices only. So a unit
/// that a user's own manager started, whatever its name, is not it; what lies deeper than a system unit belongs to that
/// unit. Empty when there is none.
[[nodiscard]] std::string systemUnitInCgroups(std::string_view cgroups);

class LinuxPeerIdentity final : public PeerIdentity {
public:
    /// `daemonUserId` is the uid that this process runs under. A daemon that is not root reports its own uid and root's
    /// as 0: on its root it is the owner.
    LinuxPeerIdentity(IdentityRegistry& registry, uid_t daemonUserId)
        : registry_(registry), daemonUserId_(daemonUserId) {}

    /// Whether /proc is of this process's own pid namespace: in another's, numbers are other processes'. A daemon for
    /// which it is not cannot tell its peers apart.
    [[nodiscard]] static bool procIsOurs();

    /// The peer must not outlive this object.
    [[nodiscard]] std::unique_ptr<Peer> peerOfSocket(int socket) override;
    [[nodiscard]] bool ownsRoot(uid_t uid) const override { return uid == 0 || uid == daemonUserId_; }
    [[nodiscard]] bool allowsPassedSockets(std::string_view identifier) override;

private:
    IdentityRegistry& registry_;
    const uid_t daemonUserId_;
};

} // namespace zor::platform
