// SPDX-License-Identifier: Apache-2.0
#include "platform/linux/DaemonLock.h"

#include "platform/linux/Names.h"
#include "platform/linux/Openat2.h"

#include <cerrno>
#include <fcntl.h>
#include <string>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

namespace zor::platform {

namespace {
/// Whoever can open the file can hold the lock and keep the daemon from starting.
constexpr mode_t lockMode = 0600;
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

} // namespace zor::platform
