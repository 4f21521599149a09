// SPDX-License-Identifier: Apache-2.0
// A serial queue with one thread. The thread of a queue of background priority has less of the processors than others
// (nice 5), and of the disk only what nobody else wants.
//
// Destroying a queue waits for the running job and for all that are queued, including those that they queue; of a
// queue that is suspended, or was never started, the queued jobs are dropped (destroyed without having run). No other
// thread may use it then.
#pragma once

#include "base/Mutex.h"
#include "platform/Process.h"

#include <deque>
#include <string>
#include <thread>

namespace zor::platform {

class SerialWorkQueue final : public WorkQueue {
public:
    /// The thread is named after the last part of the label.
    explicit SerialWorkQueue(std::string label, Priority priority = Priority::normal);
    ~SerialWorkQueue() override;
    SerialWorkQueue(const SerialWorkQueue&) = delete;
    SerialWorkQueue& operator=(const SerialWorkQueue&) = delete;

    /// False when the system gives no thread. Once more does nothing.
    [[nodiscard]] bool start() override;
    void async(std::function<void()> job) override;
    // After a finish has begun neither has any effect.
    void suspend() override;
    void resume() override;
    /// Ends the queue as its destruction does, before the objects go that its jobs act on. Not from a job.
    void finish();

private:
    void work();
    /// The next job; empty when the queue ends.
    [[nodiscard]] std::function<void()> next();

    const std::string label_;
    const Priority priority_;
    Mutex mutex_;
    ConditionVariable changed_;
    std::deque<std::function<void()>> jobs_ ZOR_GUARDED_BY(mutex_);
    bool suspended_ ZOR_GUARDED_BY(mutex_) = false;
    bool ending_ ZOR_GUARDED_BY(mutex_) = false;
    bool finished_ ZOR_GUARDED_BY(mutex_) = false;
    std::thread thread_ ZOR_GUARDED_BY(mutex_);
};

} // namespace zor::platform
