// SPDX-License-Identifier: Apache-2.0
#include "identity/LinuxPeer.h"

#include "base/Try.h"
#include "identity/LinuxPeerIdentity.h"
#include "os/CoarseClock.h"
#include "os/Openat2.h"

#include <cerrno>
#include <climits>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

namespace zor::platform {

namespace {

constexpr std::size_t cgroupBytesMax = 64 * 1024;
constexpr const char* executableLink = "exe";
/// A peer pays for a look at its executable, some microseconds, at most once in this time.
constexpr std::int64_t examineEveryMilliseconds = 20;

std::string whyUnexamined(Errno error) {
    if (error == ESRCH || error == ENOENT || error == EBADF)
        return "the process has ended";
    return std::string("the executable cannot be examined: ") + error.text();
}

} // namespace

Identity LinuxPeer::identify(Explain explain) {
    const std::int64_t begin = coarseMilliseconds();
    registry_.lookIfDue(begin);
    Identity identity{
        .pid = accepted_.pid, .effectiveUserId = accepted_.reportedUserId, .grant = nullptr, .explanation = {}};
    if (explain == Explain::no && begin < examineAtMilliseconds_ && registry_.generation() == judgedGeneration_ &&
        accepted_.addressSpace.lives()) {
        identity.grant = judgedGrant_;
        return identity;
    }
    examineAtMilliseconds_ = 0;
    const auto now = executableOf(accepted_.process.get());
    hasExecutedAnother_ = hasExecutedAnother_ || (now && !isAsAccepted(*now));
    if (!now || hasExecutedAnother_) {
        judgedGeneration_ = 0;
        judgedGrant_ = nullptr;
        if (explain == Explain::yes)
            identity.explanation =
                now ? "the process has executed another program since it connected" : whyUnexamined(now.error());
        return identity;
    }
    if (accepted_.addressSpace.lives())
        examineAtMilliseconds_ = begin + examineEveryMilliseconds;
    if (explain == Explain::no && registry_.generation() == judgedGeneration_) {
        identity.grant = judgedGrant_;
        return identity;
    }
    registry_.takeNotices();
    auto snapshot = registry_.snapshot();
    Judgement judgement = judge(*snapshot, now->id);
    if (!judgement.named && registry_.lookAgain()) {
        snapshot = registry_.snapshot();
        judgement = judge(*snapshot, now->id);
    }
    judgedGeneration_ = judgement.decided ? snapshot->generation : 0;
    judgedGrant_ = judgement.grant;
    identity.grant = std::move(judgement.grant);
    if (explain == Explain::yes)
        identity.explanation = std::move(judgement.explanation);
    return identity;
}

ErrnoOr<LinuxPeer::Executable> LinuxPeer::executableOf(int process) {
    struct statx status{};
    // The link is one of the kernel's: following it leads to the file that runs, whatever its name is or was. The
    // numbers that tell it apart never change, so a file system that a server keeps, maybe the peer's own, need not be
    // asked.
    if (::statx(process, executableLink, AT_STATX_DONT_SYNC, STATX_INO | STATX_MODE | STATX_UID | STATX_GID, &status) !=
        0)
        return Errno::last();
    return Executable{.id = {.device = makedev(status.stx_dev_major, status.stx_dev_minor), .inode = status.stx_ino},
                      .givesUser = (status.stx_mode & S_ISUID) != 0,
                      .givesGroup = (status.stx_mode & S_ISGID) != 0,
                      .uid = status.stx_uid,
                      .gid = status.stx_gid};
}

bool LinuxPeer::isAsAccepted(const Executable& now) const {
    if (now.id != accepted_.executable)
        return false;
    const bool mayHaveUser = now.givesUser && now.uid != accepted_.uid;
    const bool mayHaveGroup = now.givesGroup && now.gid != accepted_.gid;
    if (!mayHaveUser && !mayHaveGroup)
        return true;
    // The directory belongs to the process's effective user and group, whatever hides the rest of it. A program may
    // have dropped what its file gave it before it connected.
    struct statx process{};
    return ::statx(accepted_.process.get(), "", AT_EMPTY_PATH, STATX_UID | STATX_GID, &process) == 0 &&
           !(mayHaveUser && process.stx_uid == now.uid) && !(mayHaveGroup && process.stx_gid == now.gid);
}

LinuxPeer::Judgement LinuxPeer::judge(const IdentityRegistry::Snapshot& snapshot, const FileId& executable) const {
    Judgement judgement;
    for (const IdentityRegistry::Registered& registered : snapshot.entries) {
        if (registered.executable != executable)
            continue;
        // Inode numbers are used again: what the path names is looked at once more before power is given.
        if (registry_.executableAt(registered.entry->executable) != executable)
            continue;
        judgement.named = true;
        const auto reason = mismatch(*registered.entry);
        judgement.explanation += (judgement.explanation.empty() ? "" : "; ") + registered.fileName + ": ";
        if (!reason) {
            // No entry after it counts either: this may be the one.
            judgement.decided = false;
            judgement.explanation += std::string("the process cannot be examined: ") + reason.error().text();
            return judgement;
        }
        judgement.explanation += reason->empty() ? "matches" : *reason;
        if (reason->empty()) {
            judgement.grant = registered.entry->grant;
            return judgement;
        }
    }
    if (!judgement.named)
        judgement.explanation = "no entry names " + executableName();
    return judgement;
}

ErrnoOr<std::string> LinuxPeer::mismatch(const RegistryEntry& entry) const {
    if (!entry.admitsUser(accepted_.reportedUserId))
        return "uid " + std::to_string(accepted_.reportedUserId) +
               (entry.userIds ? " is not one of its UserIDs" : " is not 0, and it names no UserIDs");
    if (entry.unit) {
        const std::string actual = TRY(unit());
        if (actual != *entry.unit)
            return "the process is in unit \"" + actual + "\", not in \"" + *entry.unit + "\"";
    }
    if (entry.securityLabel && !accepted_.securityLabel)
        return "the kernel gives no security label";
    if (entry.securityLabel && entry.securityLabel != accepted_.securityLabel)
        return "the security label is \"" + *accepted_.securityLabel + "\"";
    return std::string();
}

ErrnoOr<std::string> LinuxPeer::unit() const {
    const FileDescriptor file(::openat(accepted_.process.get(), "cgroup", O_RDONLY | O_CLOEXEC));
    const auto text = file.valid() ? readSmallFile(file.get(), cgroupBytesMax) : Errno::last();
    if (!text && isOwnShortage(text.error()))
        return text.error();
    return text ? systemUnitInCgroups(*text) : std::string();
}

std::string LinuxPeer::executableName() const {
    char buffer[PATH_MAX];
    const ssize_t bytes = ::readlinkat(accepted_.process.get(), executableLink, buffer, sizeof buffer);
    return bytes > 0 ? std::string(buffer, static_cast<std::size_t>(bytes)) : std::string("the executable");
}

} // namespace zor::platform
