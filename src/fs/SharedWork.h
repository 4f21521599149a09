// SPDX-License-Identifier: Apache-2.0
// Work that several threads share: numbered things, or the directories of a tree.
//
// Threads come to the caller's own where that pays, and have ended when a call returns; one that is not to be had is
// not missed. A thread serves the caller at the caller's priority, or at the usual one where the caller's is higher. An
// exception of any thread comes out on the caller's, after all have ended; then not everything need have been done.
#pragma once

#include "base/Mutex.h"

#include <atomic>
#include <cstddef>
#include <deque>
#include <exception>
#include <functional>
#include <string>
#include <thread>
#include <vector>

namespace zor::fs {

/// Threads beside the caller's. Any thread may add one, their own too; the maker ends them.
class Helpers {
public:
    explicit Helpers(std::size_t countMax) : countMax_(countMax) {}
    Helpers(const Helpers&) = delete;
    Helpers& operator=(const Helpers&) = delete;
    ~Helpers() { join(); }

    /// Does nothing where there are as many as may be, or no thread is to be had. `work` outlives them.
    void add(const std::function<void()>& work);
    /// Waits for all, and throws on what one of them, or `run` at another thread, threw first.
    void finish();
    /// Calls `work` and keeps its exception for finish().
    void run(const std::function<void()>& work) noexcept;

private:
    void join() noexcept;

    const std::size_t countMax_;
    platform::Mutex mutex_;
    std::size_t count_ ZOR_GUARDED_BY(mutex_) = 0;
    std::vector<std::thread> threads_ ZOR_GUARDED_BY(mutex_);
    std::exception_ptr thrown_ ZOR_GUARDED_BY(mutex_);
};

/// Calls `work(begin, end)` for stretches that together are 0 to `count`, each once: on this thread, on a second one
/// where there are many, and on more for as long as the threads wait for a disk, which serves several at once.
void forEachStretch(std::size_t count, const std::function<void(std::size_t begin, std::size_t end)>& work);

/// The directories of a tree that wait for one of the threads that share a walk of it, as paths relative to its root,
/// which is "" and waits first. Bounded in number and in memory. Any thread.
class DirectoryQueue {
public:
    DirectoryQueue() { waiting_.emplace_back(); }

    /// False when no more may wait: whoever met the directory then works on all of it by other means.
    [[nodiscard]] bool add(std::string path) ZOR_EXCLUDES(mutex_);
    /// Whether another thread would find something to do.
    [[nodiscard]] bool hasWork() ZOR_EXCLUDES(mutex_);
    /// Calls `work` for one directory after another, until none waits and no thread works on one that may add more.
    /// An exception of `work` stops all.
    void workOff(const std::function<void(const std::string& path)>& work) ZOR_EXCLUDES(mutex_);
    /// Lets each thread end after the directory that it works on.
    void stop() ZOR_EXCLUDES(mutex_);

private:
    /// False at the end.
    bool take(std::string& path) ZOR_EXCLUDES(mutex_);
    void giveBack() ZOR_EXCLUDES(mutex_);

    platform::Mutex mutex_;
    platform::ConditionVariable changed_;
    std::deque<std::string> waiting_ ZOR_GUARDED_BY(mutex_);
    std::size_t waitingBytes_ ZOR_GUARDED_BY(mutex_) = 0;
    /// Threads that work on a directory, and threads that wait for one.
    std::size_t busy_ ZOR_GUARDED_BY(mutex_) = 0;
    std::size_t idle_ ZOR_GUARDED_BY(mutex_) = 0;
    bool stopped_ ZOR_GUARDED_BY(mutex_) = false;
};

} // namespace zor::fs
