// SPDX-License-Identifier: Apache-2.0
// The main thread's loop, over epoll: descriptors that become readable, jobs posted from other threads, and timers, one
// after the other.
//
// watch, unwatch and post may be called from any thread, and from what the loop calls. After an unwatch on the loop's
// thread its callback is not called again; an unwatch from elsewhere does not wait for a callback that is running. A
// stop that comes before run makes run return at once.
#pragma once

#include "base/Mutex.h"
#include "os/FileDescriptor.h"

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <initializer_list>
#include <map>
#include <memory>
#include <optional>
#include <utility>
#include <vector>

namespace zor::platform {

class RunLoop {
public:
    /// Throws std::system_error when the system gives no descriptors.
    RunLoop();

    /// Calls `ready` on the loop's thread whenever `fd` is readable. The caller keeps `fd` open. False on failure.
    bool watch(int fd, std::function<void()> ready);
    void unwatch(int fd);
    /// Runs `job` on the loop's thread. Any thread.
    void post(std::function<void()> job);

    // Timers, as LoopTimer uses them. Any thread.
    unsigned addTimer(std::function<void()> job);
    /// A removal on the loop's thread is certain to be the end of its calls.
    void removeTimer(unsigned timer);
    /// Needs no memory and no descriptor.
    void setTimer(unsigned timer, std::chrono::milliseconds delay);

    /// Runs until stop; to be called by the thread that owns the loop.
    void run();
    /// Any thread.
    void stop();

private:
    struct Watch {
        int fd = -1;
        std::shared_ptr<std::function<void()>> ready;
    };
    struct Timer {
        std::shared_ptr<std::function<void()>> job;
        std::optional<std::chrono::steady_clock::time_point> due;
    };
    void wake();
    /// For epoll_wait: until the next timer is due, rounded up; -1 when none is set.
    [[nodiscard]] int millisecondsToNextTimer();
    void runDueTimers();
    void drainWake();
    void runPosted();
    [[nodiscard]] std::shared_ptr<std::function<void()>> callbackOf(std::uint64_t serial);

    FileDescriptor epoll_;
    FileDescriptor wake_;
    std::atomic<bool> stop_{false};
    Mutex mutex_;
    /// By serial number, not by descriptor: an event of a descriptor that was closed and given out again is nobody's.
    std::map<std::uint64_t, Watch> watches_ ZOR_GUARDED_BY(mutex_);
    std::uint64_t lastSerial_ ZOR_GUARDED_BY(mutex_) = 0;
    /// A few, by number.
    std::map<unsigned, Timer> timers_ ZOR_GUARDED_BY(mutex_);
    unsigned lastTimer_ ZOR_GUARDED_BY(mutex_) = 0;
    std::vector<std::function<void()>> posted_ ZOR_GUARDED_BY(mutex_);
};

/// Has a job done on the loop's thread a while later. The loop outlives the timer. The timer is destroyed on the loop's
/// thread, or while the loop does not run.
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

// Signals as something to read: blocks them in the calling thread, so in every thread started after, and hands them out
// through a descriptor that a run loop can watch. To be made by main before any thread. Never unblocked.

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
