// SPDX-License-Identifier: Apache-2.0
// Keeps a second daemon off the same root: run/zorvane/zorvaned.lock, locked for the life of the process. The kernel
// gives it up when the process ends, however it ends.
#pragma once

#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"

#include <expected>

namespace zor::platform {

class DaemonLock {
public:
    /// EWOULDBLOCK when another daemon holds it, else an errno.
    [[nodiscard]] static std::expected<DaemonLock, int> take(const SystemRoot& root);

    /// Whether a daemon holds it, as far as this process can see. Does not try the lock: whoever tries it could keep a
    /// daemon from starting.
    [[nodiscard]] static bool isHeld(const SystemRoot& root);

private:
    explicit DaemonLock(FileDescriptor file) : file_(std::move(file)) {}
    FileDescriptor file_;
};

} // namespace zor::platform
