// SPDX-License-Identifier: Apache-2.0
// The main thread's loop: descriptors that become readable, jobs posted from other threads, and timers, one after the
// other.
#pragma once

#include <chrono>
#include <functional>
#include <utility>

namespace zor::platform {

class RunLoop {
public:
    virtual ~RunLoop() = default;
    /// Calls `ready` on the loop's thread whenever `fd` is readable. The caller keeps `fd` open. False on failure.
    virtual bool watch(int fd, std::function<void()> ready) = 0;
    virtual void unwatch(int fd) = 0;
    /// Runs `job` on the loop's thread. Any thread.
    virtual void post(std::function<void()> job) = 0;

    // Timers, as LoopTimer uses them. Any thread.
    virtual unsigned addTimer(std::function<void()> job) = 0;
    /// A removal on the loop's thread is certain to be the end of its calls.
    virtual void removeTimer(unsigned timer) = 0;
    /// Needs no memory and no descriptor.
    virtual void setTimer(unsigned timer, std::chrono::milliseconds delay) = 0;

    /// Runs until stop; to be called by the thread that owns the loop.
    virtual void run() = 0;
    /// Any thread.
    virtual void stop() = 0;
};

/// Has a job done on the loop's thread a while later. The loop outlives it, and does not run when it goes, unless it
/// goes on the loop's thread.
class LoopTimer {
public:
    LoopTimer(RunLoop& loop, std::function<void()> job) : loop_(loop), timer_(loop.addTimer(std::move(job))) {}
    ~LoopTimer() { loop_.removeTimer(timer_); }
    LoopTimer(const LoopTimer&) = delete;
    LoopTimer& operator=(const LoopTimer&) = delete;

    /// The job is due after the delay, once; at the earlier moment when it was due already. It cannot fail. Any thread.
    void set(std::chrono::milliseconds delay) const { loop_.setTimer(timer_, delay); }

private:
    RunLoop& loop_;
    const unsigned timer_;
};

} // namespace zor::platform
