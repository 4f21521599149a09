// SPDX-License-Identifier: Apache-2.0
#include "service/ListenerPool.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <ctime>
#include <exception>
#include <fcntl.h>
#include <new>
#include <poll.h>
#include <pthread.h>
#include <string_view>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/resource.h>
#include <unistd.h>
#include <utility>

namespace zor::platform {

namespace {

constexpr std::uint64_t phaseMask = 3;
constexpr std::uint64_t oneTask = 4;
/// The peer waits for the answer, which takes microseconds: a worker that is woken runs at once, and not when the
/// peer that woke it has used up its time. A tenth of a round trip on one processor.
constexpr int workerNice = -5;
/// A worker with a heavy load comes behind those that ask and answer until its task has ended: the kernel may let it
/// finish a long call before it is another's turn.
constexpr int heavyNice = 5;
/// A burst is seen in a few looks; more would be stack that is rarely used.
constexpr std::size_t eventsPerLook = 64;

bool setNiceOfThisThread(int nice) {
    return ::setpriority(PRIO_PROCESS, 0, nice) == 0; // who 0: on Linux this thread alone
}

/// A thread that takes no signals: those belong to the main thread. False when the system gives none, or no memory.
bool startThreadWithoutSignals(std::thread& thread, const char* name, std::function<void()> body) {
    sigset_t all;
    sigset_t before;
    sigfillset(&all);
    pthread_sigmask(SIG_SETMASK, &all, &before);
    bool started = true;
    try {
        thread = std::thread(std::move(body));
        pthread_setname_np(thread.native_handle(), name);
    } catch (const std::exception&) {
        started = false;
    }
    pthread_sigmask(SIG_SETMASK, &before, nullptr);
    return started;
}

/// Whether a thread computes or waits for a processor. One that computes gets little time on a crowded system, but it
/// is no use to add another.
bool isRunnable(pid_t threadId) {
    char path[64];
    std::snprintf(path, sizeof path, "/proc/self/task/%d/stat", static_cast<int>(threadId));
    const FileDescriptor file(::openat(AT_FDCWD, path, O_RDONLY | O_CLOEXEC));
    char text[128];
    const ssize_t size = file.valid() ? ::read(file.get(), text, sizeof text) : -1;
    if (size <= 0)
        return false;
    // "TID (NAME) STATE ...": the name may hold anything, so its end is the last parenthesis.
    const std::string_view line(text, static_cast<std::size_t>(size));
    const std::size_t nameEnd = line.rfind(')');
    return nameEnd != std::string_view::npos && nameEnd + 2 < line.size() && line[nameEnd + 2] == 'R';
}

} // namespace

ListenerPool::ListenerPool(const ListenerLimits& limits)
    : running_(limits.threadsRunning > 0 ? limits.threadsRunning : std::max(2U, std::thread::hardware_concurrency())),
      threadsMax_(std::max(limits.threadsMax, running_)), threadIdle_(limits.threadIdle), tick_(limits.tick) {}

ListenerPool::~ListenerPool() {
    stop();
}

bool ListenerPool::start() {
    epoll_.reset(::epoll_create1(EPOLL_CLOEXEC));
    wake_.reset(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    if (!epoll_.valid() || !wake_.valid())
        return false;
    // Edge-triggered, so that one write wakes one worker and nobody has to read it.
    epoll_event event = {.events = EPOLLIN | EPOLLET, .data = {.ptr = nullptr}};
    if (::epoll_ctl(epoll_.get(), EPOLL_CTL_ADD, wake_.get(), &event) != 0)
        return false;
    if (!startThreadWithoutSignals(watcher_, "listener-watch", [this] { watch(); }))
        return false;
    const MutexLock lock(mutex_);
    // So that keeping a thread that runs, or one that has ended, never fails.
    workers_.reserve(threadsMax_);
    ended_.reserve(threadsMax_);
    while (addWorkerLocked()) {
    }
    return !workers_.empty();
}

void ListenerPool::stop() {
    std::vector<std::thread*> threads;
    {
        const MutexLock lock(mutex_);
        stopping_ = true;
        for (const auto& worker : workers_)
            threads.push_back(&worker->thread);
        joinEnded();
    }
    parkedWake_.broadcast();
    watcherWake_.broadcast();
    if (wake_.valid())
        wakeWaiting();
    for (std::thread* thread : threads)
        thread->join();
    {
        const MutexLock lock(mutex_);
        workersJoined_ = true;
    }
    watcherWake_.broadcast();
    if (watcher_.joinable())
        watcher_.join();
    const MutexLock lock(mutex_);
    for (const auto& worker : workers_)
        messagesOfEnded_ += worker->scratch.messages.load(std::memory_order_relaxed);
    workers_.clear();
    laterJob_ = nullptr;
}

bool ListenerPool::add(int fd, ListenerTask& task, std::uint32_t events) {
    epoll_event event = {.events = events, .data = {.ptr = &task}};
    return ::epoll_ctl(epoll_.get(), EPOLL_CTL_ADD, fd, &event) == 0;
}

bool ListenerPool::change(int fd, ListenerTask& task, std::uint32_t events) {
    epoll_event event = {.events = events, .data = {.ptr = &task}};
    return ::epoll_ctl(epoll_.get(), EPOLL_CTL_MOD, fd, &event) == 0;
}

void ListenerPool::remove(int fd) {
    ::epoll_ctl(epoll_.get(), EPOLL_CTL_DEL, fd, nullptr);
}

void ListenerPool::requeue(ListenerTask& task) {
    {
        const MutexLock lock(mutex_);
        turns_.requeue(task);
    }
    offerTurns();
}

void ListenerPool::offerTurns() {
    if (turns_.count() > 0 && waiting_ > 0)
        wakeWaiting();
}

void ListenerPool::callLater(std::chrono::milliseconds delay, std::function<void()> job) {
    {
        const MutexLock lock(mutex_);
        laterAt_ = Clock::now() + delay;
        laterJob_ = std::move(job);
    }
    watcherWake_.signal();
}

ListenerPool::Counters ListenerPool::counters() const {
    const MutexLock lock(mutex_);
    Counters counters = {.threads = static_cast<unsigned>(workers_.size()),
                         .threadsParked = parked_ - called_,
                         .threadsMost = threadsMost_,
                         .messages = messagesOfEnded_};
    const unsigned active = active_;
    counters.threadsBlocked = counters.threads - std::min(counters.threads, active + counters.threadsParked);
    for (const auto& worker : workers_)
        counters.messages += worker->scratch.messages.load(std::memory_order_relaxed);
    return counters;
}

// Workers.

void ListenerPool::work(Worker& worker) {
    worker.threadId = ::gettid();
    // The pool serves all the same where that is not allowed.
    worker.isRaised = setNiceOfThisThread(workerNice);
    allowInterrupts();
    BlockingObserver::setForThisThread(&worker);
    while (!stopping_) {
        if (active_ > running_ && !parkWhileEnoughRun(worker))
            return;
        const Turn turn = nextTurn();
        if (turn.task)
            runTask(worker, turn);
    }
    // One write wakes one worker: the next one is this one's to wake.
    wakeWaiting();
}

void ListenerPool::runTask(Worker& worker, const Turn& turn) {
    const std::uint64_t task = (worker.state.load(std::memory_order_relaxed) & ~phaseMask) + oneTask;
    worker.state.store(task | static_cast<std::uint64_t>(Phase::working));
    turn.task->run(worker.scratch, turn.events);
    if (std::exchange(worker.hasGivenWay, false))
        worker.isRaised = setNiceOfThisThread(workerNice);
    const std::uint64_t last = worker.state.exchange(task | static_cast<std::uint64_t>(Phase::waiting));
    if (last == (task | static_cast<std::uint64_t>(Phase::blocked)))
        ++active_;
    if (!turn.line->end())
        return;
    {
        const MutexLock lock(mutex_);
        turns_.callBack(*turn.line);
    }
    offerTurns();
}

ListenerPool::Turn ListenerPool::nextTurn() {
    std::array<epoll_event, eventsPerLook> events; // NOLINT(*-member-init): the kernel fills what is looked at
    ++waiting_;
    // Looked at after this worker counts as waiting: either it sees what waits, or who lets it wait wakes this one.
    const bool somebodyWaits = turns_.count() > 0;
    const int count = ::epoll_wait(epoll_.get(), events.data(), events.size(), somebodyWaits ? 0 : -1);
    if (waiting_-- == 1)
        nobodyWaits();
    if (count == 1 && turns_.count() == 0) {
        if (const Turn turn = turnOf(events.front()); turn.task)
            return turn;
    }
    return turnAfter(std::span(events).first(static_cast<std::size_t>(std::max(count, 0))));
}

ListenerPool::Turn ListenerPool::turnOf(const epoll_event& event) const {
    auto* const task = static_cast<ListenerTask*>(event.data.ptr);
    if (!task || stopping_)
        return {};
    ListenerLine& line = task->line();
    return line.begin() ? Turn{.task = task, .events = event.events, .line = &line} : Turn{};
}

ListenerPool::Turn ListenerPool::turnAfter(std::span<const epoll_event> events) {
    if (events.empty() && turns_.count() == 0)
        return {};
    Turn turn;
    {
        const MutexLock lock(mutex_);
        for (const epoll_event& event : events) {
            if (event.data.ptr)
                turns_.add(*static_cast<ListenerTask*>(event.data.ptr), event.events);
        }
        if (stopping_)
            return {};
        // A full look may have left some out, among them one whose turn comes first.
        if (events.size() < eventsPerLook)
            turn = turns_.take();
    }
    offerTurns();
    return turn;
}

bool ListenerPool::parkWhileEnoughRun(Worker& worker) {
    const MutexLock lock(mutex_);
    unsigned active = active_;
    do {
        if (active <= running_ || stopping_)
            return true;
    } while (!active_.compare_exchange_weak(active, active - 1));
    ++parked_;
    const Clock::time_point end = Clock::now() + threadIdle_;
    while (called_ == 0 && !stopping_) {
        const auto left = end - Clock::now();
        if (left > Clock::duration::zero()) {
            parkedWake_.waitFor(mutex_, left);
            continue;
        }
        --parked_;
        messagesOfEnded_ += worker.scratch.messages.load(std::memory_order_relaxed);
        const auto self =
            std::find_if(workers_.begin(), workers_.end(), [&](const auto& other) { return other.get() == &worker; });
        ended_.push_back(std::move(*self));
        workers_.erase(self);
        return false;
    }
    --parked_;
    if (called_ > 0)
        --called_;
    else
        ++active_;
    return true;
}

void ListenerPool::Worker::willBlock(Load load) noexcept {
    if (load == Load::heavy && isRaised && !std::exchange(hasGivenWay, true))
        (void)setNiceOfThisThread(heavyNice);
    if (blockingDepth++ > 0)
        return;
    std::uint64_t seen = state;
    // The watcher may have counted this worker as blocked already.
    if ((seen & phaseMask) == static_cast<std::uint64_t>(Phase::working) &&
        state.compare_exchange_strong(seen, (seen & ~phaseMask) | static_cast<std::uint64_t>(Phase::blocked)))
        --pool.active_;
    if (pool.waiting_ == 0)
        pool.addWorker();
}

void ListenerPool::Worker::didBlock() noexcept {
    if (--blockingDepth > 0)
        return;
    // In this phase nobody else changes the state.
    const std::uint64_t seen = state;
    if ((seen & phaseMask) != static_cast<std::uint64_t>(Phase::blocked))
        return;
    state = (seen & ~phaseMask) | static_cast<std::uint64_t>(Phase::working);
    ++pool.active_;
}

// Growth.

bool ListenerPool::canGrow() const {
    return parked_ > called_ || workers_.size() < threadsMax_;
}

void ListenerPool::addWorker() {
    const MutexLock lock(mutex_);
    addWorkerLocked();
}

bool ListenerPool::addWorkerLocked() {
    if (stopping_ || active_ >= running_)
        return false;
    joinEnded();
    if (parked_ > called_) {
        ++called_;
        ++active_;
        parkedWake_.signal();
        return true;
    }
    return workers_.size() < threadsMax_ && startThread();
}

bool ListenerPool::startThread() {
    std::unique_ptr<Worker> worker;
    try {
        worker = std::make_unique<Worker>(*this);
    } catch (const std::bad_alloc&) {
        return false;
    }
    ++active_;
    Worker* raw = worker.get();
    if (!startThreadWithoutSignals(worker->thread, "listener", [this, raw] { work(*raw); })) {
        --active_;
        return false;
    }
    workers_.push_back(std::move(worker));
    threadsMost_ = std::max(threadsMost_, static_cast<unsigned>(workers_.size()));
    return true;
}

void ListenerPool::joinEnded() {
    // They gave up the mutex with their last step, so this waits for no more than their way out.
    for (const auto& worker : ended_)
        worker->thread.join();
    ended_.clear();
}

void ListenerPool::wakeWaiting() {
    const std::uint64_t one = 1;
    // It fails only when the counter is full, and then there is an event already.
    [[maybe_unused]] const ssize_t written = ::write(wake_.get(), &one, sizeof one);
}

void ListenerPool::nobodyWaits() {
    if (active_ < running_)
        addWorker();
    if (!watching_ && !watching_.exchange(true)) {
        // The watcher looks at the flag under the mutex: it is before that look, or in its wait.
        mutex_.lock();
        mutex_.unlock();
        watcherWake_.signal();
    }
}

// The watcher: finds handlers that wait without having said so, makes up for threads that could not be started, and
// interrupts receives that do not end.

void ListenerPool::watch() {
    const MutexLock lock(mutex_);
    Clock::time_point nextTick = Clock::now();
    bool wasWatching = false;
    while (!stopping_) {
        const bool watching = watching_;
        if (watching && !wasWatching)
            nextTick = Clock::now() + tick_;
        wasWatching = watching;
        if (!watching && !laterJob_) {
            watcherWake_.wait(mutex_);
            continue;
        }
        const Clock::time_point next = !laterJob_ ? nextTick : !watching ? laterAt_ : std::min(nextTick, laterAt_);
        const Clock::time_point now = Clock::now();
        if (next > now) {
            watcherWake_.waitFor(mutex_, next - now);
            continue;
        }
        if (laterJob_ && laterAt_ <= now) {
            const std::function<void()> job = std::exchange(laterJob_, nullptr);
            mutex_.unlock();
            job();
            mutex_.lock();
            continue;
        }
        nextTick = now + tick_;
        tick();
    }
    while (!workersJoined_) {
        (void)interruptReceivers();
        watcherWake_.waitFor(mutex_, tick_);
    }
}

void ListenerPool::tick() {
    // One that is held costs the others a thread, also while some wait.
    const bool somebodyReceives = interruptReceivers();
    if (waiting_ > 0 && !somebodyReceives) {
        watching_ = false;
        // Between the look and the flag the last one may have stopped waiting, and left the flag to this thread.
        if (waiting_ > 0 || watching_.exchange(true))
            return;
    }
    if (waiting_ == 0 && canGrow())
        makeUpForStuckWorkers();
}

bool ListenerPool::interruptReceivers() {
    bool somebodyReceives = false;
    for (const auto& worker : workers_) {
        if (worker->scratch.receiving.hasStayed())
            interruptThread(worker->threadId);
        somebodyReceives = somebodyReceives || worker->scratch.receiving.isSet();
    }
    return somebodyReceives;
}

void ListenerPool::makeUpForStuckWorkers() {
    for (const auto& worker : workers_) {
        if (!isStuck(*worker) || !workIsReady())
            continue;
        std::uint64_t state = worker->stateSeen;
        if (worker->state.compare_exchange_strong(state,
                                                  (state & ~phaseMask) | static_cast<std::uint64_t>(Phase::blocked)))
            --active_;
    }
    while (addWorkerLocked()) {
    }
}

bool ListenerPool::workIsReady() const {
    pollfd epoll = {.fd = epoll_.get(), .events = POLLIN, .revents = 0};
    return turns_.count() > 0 || ::poll(&epoll, 1, 0) > 0;
}

bool ListenerPool::isStuck(Worker& worker) const {
    timespec cpu = {};
    clockid_t clock = 0;
    if (pthread_getcpuclockid(worker.thread.native_handle(), &clock) == 0)
        ::clock_gettime(clock, &cpu);
    const std::chrono::nanoseconds cpuTime = std::chrono::seconds(cpu.tv_sec) + std::chrono::nanoseconds(cpu.tv_nsec);
    const std::chrono::nanoseconds cpuUsed = cpuTime - std::exchange(worker.cpuTimeSeen, cpuTime);
    const std::uint64_t state = worker.state;
    const bool sameTask = state == std::exchange(worker.stateSeen, state);
    return sameTask && (state & phaseMask) == static_cast<std::uint64_t>(Phase::working) && cpuUsed < tick_ / 10 &&
           !isRunnable(worker.threadId);
}

} // namespace zor::platform
