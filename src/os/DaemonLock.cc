// SPDX-License-Identifier: Apache-2.0
#include "os/DaemonLock.h"

#include "os/Names.h"
#include "os/Openat2.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <fcntl.h>
#include <string>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

namespace zor::platform {

namespace {
/// A process that can open the file can hold the lock and keep the daemon from starting.
constexpr mode_t lockMode = 0600;
/// A line of /proc/locks is about 60 bytes.
constexpr std::size_t lockListBytesMax = std::size_t{16} << 20;
/// Whether a line of the list is about a lock on that inode which its file's owner holds. "1: FLOCK  ADVISORY  WRITE
/// 4711 00:1c:12345 0 EOF". Stacked file systems give the device of a lower one, so the inode alone has to do; and
/// everybody can make one with that number somewhere, so the process counts too.
bool isOwnersLock(const std::string& line, const struct stat& file) {
    int process = 0;
    unsigned long long inode = 0;
    if (std::sscanf(line.c_str(), "%*d: FLOCK %*s WRITE %d %*x:%*x:%llu ", &process, &inode) != 2 ||
        inode != file.st_ino)
        return false;
    struct stat status{};
    return ::stat(("/proc/" + std::to_string(process)).c_str(), &status) == 0 && status.st_uid == file.st_uid;
}

} // namespace

std::expected<DaemonLock, int> DaemonLock::take(const SystemRoot& root) {
    auto file = openBeneath(root.runtimeDirectory(), names::lockFile, O_RDWR | O_CREAT | O_NONBLOCK, lockMode);
    if (!file)
        return std::unexpected(file.error());
    struct stat status{};
    if (::fstat(file->get(), &status) != 0)
        return std::unexpected(errno);
    if (!S_ISREG(status.st_mode))
        return std::unexpected(EINVAL);
    while (::flock(file->get(), LOCK_EX | LOCK_NB) != 0) {
        if (errno != EINTR)
            return std::unexpected(errno);
    }
    // For people who ask who holds it; nothing reads it.
    const std::string pid = std::to_string(::getpid()) + "\n";
    if (::ftruncate(file->get(), 0) == 0)
        (void)!::pwrite(file->get(), pid.data(), pid.size(), 0);
    return DaemonLock(std::move(*file));
}

bool DaemonLock::isHeld(const SystemRoot& root) {
    struct stat status{};
    if (::fstatat(root.runtimeDirectory(), names::lockFile, &status, AT_SYMLINK_NOFOLLOW) != 0)
        return false;
    const FileDescriptor file(::open("/proc/locks", O_RDONLY | O_CLOEXEC));
    const auto locks = file.valid() ? readSmallFile(file.get(), lockListBytesMax) : std::unexpected(errno);
    if (!locks)
        return false;
    for (std::size_t begin = 0; begin < locks->size();) {
        const std::size_t end = std::min(locks->find('\n', begin), locks->size());
        if (isOwnersLock(locks->substr(begin, end - begin), status))
            return true;
        begin = end + 1;
    }
    return false;
}

} // namespace zor::platform
