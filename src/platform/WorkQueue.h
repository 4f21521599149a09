// SPDX-License-Identifier: Apache-2.0
// A serial queue with one thread of its own.
#pragma once

#include <functional>
#include <string>

namespace zor::platform {

class WorkQueue {
public:
    enum class Priority { normal, background };
    virtual ~WorkQueue() = default;
    /// Gives the queue its thread; jobs that came before wait for it. False when the system has none.
    [[nodiscard]] virtual bool start() = 0;
    /// Runs `job` on the queue's thread after everything queued before it. Any thread, never blocks. Throws
    /// std::bad_alloc alone, and has queued nothing then.
    virtual void async(std::function<void()> job) = 0;
    /// After this returns, no further job begins until resume; a running one goes on. Calls pair, and do not nest.
    virtual void suspend() = 0;
    virtual void resume() = 0;
};

} // namespace zor::platform
