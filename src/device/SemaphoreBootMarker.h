// SPDX-License-Identifier: Apache-2.0
// The boot marker as a POSIX semaphore: it lies on a memory file system, so it ends with the boot.
//
// The directory of semaphores is open to every user, so the name alone proves nothing: only a semaphore that the
// daemon's user owns, with the mode that the daemon gives it and no second name, counts. And any user can fill that
// file system, or keep the name taken. So a file in the daemon's runtime directory, where nobody else writes, marks the
// boot too; either counts. It may lie on a disk, so it holds the kernel's name of the boot and ends with that.
//
// A stop while the marks are made leaves one, or a file that names no boot: it counts as absent. Any thread.
#pragma once

#include "os/SystemRoot.h"
#include "platform/Device.h"
#include "platform/Errno.h"

namespace zor::platform {

class SemaphoreBootMarker final : public BootMarker {
public:
    explicit SemaphoreBootMarker(const SystemRoot& root);
    [[nodiscard]] State look() const override;
    /// Makes both marks; an error only where neither could be. A foreign semaphore of the name is removed first, where
    /// that is allowed.
    Errno make() override;
    void forget() override;
    [[nodiscard]] std::string name() const override { return name_; }

private:
    Errno makeSemaphore(bool foreign) const;
    [[nodiscard]] bool fileNamesThisBoot() const;
    Errno writeFile() const;

    const SystemRoot& root_;
    const std::string name_;
};

} // namespace zor::platform
