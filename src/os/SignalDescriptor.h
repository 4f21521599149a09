// SPDX-License-Identifier: Apache-2.0
// Signals as something to read: blocks them in the calling thread, so in every thread started after, and hands them out
// through a descriptor that a run loop can watch. To be made by main before any thread. Never unblocked.
#pragma once

#include "os/FileDescriptor.h"

#include <initializer_list>
#include <optional>

namespace zor::platform {

class SignalDescriptor {
public:
    explicit SignalDescriptor(std::initializer_list<int> signals);
    /// -1 when the system gave none.
    [[nodiscard]] int get() const { return descriptor_.get(); }
    /// The next pending signal; nothing when there is none.
    [[nodiscard]] std::optional<int> take();

private:
    FileDescriptor descriptor_;
};

} // namespace zor::platform
