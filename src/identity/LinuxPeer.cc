// SPDX-License-Identifier: Apache-2.0
#include "identity/LinuxPeer.h"

#include "os/FileChanges.h"
#include "os/FileDescriptor.h"
#include "platform/Errno.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <climits>
#include <fcntl.h>
#include <poll.h>
#include <string>
#include <string_view>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
#include <unistd.h>
#include <utility>

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

namespace {

/// The path in a line of the unified hierarchy, or of the manager's own one on systems that still have several.
std::string_view managerPath(std::string_view line) {
    const std::size_t first = line.find(':');
    const std::size_t second = line.find(':', first == line.npos ? first : first + 1);
    if (second == line.npos)
        return {};
    const std::string_view controllers = line.substr(first + 1, second - first - 1);
    const bool isUnified = line.substr(0, first) == "0" && controllers.empty();
    return isUnified || controllers == "name=systemd" ? line.substr(second + 1) : std::string_view();
}

std::string unitInPath(std::string_view path) {
    while (!path.empty()) {
        path.remove_prefix(path.front() == '/' ? 1 : 0);
        std::string_view name = path.substr(0, path.find('/'));
        path.remove_prefix(name.size());
        if (name.ends_with(".slice"))
            continue;
        // The manager puts an underscore before names that the kernel could mistake for its own files.
        name.remove_prefix(name.starts_with('_') ? 1 : 0);
        return std::string(name);
    }
    return {};
}

} // namespace

std::string systemUnitInCgroups(std::string_view cgroups) {
    std::string unit;
    while (!cgroups.empty()) {
        const std::string_view line = cgroups.substr(0, cgroups.find('\n'));
        cgroups.remove_prefix(line.size() < cgroups.size() ? line.size() + 1 : line.size());
        const std::string_view path = managerPath(line);
        // With several hierarchies the unified one may know no units; the manager's own line counts wherever it stands.
        if (std::string found = unitInPath(path); !found.empty())
            unit = std::move(found);
    }
    return unit;
}

namespace {

#ifdef SO_PEERPIDFD
constexpr int peerPidfdOption = SO_PEERPIDFD;
#else
constexpr int peerPidfdOption = 77;
#endif
constexpr std::size_t labelBytesMax = 4096;
constexpr std::size_t fdinfoBytesMax = 4096;

/// A descriptor of the process that connected. Kernels before 6.5 do not keep one with the socket: there the process
/// that has the pid now is taken. Should the pid have been given to another one in the moment since the connect, that
/// one is judged by its executable, but still under the uid that the kernel recorded.
FileDescriptor processOfPeer(int socket, pid_t pid) {
    int fd = -1;
    socklen_t length = sizeof fd;
    if (::getsockopt(socket, SOL_SOCKET, peerPidfdOption, &fd, &length) == 0)
        return FileDescriptor(fd);
    if (errno != ENOPROTOOPT)
        return {};
    return FileDescriptor(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)));
}

ErrnoOr<FileDescriptor> unlessShortage(Errno error) {
    return isOwnShortage(error) ? ErrnoOr<FileDescriptor>(error) : FileDescriptor();
}

bool hasEnded(int pidfd) {
    pollfd ended{.fd = pidfd, .events = POLLIN, .revents = 0};
    int count = 0;
    do {
        count = ::poll(&ended, 1, 0);
    } while (count < 0 && errno == EINTR);
    return count != 0;
}

/// Which number /proc gives the process: what it has in the namespace that /proc belongs to. An error when that cannot
/// be told.
ErrnoOr<pid_t> numberInProc(int pidfd) {
    const std::string path = "/proc/self/fdinfo/" + std::to_string(pidfd);
    const FileDescriptor file(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    const std::string text = TRY(file.valid() ? readSmallFile(file.get(), fdinfoBytesMax) : Errno::last());
    constexpr std::string_view field = "\nPid:\t";
    const std::size_t at = text.find(field);
    pid_t number = 0;
    if (at != std::string::npos)
        (void)std::from_chars(text.data() + at + field.size(), text.data() + text.size(), number);
    return number;
}

/// /proc/PID of the peer. It was the peer's when it was opened if the peer was alive afterwards; from then on the
/// descriptor belongs to that process alone. Invalid when the peer has ended; an error when there was no descriptor or
/// no memory to look: a living peer would be nobody for as long as it is connected.
ErrnoOr<FileDescriptor> pinProcess(int socket, pid_t pid) {
    const FileDescriptor process = processOfPeer(socket, pid);
    if (!process.valid())
        return unlessShortage(Errno::last());
    // Another /proc may have been mounted there since the start: its number for this process would be another's.
    const auto number = numberInProc(process.get());
    if (!number)
        return unlessShortage(number.error());
    if (*number != pid)
        return FileDescriptor();
    const std::string path = "/proc/" + std::to_string(pid);
    FileDescriptor directory(::open(path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!directory.valid())
        return unlessShortage(Errno::last());
    if (hasEnded(process.get()))
        directory.reset();
    return directory;
}

std::optional<std::string> securityLabelOf(int socket) {
    std::string label(256, '\0');
    for (;;) {
        auto length = static_cast<socklen_t>(label.size());
        if (::getsockopt(socket, SOL_SOCKET, SO_PEERSEC, label.data(), &length) == 0) {
            label.resize(length);
            break;
        }
        if (errno != ERANGE || length <= label.size() || length > labelBytesMax)
            return std::nullopt;
        label.resize(length);
    }
    while (!label.empty() && (label.back() == '\0' || label.back() == '\n'))
        label.pop_back();
    if (label.empty())
        return std::nullopt;
    return label;
}

} // namespace

bool LinuxPeerIdentity::procIsOurs() {
    char number[16];
    const ssize_t bytes = ::readlink("/proc/self", number, sizeof number);
    return bytes > 0 && std::string_view(number, static_cast<std::size_t>(bytes)) == std::to_string(::getpid());
}

std::unique_ptr<Peer> LinuxPeerIdentity::peerOfSocket(int socket) {
    ucred credentials{};
    socklen_t length = sizeof credentials;
    if (::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0)
        return nullptr;
    // 0 is a process that has no pid here: one outside of this pid namespace.
    if (credentials.pid <= 0 || credentials.uid == static_cast<uid_t>(-1)) {
        errno = ESRCH;
        return nullptr;
    }
    auto process = pinProcess(socket, credentials.pid);
    if (!process) {
        errno = process.error().number();
        return nullptr;
    }
    AddressSpace addressSpace;
    std::optional<FileId> executable;
    if (process->valid()) {
        addressSpace = AddressSpace::of(process->get());
        const auto now = LinuxPeer::executableOf(process->get());
        if (!now && isOwnShortage(now.error())) {
            errno = now.error().number();
            return nullptr;
        }
        if (now)
            executable = now->id;
    }
    const bool isOwner = daemonUserId_ != 0 && ownsRoot(credentials.uid);
    return std::make_unique<LinuxPeer>(LinuxPeer::Accepted{.pid = credentials.pid,
                                                           .uid = credentials.uid,
                                                           .gid = credentials.gid,
                                                           .reportedUserId = isOwner ? 0 : credentials.uid,
                                                           .process = std::move(*process),
                                                           .addressSpace = std::move(addressSpace),
                                                           .executable = executable,
                                                           .securityLabel = securityLabelOf(socket)},
                                       registry_);
}

bool LinuxPeerIdentity::allowsPassedSockets(std::string_view identifier) {
    registry_.takeNotices();
    const auto snapshot = registry_.snapshot();
    return std::ranges::any_of(snapshot->entries, [&](const IdentityRegistry::Registered& registered) {
        return registered.entry->passedSockets && registered.entry->grant->identifier == identifier;
    });
}

} // namespace zor::platform
