// SPDX-License-Identifier: Apache-2.0
// The main thread's loop over epoll.
//
// watch, unwatch and post may be called from any thread, and from what the loop calls. After an unwatch on the loop's
// thread its callback is not called again; an unwatch from elsewhere does not wait for a callback that is running. A
// stop that comes before run makes run return at once.
#pragma once

#include "base/Mutex.h"
#include "os/FileDescriptor.h"
#include "platform/RunLoop.h"

#include <atomic>
#include <chrono>
#include <cstdint>
#include <initializer_list>
#include <map>
#include <memory>
#include <optional>
#include <vector>

namespace zor::platform {

class EpollRunLoop final : public RunLoop {
public:
    /// Throws std::system_error when the system gives no descriptors.
    EpollRunLoop();

    bool watch(int fd, std::function<void()> ready) override;
    void unwatch(int fd) override;
    void post(std::function<void()> job) override;
    unsigned addTimer(std::function<void()> job) override;
    void removeTimer(unsigned timer) override;
    void setTimer(unsigned timer, std::chrono::milliseconds delay) override;
    void run() override;
    void stop() override;

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
