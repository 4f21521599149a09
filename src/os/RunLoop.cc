// SPDX-License-Identifier: Apache-2.0
#include "os/RunLoop.h"

#include "platform/Errno.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>
#include <limits>
#include <pthread.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/signalfd.h>
#include <system_error>
#include <unistd.h>

namespace zor::platform {

namespace {

constexpr std::uint64_t wakeSerial = 0;

int checkedDescriptor(int fd, const char* what) {
    if (fd < 0)
        throw std::system_error(errno, std::generic_category(), what);
    return fd;
}

} // namespace

RunLoop::RunLoop()
    : epoll_(checkedDescriptor(::epoll_create1(EPOLL_CLOEXEC), "epoll_create1")),
      wake_(checkedDescriptor(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK), "eventfd")) {
    epoll_event event{};
    event.events = EPOLLIN;
    event.data.u64 = wakeSerial;
    checkedDescriptor(::epoll_ctl(epoll_.get(), EPOLL_CTL_ADD, wake_.get(), &event), "epoll_ctl");
}

bool RunLoop::watch(int fd, std::function<void()> ready) {
    ZOR_ASSERT(ready);
    const MutexLock lock(mutex_);
    epoll_event event{};
    event.events = EPOLLIN;
    event.data.u64 = ++lastSerial_;
    if (::epoll_ctl(epoll_.get(), EPOLL_CTL_ADD, fd, &event) != 0)
        return false;
    watches_[lastSerial_] = {.fd = fd, .ready = std::make_shared<std::function<void()>>(std::move(ready))};
    return true;
}

void RunLoop::unwatch(int fd) {
    // An object that a callback holds may unwatch in its turn when it goes: it goes after the lock.
    std::shared_ptr<std::function<void()>> gone;
    const MutexLock lock(mutex_);
    for (auto it = watches_.begin(); it != watches_.end(); ++it) {
        if (it->second.fd != fd)
            continue;
        gone = std::move(it->second.ready);
        watches_.erase(it);
        (void)::epoll_ctl(epoll_.get(), EPOLL_CTL_DEL, fd, nullptr);
        return;
    }
}

void RunLoop::post(std::function<void()> job) {
    ZOR_ASSERT(job);
    {
        const MutexLock lock(mutex_);
        posted_.push_back(std::move(job));
    }
    wake();
}

unsigned RunLoop::addTimer(std::function<void()> job) {
    ZOR_ASSERT(job);
    auto shared = std::make_shared<std::function<void()>>(std::move(job));
    const MutexLock lock(mutex_);
    timers_[++lastTimer_] = {.job = std::move(shared), .due = {}};
    return lastTimer_;
}

void RunLoop::removeTimer(unsigned timer) {
    // As with a watch: what the job holds goes after the lock.
    std::shared_ptr<std::function<void()>> gone;
    const MutexLock lock(mutex_);
    if (const auto found = timers_.find(timer); found != timers_.end()) {
        gone = std::move(found->second.job);
        timers_.erase(found);
    }
}

void RunLoop::setTimer(unsigned timer, std::chrono::milliseconds delay) {
    ZOR_ASSERT(delay.count() >= 0);
    const auto due = std::chrono::steady_clock::now() + delay;
    {
        const MutexLock lock(mutex_);
        const auto found = timers_.find(timer);
        if (found == timers_.end() || (found->second.due && *found->second.due <= due))
            return;
        found->second.due = due;
    }
    wake();
}

int RunLoop::millisecondsToNextTimer() {
    std::optional<std::chrono::steady_clock::time_point> next;
    {
        const MutexLock lock(mutex_);
        for (const auto& [number, timer] : timers_)
            next = !next || (timer.due && *timer.due < *next) ? timer.due : next;
    }
    if (!next)
        return -1;
    const auto left = std::chrono::ceil<std::chrono::milliseconds>(*next - std::chrono::steady_clock::now()).count();
    return static_cast<int>(std::clamp<std::int64_t>(left, 0, std::numeric_limits<int>::max()));
}

void RunLoop::runDueTimers() {
    const auto now = std::chrono::steady_clock::now();
    for (;;) {
        std::shared_ptr<std::function<void()>> job;
        {
            const MutexLock lock(mutex_);
            const auto found = std::ranges::find_if(
                timers_, [&](const auto& entry) { return entry.second.due && *entry.second.due <= now; });
            if (found == timers_.end())
                return;
            found->second.due.reset();
            job = found->second.job;
        }
        (*job)();
    }
}

void RunLoop::stop() {
    stop_.store(true, std::memory_order_release);
    wake();
}

void RunLoop::run() {
    constexpr int eventsMax = 32;
    std::array<epoll_event, eventsMax> events{};
    while (!stop_.exchange(false, std::memory_order_acq_rel)) {
        const int count = ::epoll_wait(epoll_.get(), events.data(), eventsMax, millisecondsToNextTimer());
        if (count < 0 && errno != EINTR)
            throw std::system_error(errno, std::generic_category(), "epoll_wait");
        for (int i = 0; i < count; ++i) {
            const std::uint64_t serial = events[static_cast<std::size_t>(i)].data.u64;
            if (serial == wakeSerial)
                drainWake();
            else if (const auto ready = callbackOf(serial))
                (*ready)();
        }
        runDueTimers();
        runPosted();
    }
}

std::shared_ptr<std::function<void()>> RunLoop::callbackOf(std::uint64_t serial) {
    const MutexLock lock(mutex_);
    const auto found = watches_.find(serial);
    return found == watches_.end() ? nullptr : found->second.ready;
}

void RunLoop::runPosted() {
    std::vector<std::function<void()>> jobs;
    {
        const MutexLock lock(mutex_);
        jobs.swap(posted_);
    }
    for (std::function<void()>& job : jobs) {
        job();
        job = nullptr;
    }
}

void RunLoop::wake() {
    const std::uint64_t one = 1;
    // It fails only when the count is full, and then the loop wakes anyway.
    (void)!::write(wake_.get(), &one, sizeof one);
}

void RunLoop::drainWake() {
    std::uint64_t count = 0;
    (void)!::read(wake_.get(), &count, sizeof count);
}

SignalDescriptor::SignalDescriptor(std::initializer_list<int> signals) {
    sigset_t set;
    ::sigemptyset(&set);
    for (const int signal : signals)
        ::sigaddset(&set, signal);
    if (::pthread_sigmask(SIG_BLOCK, &set, nullptr) == 0)
        descriptor_.reset(::signalfd(-1, &set, SFD_CLOEXEC | SFD_NONBLOCK));
}

std::optional<int> SignalDescriptor::take() {
    signalfd_siginfo info{};
    ssize_t bytes = 0;
    do {
        bytes = ::read(descriptor_.get(), &info, sizeof info);
    } while (bytes < 0 && errno == EINTR);
    if (bytes != sizeof info)
        return std::nullopt;
    return static_cast<int>(info.ssi_signo);
}

} // namespace zor::platform
