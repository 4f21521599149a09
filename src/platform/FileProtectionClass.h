// SPDX-License-Identifier: Apache-2.0
// Data-protection class of an open file or directory.
#pragma once

#include <cerrno>
#include <expected>

namespace zor::platform {

/// The class that a file without a recorded one has.
inline constexpr int defaultProtectionClass = 3;

/// An errno of the kernel's for who takes EPERM for a locked device: an immutable file, a listener that forbids an
/// open, are none.
[[nodiscard]] constexpr int neverLocked(int error) {
    return error == EPERM ? EACCES : error;
}

class FileProtectionClass {
public:
    virtual ~FileProtectionClass() = default;
    /// The class, or an errno. `fd` is a real descriptor (not O_PATH) of a regular file or a directory.
    [[nodiscard]] virtual std::expected<int, int> classOf(int fd) const = 0;
    /// 0 or an errno. EPERM means that the device is locked, and nothing else: the kernel's own EPERM becomes EACCES.
    virtual int setClass(int fd, int protectionClass) = 0;
    /// False once a set has met a file system without extended attributes.
    [[nodiscard]] virtual bool supported() const = 0;
};

} // namespace zor::platform
