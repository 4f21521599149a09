// SPDX-License-Identifier: Apache-2.0
// Work that several threads share: numbered things, things as they are found, or the directories of a tree.
//
// Further threads help the caller's where that pays, and have ended when a call returns; without them the caller's does
// all of the work. A thread serves the caller at the caller's priority, or at the usual one where the caller's is
// higher. An exception of any thread comes out on the caller's, after all have ended; then not everything need have
// been done.
#pragma once

#include "base/Mutex.h"

#include <atomic>
#include <cstddef>
#include <deque>
#include <exception>
#include <functional>
#include <string>
#include <thread>
#include <utility>
#include <vector>

namespace zor::fs {

/// Threads beside the caller's. Any thread may add one, each of them too; the thread that made the object ends them.
class Helpers {
public:
    explicit Helpers(std::size_t countMax) : countMax_(countMax) {}
    Helpers(const Helpers&) = delete;
    Helpers& operator=(const Helpers&) = delete;
    ~Helpers() { join(); }

    /// Starts a thread that calls `work`; nothing happens at the limit, or when the system gives none. `work` outlives
    /// the threads.
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

/// Things that one thread finds, in order, and that it shares the work on with a second one: that one comes when there
/// have been many, takes them a batch at a time, and where it has enough to do the finder does its batch itself. So no
/// more than three batches are held. Both call `work`, at once; nothing is done in the order in which it was found.
/// `thingsOfBatch`: few enough for one descriptor each, many enough to be worth a wake-up. `countForTwoThreads`: so
/// many make a second thread worth while.
template <typename Thing, std::size_t thingsOfBatch = 16, std::size_t countForTwoThreads = 256>
class HandedOn {
public:
    using Work = std::function<void(Thing&)>;
    static constexpr std::size_t batchCount = thingsOfBatch;

    explicit HandedOn(Work work) : work_(std::move(work)) { mine_.reserve(batchCount); }
    HandedOn(const HandedOn&) = delete;
    HandedOn& operator=(const HandedOn&) = delete;
    /// After an exception what was not begun stays undone.
    ~HandedOn() { end(); }

    void add(Thing thing) {
        mine_.push_back(std::move(thing));
        if (mine_.size() < batchCount)
            return;
        if (++batches_ == countForTwoThreads / batchCount)
            helpers_.add(help_);
        if (!handOver())
            workOff(mine_);
    }
    /// Returns when all that was added is done; throws what one of the calls of `work` threw. More may be added.
    void settle() ZOR_EXCLUDES(mutex_) {
        workOff(mine_);
        {
            const platform::MutexLock held(mutex_);
            while (isHelped_ && (isHelping_ || !theirs_.empty()))
                changed_.wait(mutex_);
            if (theirs_.empty())
                return;
        }
        finish(); // the other thread threw
    }
    /// The same, and nothing more is added.
    void finish() {
        workOff(mine_);
        end();
        helpers_.finish();
    }

private:
    bool handOver() ZOR_EXCLUDES(mutex_) {
        const platform::MutexLock held(mutex_);
        if (!isHelped_ || !theirs_.empty())
            return false;
        theirs_.swap(mine_);
        changed_.signal();
        return true;
    }
    void help() ZOR_EXCLUDES(mutex_) {
        std::vector<Thing> batch;
        batch.reserve(batchCount);
        for (;;) {
            {
                const platform::MutexLock held(mutex_);
                isHelped_ = true;
                isHelping_ = false;
                changed_.signal();
                while (theirs_.empty() && !ended_)
                    changed_.wait(mutex_);
                if (theirs_.empty())
                    return;
                batch.swap(theirs_);
                isHelping_ = true;
            }
            try {
                workOff(batch);
            } catch (...) {
                const platform::MutexLock held(mutex_);
                isHelped_ = false;
                theirs_.swap(batch); // undone
                changed_.signal();
                throw;
            }
        }
    }
    void workOff(std::vector<Thing>& batch) {
        for (Thing& thing : batch)
            work_(thing);
        batch.clear();
    }
    void end() ZOR_EXCLUDES(mutex_) {
        const platform::MutexLock held(mutex_);
        ended_ = true;
        changed_.signal();
    }

    const Work work_;
    const std::function<void()> help_ = [this] { help(); };
    std::size_t batches_ = 0;
    std::vector<Thing> mine_;
    platform::Mutex mutex_;
    platform::ConditionVariable changed_;
    std::vector<Thing> theirs_ ZOR_GUARDED_BY(mutex_);
    bool isHelped_ ZOR_GUARDED_BY(mutex_) = false;  // the other thread takes batches
    bool isHelping_ ZOR_GUARDED_BY(mutex_) = false; // and has one
    bool ended_ ZOR_GUARDED_BY(mutex_) = false;
    Helpers helpers_{1}; // ends before what it works on
};

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
