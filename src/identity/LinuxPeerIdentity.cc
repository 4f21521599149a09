// SPDX-License-Identifier: Apache-2.0
#include "identity/LinuxPeerIdentity.h"

#include "base/Try.h"
#include "identity/LinuxPeer.h"
#include "os/Openat2.h"

#include <cerrno>
#include <charconv>
#include <fcntl.h>
#include <poll.h>
#include <string>
#include <string_view>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <unistd.h>
#include <utility>

namespace zor::platform {

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

} // namespace zor::platform
