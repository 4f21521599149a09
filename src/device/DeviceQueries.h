// SPDX-License-Identifier: Apache-2.0
// The device's answers about itself: which build it runs, and whether the daemon has been started in this boot.
#pragma once

#include "os/SystemRoot.h"
#include "platform/Device.h"
#include "platform/Errno.h"

namespace zor::platform {

// The build that the device runs, from files below DIR/etc. Read anew each time; any thread.

/// Whether etc/zorvane/internal-build exists.
class LinuxInternalBuildQuery final : public InternalBuildQuery {
public:
    explicit LinuxInternalBuildQuery(const SystemRoot& root) : root_(root) {}
    [[nodiscard]] bool isInternalBuild() const override;

private:
    const SystemRoot& root_;
};

/// BUILD_ID of etc/os-release, else its VERSION_ID.
class LinuxSystemVersionQuery final : public SystemVersionQuery {
public:
    explicit LinuxSystemVersionQuery(const SystemRoot& root) : root_(root) {}
    [[nodiscard]] std::string buildVersion() const override;

private:
    const SystemRoot& root_;
};

/// The value of `key` in text of the form of os-release: shell assignments, one a line, values perhaps quoted. The last
/// of several counts; empty when there is none.
[[nodiscard]] std::string valueInRelease(std::string_view text, std::string_view key);

// The boot marker as a POSIX semaphore: it lies on a memory file system, so it ends with the boot.
//
// The directory of semaphores is open to every user, so the name alone proves nothing: only a semaphore that the
// daemon's user owns, with the mode that the daemon gives it and no second name, counts. And any user can fill that
// file system, or keep the name taken. So a file in the daemon's runtime directory, where nobody else writes, marks the
// boot too; either counts. It may lie on a disk, so it holds the kernel's name of the boot and ends with that.
//
// A stop while the marks are made leaves one, or a file that names no boot: it counts as absent. Any thread.

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
