// SPDX-License-Identifier: Apache-2.0
#include "platform/linux/DaemonLock.h"

#include "platform/linux/Names.h"
#include "platform/linux/Openat2.h"
#include "platform/linux/SmallFile.h"

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <string>
#include <string_view>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

namespace zor::platform {

namespace {
/// Whoever can open the file can hold the lock and keep the daemon from starting.
constexpr mode_t lockMode = 0600;
/// A line of /proc/locks is about 60 bytes.
constexpr std::size_t lockListBytesMax = std::size_t{16} << 20;
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
    // "1: FLOCK  ADVISORY  WRITE 4711 00:1c:12345 0 EOF". Stacked file systems give the device of a lower one, so the
    // inode alone has to do.
    const std::string inode = ":" + std::to_string(status.st_ino) + " ";
    for (std::size_t begin = 0; begin < locks->size();) {
        const std::size_t end = std::min(locks->find('\n', begin), locks->size());
        const std::string_view line(locks->data() + begin, end - begin);
        if (line.find(" FLOCK ") != line.npos && line.find(" WRITE ") != line.npos && line.find(inode) != line.npos &&
            line.find("->") == line.npos)
            return true;
        begin = end + 1;
    }
    return false;
}

} // namespace zor::platform
