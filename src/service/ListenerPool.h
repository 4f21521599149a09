// SPDX-License-Identifier: Apache-2.0
// The threads that serve clients: an elastic pool around one epoll that tells each event once. The thread that takes an
// event does all of its work itself.
//
// Terms: a worker is *waiting* in epoll_wait, *working* on an event, *blocked* inside one (it said so with a
// BlockingScope, or the watcher found out), or *parked* because enough others run. Waiting and working ones are
// *active*.
//
// Invariants:
//   - active workers are as many as may run at once (`running_`), except for moments in which one has ended its wait
//     and has not parked yet;
//   - whenever fewer are active than may run, at least one is waiting, or the pool has threadsMax threads: so work that
//     arrives is always seen by somebody. A thread that makes "nobody waits" or "fewer are active" true looks at the
//     other and adds a worker; both counters are sequentially consistent, so one of two that meet sees it;
//   - an event wakes one worker, and whoever leaves tasks waiting for their turn (ListenerShares.h) wakes one that has
//     nothing to do. A task may be called for an event that is out of date, or while another worker has it: it has to
//     tell that itself.
// The watcher is a thread that ticks while nobody waits, and until no receive is under way, and else sleeps without a
// timeout; an idle pool costs nothing. Handlers that only compute never make the pool grow: the watcher looks at the
// state of their threads.
#pragma once

#include "base/Mutex.h"
#include "os/FileDescriptor.h"
#include "service/ListenerShares.h"
#include "service/PassedAlong.h"

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <span>
#include <sys/epoll.h>
#include <sys/types.h>
#include <thread>
#include <vector>

namespace zor::platform {

/// Memory of one worker that its tasks may use while they run.
struct ListenerScratch {
    std::unique_ptr<std::uint8_t[]> bytes = std::make_unique_for_overwrite<std::uint8_t[]>(listenerScratchBytes);
    /// Requests that this worker has served. Written by it alone.
    std::atomic<std::uint64_t> messages{0};
    /// Set around each receive, so that nothing a peer passed along holds the worker there.
    ReceivingMark receiving;
};

class ListenerPool {
public:
    explicit ListenerPool(const ListenerLimits& limits);
    ~ListenerPool();
    ListenerPool(const ListenerPool&) = delete;
    ListenerPool& operator=(const ListenerPool&) = delete;

    /// False when the system gives no epoll descriptor, or not a single thread.
    [[nodiscard]] bool start();
    /// Lets running tasks end, then joins all threads. Events that nobody took are lost. Not from a task.
    void stop();

    // Descriptors. `events` are those of epoll, with EPOLLET or EPOLLONESHOT among them. After a change the kernel
    // tells again what is there. Any thread, while the pool lives.
    [[nodiscard]] bool add(int fd, ListenerTask& task, std::uint32_t events);
    [[nodiscard]] bool change(int fd, ListenerTask& task, std::uint32_t events);
    void remove(int fd);

    /// Has the task called again, in the turn of its line. From a task.
    void requeue(ListenerTask& task);
    /// Whether somebody else than this line waits for a turn, as far as is known. From a task.
    [[nodiscard]] bool othersWait(const ListenerLine& line) const { return turns_.othersWait(line); }
    /// Runs `job` on the watcher's thread after the delay. At most one is pending; a second call replaces it.
    void callLater(std::chrono::milliseconds delay, std::function<void()> job);

    struct Counters {
        unsigned threads = 0;
        unsigned threadsBlocked = 0;
        unsigned threadsParked = 0;
        unsigned threadsMost = 0;
        std::uint64_t messages = 0;
    };
    [[nodiscard]] Counters counters() const;

private:
    using Clock = std::chrono::steady_clock;

    enum class Phase : std::uint64_t { waiting, working, blocked };

    struct Worker final : BlockingObserver {
        explicit Worker(ListenerPool& owner) : pool(owner) {}
        void willBlock(Load load) noexcept override;
        void didBlock() noexcept override;

        ListenerPool& pool;
        std::thread thread;
        std::atomic<pid_t> threadId{0};
        /// The number of tasks begun, times four, plus the phase: so "the same task still" is one comparison.
        std::atomic<std::uint64_t> state{0};
        // The watcher's view at its last tick.
        std::uint64_t stateSeen = 0;
        std::chrono::nanoseconds cpuTimeSeen{0};
        unsigned blockingDepth = 0;
        /// Whether it runs before others, and until its task ends behind them.
        bool isRaised = false;
        bool hasGivenWay = false;
        ListenerScratch scratch;
    };
    using Turn = ListenerTurns::Turn;

    void work(Worker& worker);
    void runTask(Worker& worker, const Turn& turn);
    /// No task when the pool stops or there was nothing after all.
    Turn nextTurn();
    /// The task of an event that came alone, while none waited; no task when there is none, or its line is at its
    /// share.
    Turn turnOf(const epoll_event& event) const;
    /// Lets what has come wait, and takes the next one.
    Turn turnAfter(std::span<const epoll_event> events);
    /// After a change of what waits: there is a worker for it that looks.
    void offerTurns();
    /// False: this thread was not needed for a while, is no worker any more, and has to return.
    bool parkWhileEnoughRun(Worker& worker);
    /// Makes one more worker active, if fewer are than may run.
    void addWorker();
    bool addWorkerLocked() ZOR_REQUIRES(mutex_);
    /// False when the system gives no thread, or no memory for one.
    bool startThread() ZOR_REQUIRES(mutex_);
    [[nodiscard]] bool canGrow() const ZOR_REQUIRES(mutex_);
    void joinEnded() ZOR_REQUIRES(mutex_);
    void wakeWaiting();

    void nobodyWaits();
    void watch();
    void tick() ZOR_REQUIRES(mutex_);
    void makeUpForStuckWorkers() ZOR_REQUIRES(mutex_);
    /// Has workers go on that are held in a receive since the last look; whether any is in one now.
    bool interruptReceivers() ZOR_REQUIRES(mutex_);
    bool workIsReady() const;
    /// Whether the worker has been in one task since the last tick, has computed next to nothing there, and is not
    /// about to.
    bool isStuck(Worker& worker) const;

    const unsigned running_;
    const unsigned threadsMax_;
    const std::chrono::milliseconds threadIdle_;
    const std::chrono::milliseconds tick_;

    FileDescriptor epoll_;
    /// Wakes one waiting worker for each write.
    FileDescriptor wake_;
    std::atomic<bool> stopping_{false};
    std::atomic<unsigned> waiting_{0};
    std::atomic<unsigned> active_{0};
    /// Whether the watcher ticks. Only its own look at `waiting_` ends that.
    std::atomic<bool> watching_{false};

    mutable Mutex mutex_;
    /// Changed under the mutex.
    ListenerTurns turns_;
    /// No worker comes or goes once the pool is stopping.
    std::vector<std::unique_ptr<Worker>> workers_ ZOR_GUARDED_BY(mutex_);
    std::vector<std::unique_ptr<Worker>> ended_ ZOR_GUARDED_BY(mutex_);
    unsigned parked_ ZOR_GUARDED_BY(mutex_) = 0;
    /// Parked workers that were called back and have not woken yet.
    unsigned called_ ZOR_GUARDED_BY(mutex_) = 0;
    bool workersJoined_ ZOR_GUARDED_BY(mutex_) = false;
    unsigned threadsMost_ ZOR_GUARDED_BY(mutex_) = 0;
    std::uint64_t messagesOfEnded_ ZOR_GUARDED_BY(mutex_) = 0;
    std::function<void()> laterJob_ ZOR_GUARDED_BY(mutex_);
    Clock::time_point laterAt_ ZOR_GUARDED_BY(mutex_);
    ConditionVariable parkedWake_;
    ConditionVariable watcherWake_;
    std::thread watcher_;
};

} // namespace zor::platform
