// SPDX-License-Identifier: Apache-2.0
// The boot marker as a POSIX semaphore: it lies on a memory file system, so it ends with the boot.
//
// The directory of semaphores is open to every user, so the name alone proves nothing: only a semaphore that the
// daemon's user owns, with the mode that the daemon gives it and no second name, counts. Any thread.
#pragma once

#include "platform/BootMarker.h"
#include "platform/linux/SystemRoot.h"

namespace zor::platform {

class SemaphoreBootMarker final : public BootMarker {
public:
    explicit SemaphoreBootMarker(const SystemRoot& root);
    [[nodiscard]] State look() const override;
    /// A foreign semaphore of the name is removed first, where that is allowed; else EEXIST.
    int make() override;
    void forget() override;
    [[nodiscard]] std::string name() const override { return name_; }

private:
    const std::string name_;
};

} // namespace zor::platform
