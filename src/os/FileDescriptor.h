// SPDX-License-Identifier: Apache-2.0
// File descriptors: their owner, and the ways to open, read and name something beneath an open directory.
//
// Closing ignores errors on purpose: nothing that must be durable relies on close.
#pragma once

#include "platform/Errno.h"

#include <cstddef>
#include <cstdint>
#include <span>
#include <string>
#include <sys/types.h>
#include <unistd.h>
#include <utility>
#include <vector>

namespace zor::platform {

class FileDescriptor {
public:
    FileDescriptor() = default;
    explicit FileDescriptor(int fd) : fd_(fd) {}
    FileDescriptor(FileDescriptor&& other) noexcept : fd_(std::exchange(other.fd_, -1)) {}
    FileDescriptor& operator=(FileDescriptor&& other) noexcept {
        if (this != &other)
            reset(std::exchange(other.fd_, -1));
        return *this;
    }
    FileDescriptor(const FileDescriptor&) = delete;
    FileDescriptor& operator=(const FileDescriptor&) = delete;
    ~FileDescriptor() { reset(); }

    [[nodiscard]] int get() const { return fd_; }
    [[nodiscard]] bool valid() const { return fd_ >= 0; }
    [[nodiscard]] int release() { return std::exchange(fd_, -1); }
    void reset(int fd = -1) {
        if (fd_ >= 0)
            ::close(fd_);
        fd_ = fd;
    }

private:
    int fd_ = -1;
};

// A program that was started without standard input, output or error.

/// Opens /dev/null in the place of each missing one of the first three descriptors. To be called before anything else
/// is opened: what got one of their numbers would be read, and written to, in their place.
[[nodiscard]] bool fillStandardDescriptors();

// Opening below a directory that others may write to: no link is followed and no step leads out, whatever the tree does
// meanwhile. Any thread.

/// Opens `relativePath` below `directory` (RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS | RESOLVE_NO_MAGICLINKS; O_CLOEXEC is
/// added). A link anywhere gives ELOOP (with O_PATH | O_NOFOLLOW a link in the last place too), a step out EXDEV.
[[nodiscard]] ErrnoOr<FileDescriptor> openBeneath(int directory, const char* relativePath, int flags, mode_t mode = 0);

/// The same, and no mount point is crossed, not even one of the same file system: EXDEV. The file system that is
/// mounted there is not asked. A ".." is refused even where it stays inside.
[[nodiscard]] ErrnoOr<FileDescriptor> openBeneathOnMount(int directory, const char* relativePath, int flags);

/// The same as openBeneath with O_PATH, out of the kernel's memory of names alone, and a ".." is refused even where it
/// stays inside: no file system is asked, so none can make it wait. EAGAIN, as often as it likes, where one would have
/// to be asked, or where the kernel has no such call.
[[nodiscard]] ErrnoOr<FileDescriptor> openBeneathRemembered(int directory, const char* relativePath, int flags);

/// The same for an absolute path, whose links are followed.
[[nodiscard]] ErrnoOr<FileDescriptor> openRemembered(const char* path);

/// The same as openBeneath for trees that only root writes to, such as DIR/etc: links are followed, as if `directory`
/// were "/".
[[nodiscard]] ErrnoOr<FileDescriptor> openInRoot(int directory, const char* relativePath, int flags);

/// The number of the mount that an open file lies on. Asks its file system nothing; errno on failure.
[[nodiscard]] ErrnoOr<std::uint64_t> mountIdOf(int fd);

// Reading a file of bounded size whole. Any thread.

/// Everything from the descriptor's offset on. EFBIG when that is more than `bytesMax`, EINVAL when it is no regular
/// file.
[[nodiscard]] ErrnoOr<std::string> readSmallFile(int fd, std::size_t bytesMax);
/// One read(2), begun again when a signal ends it: the bytes read, 0 at the end of the file.
[[nodiscard]] ErrnoOr<std::size_t> readOnce(int fd, std::span<std::uint8_t> bytes);

// The names in a directory that only root writes to. Any thread.

/// All names but "." and "..", sorted by their bytes; `directory` is a real descriptor, its offset is not used. An
/// errno when not all could be read.
[[nodiscard]] ErrnoOr<std::vector<std::string>> directoryNames(int directory);
/// The same for a caller that can do without the names: none when the directory cannot be read.
[[nodiscard]] std::vector<std::string> directoryNamesIfAny(int directory);

// Whether a directory shows what is in it. One that is encrypted by its file system, while its key is away, does not:
// it lists names that are none, and a name that is there is answered as missing. Any thread.

/// False also where that cannot be told. `directory` is open, O_PATH will do.
[[nodiscard]] bool hidesNames(int directory);

} // namespace zor::platform
