// SPDX-License-Identifier: Apache-2.0
// The status of an item, out of what the kernel remembers of it: a file system that is not here, or that a user made,
// is not asked, and so cannot make anybody wait. Any thread.
#pragma once

#include "platform/Errno.h"

#include <cstdint>
#include <sys/stat.h>

namespace zor::fs {

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
