// SPDX-License-Identifier: Apache-2.0
// Data-protection classes as decimal numbers in an extended attribute. Nothing is encrypted by it: what the class means
// is the business of whoever encrypts; the daemon keeps the record and the rule of what a lock takes away.
//
// While the device is locked, a set is refused where the class of the file, before or after, is one whose keys are away
// (1 and 2). Any thread.
#pragma once

#include "platform/Device.h"
#include "platform/Disk.h"
#include "platform/Errno.h"

#include <atomic>
#include <optional>

namespace zor::platform {

class XattrProtectionClass final : public FileProtectionClass {
public:
    /// Looks once whether this process may set attributes that clients cannot: else the attribute is one that a file's
    /// owner can forge.
    XattrProtectionClass(Disk& disk, const DeviceLockState& lockState);

    /// The class that an attribute of an open file says; nullopt when it has none (or its file system has none at all).
    /// A value that is no class of ours reads as the default.
    [[nodiscard]] static ErrnoOr<std::optional<int>> classIn(int fd, const char* attribute);

    [[nodiscard]] ErrnoOr<int> classOf(int fd) const override;
    /// EINVAL for a negative class.
    Errno setClass(int fd, int protectionClass) override;
    [[nodiscard]] bool supported() const override { return supported_.load(std::memory_order_relaxed); }
    [[nodiscard]] const char* attributeName() const { return attribute_; }

private:
    const char* const attribute_;
    Disk& disk_;
    const DeviceLockState& lockState_;
    std::atomic<bool> supported_{true};
};

} // namespace zor::platform
