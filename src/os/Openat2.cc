// SPDX-License-Identifier: Apache-2.0
#include "os/Openat2.h"

#include <cerrno>
#include <cstdint>
#include <fcntl.h>
#include <linux/openat2.h>
#include <string_view>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace zor::platform {

namespace {

/// The kernel answers EAGAIN when a rename raced with its check; a client that renames without pause must not hold us.
constexpr int attemptsMax = 128;

std::expected<FileDescriptor, int> resolve(int directory, const char* path, int flags, mode_t mode,
                                           std::uint64_t rules) {
    open_how how{};
    how.flags = static_cast<std::uint64_t>(static_cast<unsigned>(flags | O_CLOEXEC));
    how.mode = mode;
    how.resolve = rules;
    for (int attempt = 0;; ++attempt) {
        const long fd = ::syscall(SYS_openat2, directory, path, &how, sizeof how);
        if (fd >= 0)
            return FileDescriptor(static_cast<int>(fd));
        if (errno != EINTR && (errno != EAGAIN || attempt >= attemptsMax))
            return std::unexpected(errno);
    }
}

bool hasParentComponent(std::string_view path) {
    return path == ".." || path.starts_with("../") || path.ends_with("/..") || path.find("/../") != path.npos;
}

} // namespace

std::expected<FileDescriptor, int> openBeneath(int directory, const char* relativePath, int flags, mode_t mode) {
    return resolve(directory, relativePath, flags, mode, RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS);
}

std::expected<FileDescriptor, int> openBeneathOnMount(int directory, const char* relativePath, int flags) {
    // Where no link is followed, only these lead out. RESOLVE_BENEATH would find them too, at a tenth of the price of
    // the whole call, which walks of large trees make for every directory.
    if (relativePath[0] == '/' || hasParentComponent(relativePath))
        return std::unexpected(EXDEV);
    return resolve(directory, relativePath, flags, 0, RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS | RESOLVE_NO_XDEV);
}

std::expected<FileDescriptor, int> openBeneathRemembered(int directory, const char* relativePath, int flags) {
    open_how how{};
    how.flags = static_cast<std::uint64_t>(static_cast<unsigned>(flags | O_PATH | O_CLOEXEC));
    how.resolve = RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS | RESOLVE_CACHED;
    const long fd = ::syscall(SYS_openat2, directory, relativePath, &how, sizeof how);
    if (fd >= 0)
        return FileDescriptor(static_cast<int>(fd));
    return std::unexpected(errno == EINVAL ? EAGAIN : errno);
}

std::expected<FileDescriptor, int> openInRoot(int directory, const char* relativePath, int flags) {
    return resolve(directory, relativePath, flags, 0, RESOLVE_IN_ROOT | RESOLVE_NO_MAGICLINKS);
}

std::expected<std::uint64_t, int> mountIdOf(int fd) {
    struct statx status{};
    if (::statx(fd, "", AT_EMPTY_PATH | AT_STATX_DONT_SYNC | AT_NO_AUTOMOUNT, STATX_MNT_ID, &status) != 0)
        return std::unexpected(errno);
    if ((status.stx_mask & STATX_MNT_ID) == 0)
        return std::unexpected(ENOSYS);
    return status.stx_mnt_id;
}

} // namespace zor::platform
