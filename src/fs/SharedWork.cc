// SPDX-License-Identifier: Apache-2.0
#include "fs/SharedWork.h"

#include <algorithm>
#include <climits>
#include <sys/resource.h>
#include <system_error>
#include <unistd.h>
#include <utility>

namespace zor::fs {

using platform::MutexLock;

namespace {

/// Below this many a second thread costs more than it brings.
constexpr std::size_t countForTwoThreads = 256;
/// The number that one thread takes at a time.
constexpr std::size_t stretchCount = 32;
/// A thread that waits for a disk needs no processor. A disk serves about as many requests at once as these make.
constexpr std::size_t threadsForDisk = 16;
/// So many waits within one stretch come from a disk: for things in memory a thread hardly ever waits.
constexpr long waitsOfDisk = stretchCount / 4;

/// The directories that may wait at once.
constexpr std::size_t waitingMax = 65'536;
constexpr std::size_t waitingBytesMax = std::size_t{16} * 1024 * 1024;

/// How often this thread has given the processor away because it had to wait.
long waitsOfThisThread() {
    rusage usage{};
    return ::getrusage(RUSAGE_THREAD, &usage) == 0 ? usage.ru_nvcsw : 0;
}

/// Threads that answer requests run before others. A helper is for large work, and must not keep those back.
void giveUpHigherPriority() {
    const auto thread = static_cast<id_t>(::gettid());
    if (::getpriority(PRIO_PROCESS, thread) < 0)
        (void)::setpriority(PRIO_PROCESS, thread, 0);
}

} // namespace

void Helpers::add(const std::function<void()>& work) {
    const MutexLock held(mutex_);
    if (count_ >= countMax_)
        return;
    try {
        threads_.emplace_back([this, &work] {
            giveUpHigherPriority();
            run(work);
        });
        ++count_;
    } catch (const std::system_error&) {
        count_ = countMax_; // none to be had: nobody asks again
    }
}

void Helpers::run(const std::function<void()>& work) noexcept {
    try {
        work();
    } catch (...) {
        const MutexLock held(mutex_);
        if (!thrown_)
            thrown_ = std::current_exception();
    }
}

void Helpers::join() noexcept {
    for (;;) {
        std::vector<std::thread> ending;
        {
            const MutexLock held(mutex_);
            ending.swap(threads_);
        }
        if (ending.empty())
            return;
        for (std::thread& thread : ending)
            thread.join();
    }
}

void Helpers::finish() {
    join();
    const MutexLock held(mutex_);
    if (thrown_)
        std::rethrow_exception(std::exchange(thrown_, nullptr));
}

void forEachStretch(std::size_t count, const std::function<void(std::size_t begin, std::size_t end)>& work) {
    Helpers helpers(threadsForDisk - 1);
    std::atomic<std::size_t> next{0};
    const std::function<void()> share = [&] {
        long waits = waitsOfThisThread();
        for (std::size_t begin; (begin = next.fetch_add(stretchCount)) < count;) {
            work(begin, std::min(begin + stretchCount, count));
            const long before = std::exchange(waits, waitsOfThisThread());
            if (waits - before >= waitsOfDisk && next + stretchCount < count)
                helpers.add(share);
        }
    };
    if (count >= countForTwoThreads)
        helpers.add(share);
    helpers.run(share);
    helpers.finish();
}

bool DirectoryQueue::add(std::string path) {
    const MutexLock held(mutex_);
    if (path.size() >= PATH_MAX || waiting_.size() >= waitingMax || waitingBytes_ + path.size() > waitingBytesMax)
        return false;
    waitingBytes_ += path.size();
    waiting_.push_back(std::move(path));
    if (idle_ > 0)
        changed_.signal();
    return true;
}

bool DirectoryQueue::hasWork() {
    const MutexLock held(mutex_);
    return !waiting_.empty();
}

void DirectoryQueue::workOff(const std::function<void(const std::string& path)>& work) {
    for (std::string path; take(path);) {
        try {
            work(path);
        } catch (...) {
            stop();
            giveBack();
            throw;
        }
        giveBack();
    }
}

bool DirectoryQueue::take(std::string& path) {
    const MutexLock held(mutex_);
    ++idle_;
    while (!stopped_ && waiting_.empty() && busy_ > 0)
        changed_.wait(mutex_);
    --idle_;
    if (stopped_ || waiting_.empty())
        return false;
    path = std::move(waiting_.front());
    waiting_.pop_front();
    waitingBytes_ -= path.size();
    ++busy_;
    return true;
}

void DirectoryQueue::giveBack() {
    const MutexLock held(mutex_);
    --busy_;
    if (busy_ == 0 && idle_ > 0)
        changed_.broadcast();
}

void DirectoryQueue::stop() {
    const MutexLock held(mutex_);
    stopped_ = true;
    changed_.broadcast();
}

} // namespace zor::fs
