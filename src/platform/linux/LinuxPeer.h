// SPDX-License-Identifier: Apache-2.0
// One connected process, pinned: the descriptor of its /proc directory stays with that very process, so nobody who is
// given its pid later is taken for it.
//
// Per message, while nothing changed: one fstatat of "exe" (which file the process runs now) and two comparisons. When
// the process has executed something else, or the registry has changed, it is judged anew. Whatever cannot be examined
// (the process has ended, or belongs to somebody whom a daemon that is not root may not look at) is granted nothing.
// One thread at a time.
#pragma once

#include "platform/FileDescriptor.h"
#include "platform/PeerIdentity.h"
#include "platform/linux/IdentityRegistry.h"

#include <memory>
#include <optional>
#include <string>

namespace zor::platform {

class LinuxPeer final : public Peer {
public:
    /// What the kernel said when the connection was accepted.
    struct Accepted {
        pid_t pid = 0;
        uid_t uid = 0;
        /// The uid as the daemon reports it.
        std::uint32_t reportedUserId = 0;
        /// /proc/PID, certain to be the process that connected; invalid when that one had ended.
        FileDescriptor process;
        std::optional<std::string> securityLabel;
    };
    LinuxPeer(Accepted accepted, IdentityRegistry& registry) : accepted_(std::move(accepted)), registry_(registry) {}

    [[nodiscard]] Identity identify(Explain explain) override;
    [[nodiscard]] pid_t pid() const override { return accepted_.pid; }
    [[nodiscard]] uid_t kernelUserId() const override { return accepted_.uid; }

private:
    /// What the process runs, or the errno of the look.
    [[nodiscard]] std::expected<FileId, int> executable() const;
    struct Judgement {
        std::shared_ptr<const IdentityGrant> grant;
        /// An entry names the executable, whether it matched or not.
        bool named = false;
        /// False when it could not be told whether an entry matches: nothing is granted, and it is judged again.
        bool decided = true;
        std::string explanation;
    };
    [[nodiscard]] Judgement judge(const IdentityRegistry::Snapshot& snapshot, const FileId& executable) const;
    /// In words, what keeps the peer from being the one that the entry means; empty: nothing does. An errno when there
    /// was no descriptor or no memory to look.
    [[nodiscard]] std::expected<std::string, int> mismatch(const RegistryEntry& entry) const;
    /// Empty when it is in none; the same errnos.
    [[nodiscard]] std::expected<std::string, int> unit() const;
    [[nodiscard]] std::string executableName() const;

    const Accepted accepted_;
    IdentityRegistry& registry_;
    // The last judgement, and what it rests on.
    FileId judgedExecutable_;
    std::uint64_t judgedGeneration_ = 0;
    std::shared_ptr<const IdentityGrant> judgedGrant_;
};

} // namespace zor::platform
