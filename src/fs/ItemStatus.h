// SPDX-License-Identifier: Apache-2.0
// The kernel's word about items: the entries of an open directory, and the status of one.
#pragma once

#include "platform/Errno.h"

#include <array>
#include <cstddef>
#include <cstdint>
#include <span>
#include <sys/stat.h>
#include <sys/types.h>

namespace zor::fs {

// The entries of an open directory, as many at a time as fit a caller's buffer (getdents64).
//
// "." and ".." are left out. A directory that was removed meanwhile has no entries; that is no error. Entries that
// others add or remove while it is read may be seen or not; every other entry is seen exactly once. The descriptor and
// the buffer belong to the caller and have to outlive the reader. One thread at a time.

class BulkDirectoryRead {
public:
    static constexpr std::size_t bufferBytes = 32768;
    using Buffer = std::array<std::byte, bufferBytes>;

    struct Entry {
        /// NUL-terminated, one component; valid until the call of next() after the one that gave it.
        const char* name = nullptr;
        std::size_t nameBytes = 0;
        ino_t inode = 0;
        /// A DT_ value of <dirent.h>; DT_UNKNOWN where the file system does not say.
        unsigned char type = 0;
    };

    /// Reads on from the descriptor's offset. The buffer holds at least one entry of any name: 512 bytes or more.
    BulkDirectoryRead(int directory, std::span<std::byte> buffer);

    /// The next entry, or nullptr at the end and after an error.
    const Entry* next();
    /// The error of the read that ended the entries.
    [[nodiscard]] Errno error() const { return error_; }
    /// The place at which the entry after the last one given begins. Good for seek(), on this or another descriptor of
    /// the same directory.
    [[nodiscard]] off_t position() const { return position_; }
    /// Goes on at a position; 0 is the beginning.
    Errno seek(off_t position);

private:
    bool fill();

    int directory_;
    std::span<std::byte> buffer_;
    std::size_t filled_ = 0;
    std::size_t used_ = 0;
    off_t position_ = 0;
    Errno error_;
    Entry entry_;
};

// The status of an item, out of what the kernel remembers of it: a file system that is not here, or that a user made,
// is not asked, and so cannot make anybody wait. Any thread.

/// lstat of one name in an open directory. EXDEV where another file system, or another part of this one,
/// is mounted on the name; `status` is then that of its root, as far as it is remembered (the type is).
Errno statusOfName(int directory, const char* name, struct stat& status);

/// Which mount something lies on. Kernels before 6.8 give the number of a mount that is gone to another one, seldom
/// together with the number of its device.
struct MountIdentity {
    std::uint64_t mount = 0;
    dev_t device = 0;
    bool operator==(const MountIdentity&) const = default;
};
/// fstat of an open descriptor (O_PATH too), and its mount.
Errno statusOfDescriptor(int descriptor, struct stat& status, MountIdentity& mount);
/// The number of the mount in /proc/self/mountinfo; 0 when it cannot be had.
[[nodiscard]] std::uint64_t mountNumber(int descriptor);

// A directory that was made where others may write: they can put another in its place before it is opened.

/// Whether the open directory can be the one that this process just made: its own, closed to others, and empty.
[[nodiscard]] bool isFreshDirectory(int directory);

} // namespace zor::fs
