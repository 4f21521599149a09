// SPDX-License-Identifier: Apache-2.0
#include "os/FileDescriptor.h"

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdint>
#include <dirent.h>
#include <fcntl.h>
#include <initializer_list>
#include <linux/openat2.h>
#include <memory>
#include <string_view>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <thread>
#include <unistd.h>

namespace zor::platform {

bool fillStandardDescriptors() {
    for (const int fd : {STDIN_FILENO, STDOUT_FILENO, STDERR_FILENO})
        // The lowest number that is free is taken, and none below is.
        if (::fcntl(fd, F_GETFD) < 0 && ::open("/dev/null", O_RDWR) != fd)
            return false;
    return true;
}

namespace {

/// The kernel answers EAGAIN when a rename raced with its check; a client that renames without pause must not hold us.
constexpr int attemptsMax = 128;
/// From here on with a pause: one who renames at a higher priority gets to its end.
constexpr int attemptsAtOnce = 8;
constexpr std::chrono::microseconds pause{100};

ErrnoOr<FileDescriptor> resolve(int directory, const char* path, int flags, mode_t mode, std::uint64_t rules) {
    open_how how{};
    how.flags = static_cast<std::uint64_t>(static_cast<unsigned>(flags | O_CLOEXEC));
    how.mode = mode;
    how.resolve = rules;
    for (int attempt = 0;; ++attempt) {
        const long fd = ::syscall(SYS_openat2, directory, path, &how, sizeof how);
        if (fd >= 0)
            return FileDescriptor(static_cast<int>(fd));
        if (errno != EINTR && (errno != EAGAIN || attempt >= attemptsMax))
            return Errno::last();
        if (attempt >= attemptsAtOnce)
            std::this_thread::sleep_for(pause);
    }
}

ErrnoOr<FileDescriptor> remembered(int directory, const char* path, int flags, std::uint64_t rules) {
    open_how how{};
    how.flags = static_cast<std::uint64_t>(static_cast<unsigned>(flags | O_PATH | O_CLOEXEC));
    how.resolve = rules | RESOLVE_CACHED;
    const long fd = ::syscall(SYS_openat2, directory, path, &how, sizeof how);
    if (fd >= 0)
        return FileDescriptor(static_cast<int>(fd));
    return errno == EINVAL ? Errno(EAGAIN) : Errno::last();
}

bool hasParentComponent(std::string_view path) {
    for (std::size_t at = path.find(".."); at != path.npos; at = path.find("..", at + 1))
        if ((at == 0 || path[at - 1] == '/') && (at + 2 == path.size() || path[at + 2] == '/'))
            return true;
    return false;
}

/// Whether a path is certain to lead down from where it begins when it follows no link.
bool leadsDown(const char* path) {
    return path[0] != '/' && !hasParentComponent(path);
}

} // namespace

ErrnoOr<FileDescriptor> openBeneath(int directory, const char* relativePath, int flags, mode_t mode) {
    return resolve(directory, relativePath, flags, mode, RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS);
}

ErrnoOr<FileDescriptor> openBeneathOnMount(int directory, const char* relativePath, int flags) {
    // RESOLVE_BENEATH would find that too, at a tenth of the price of the whole call, which walks of large trees make
    // for every directory.
    if (!leadsDown(relativePath))
        return Errno(EXDEV);
    return resolve(directory, relativePath, flags, 0, RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS | RESOLVE_NO_XDEV);
}

ErrnoOr<FileDescriptor> openBeneathRemembered(int directory, const char* relativePath, int flags) {
    // The same price, for every lookup.
    if (!leadsDown(relativePath))
        return Errno(EXDEV);
    return remembered(directory, relativePath, flags, RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS);
}

ErrnoOr<FileDescriptor> openRemembered(const char* path) {
    return remembered(AT_FDCWD, path, 0, 0);
}

ErrnoOr<FileDescriptor> openInRoot(int directory, const char* relativePath, int flags) {
    return resolve(directory, relativePath, flags, 0, RESOLVE_IN_ROOT | RESOLVE_NO_MAGICLINKS);
}

ErrnoOr<std::uint64_t> mountIdOf(int fd) {
    struct statx status{};
    if (::statx(fd, "", AT_EMPTY_PATH | AT_STATX_DONT_SYNC | AT_NO_AUTOMOUNT, STATX_MNT_ID, &status) != 0)
        return Errno::last();
    if ((status.stx_mask & STATX_MNT_ID) == 0)
        return Errno(ENOSYS);
    return status.stx_mnt_id;
}

ErrnoOr<std::string> readSmallFile(int fd, std::size_t bytesMax) {
    struct stat status{};
    if (::fstat(fd, &status) != 0)
        return Errno::last();
    if (!S_ISREG(status.st_mode))
        return Errno(EINVAL);
    // The size is a hint only: files of procfs say 0, and others may grow meanwhile.
    constexpr std::size_t readBytesMin = 512;
    std::string bytes;
    std::size_t filled = 0;
    for (;;) {
        if (filled > bytesMax)
            return Errno(EFBIG);
        if (filled == bytes.size()) {
            const std::size_t hinted = std::max(static_cast<std::size_t>(status.st_size) + 1, readBytesMin);
            bytes.resize(std::min(std::max(hinted, filled * 2), bytesMax + 1));
        }
        const ssize_t count = ::read(fd, bytes.data() + filled, bytes.size() - filled);
        if (count < 0 && errno == EINTR)
            continue;
        if (count < 0)
            return Errno::last();
        if (count == 0)
            break;
        filled += static_cast<std::size_t>(count);
    }
    bytes.resize(filled);
    return bytes;
}

namespace {
struct DirectoryCloser {
    void operator()(DIR* directory) const { ::closedir(directory); }
};
} // namespace

ErrnoOr<std::vector<std::string>> directoryNames(int directory) {
    std::vector<std::string> names;
    FileDescriptor own(::openat(directory, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    const std::unique_ptr<DIR, DirectoryCloser> stream(own.valid() ? ::fdopendir(own.get()) : nullptr);
    if (!stream)
        return Errno::last();
    (void)own.release();
    for (;;) {
        errno = 0;
        const dirent* const entry = ::readdir(stream.get());
        if (!entry && errno != 0)
            return Errno::last();
        if (!entry)
            break;
        const std::string_view name = entry->d_name;
        if (name != "." && name != "..")
            names.emplace_back(name);
    }
    std::ranges::sort(names);
    return names;
}

ErrnoOr<std::size_t> readOnce(int fd, std::span<std::uint8_t> bytes) {
    for (;;) {
        const ssize_t count = ::read(fd, bytes.data(), bytes.size());
        if (count >= 0)
            return static_cast<std::size_t>(count);
        if (errno != EINTR)
            return Errno::last();
    }
}

std::vector<std::string> directoryNamesIfAny(int directory) {
    return directoryNames(directory).value_or(std::vector<std::string>());
}

bool hidesNames(int directory) {
    struct statx status{};
    if (::statx(directory, "", AT_EMPTY_PATH | AT_STATX_DONT_SYNC, 0, &status) != 0 ||
        (status.stx_attributes & STATX_ATTR_ENCRYPTED) == 0)
        return false;
    // Only making something needs the key. A file without a name is gone when it is closed.
    const auto unnamed = openBeneath(directory, ".", O_TMPFILE | O_RDWR, 0600);
    return !unnamed && unnamed.error() == ENOKEY;
}

} // namespace zor::platform
