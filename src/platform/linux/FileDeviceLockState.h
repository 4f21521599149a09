// SPDX-License-Identifier: Apache-2.0
// The lock state as the number in run/zorvane/lockstate, which whoever manages the lock replaces by rename.
//
// No file is 0, unlocked. A file that holds no number is -1: neither locked nor unlocked, so nothing that waits for an
// unlock starts, and nothing begins to wait for one that may never be said. Any thread.
#pragma once

#include "platform/DeviceLockState.h"
#include "platform/FileDescriptor.h"
#include "platform/linux/SystemRoot.h"

namespace zor::platform {

class FileDeviceLockState final : public DeviceLockState {
public:
    static constexpr int unknown = -1;

    explicit FileDeviceLockState(const SystemRoot& root) : root_(root) {}
    [[nodiscard]] int currentState() const override;
    /// Once. The loop has to end, or be told to unwatch, before this object goes.
    int registerForChanges(RunLoop& loop, std::function<void()> changed) override;
    [[nodiscard]] const char* registrationCallName() const override { return "inotify_add_watch"; }
    [[nodiscard]] const char* notificationName() const override;

private:
    [[nodiscard]] bool takeEvents() const;

    const SystemRoot& root_;
    FileDescriptor inotify_;
};

} // namespace zor::platform
