// SPDX-License-Identifier: Apache-2.0
// The main thread's loop: descriptors that become readable, and jobs posted from other threads, one after the other.
#pragma once

#include <functional>

namespace zor::platform {

class RunLoop {
public:
    virtual ~RunLoop() = default;
    /// Calls `ready` on the loop's thread whenever `fd` is readable. The caller keeps `fd` open. False on failure.
    virtual bool watch(int fd, std::function<void()> ready) = 0;
    virtual void unwatch(int fd) = 0;
    /// Runs `job` on the loop's thread. Any thread.
    virtual void post(std::function<void()> job) = 0;
    /// Runs until stop; to be called by the thread that owns the loop.
    virtual void run() = 0;
    /// Any thread.
    virtual void stop() = 0;
};

} // namespace zor::platform
