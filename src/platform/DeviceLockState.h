// SPDX-License-Identifier: Apache-2.0
// Whether the device is locked.
#pragma once

#include "platform/RunLoop.h"

#include <functional>

namespace zor::platform {

class DeviceLockState {
public:
    virtual ~DeviceLockState() = default;
    static constexpr int unlocked = 0;
    static constexpr int locked = 1;
    /// One of these, or another number for another condition. Any thread.
    [[nodiscard]] virtual int currentState() const = 0;
    /// Calls `changed` on the loop whenever the state may have changed. 0, else a status to log: changes are then found
    /// a moment late, until it can be done as it should.
    virtual int registerForChanges(RunLoop& loop, std::function<void()> changed) = 0;
    /// What the two log lines of a failed registration name.
    [[nodiscard]] virtual const char* registrationCallName() const = 0;
    [[nodiscard]] virtual const char* notificationName() const = 0;
};

} // namespace zor::platform
