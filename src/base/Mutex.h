// SPDX-License-Identifier: Apache-2.0
// How threads of the daemon wait: for a mutex, for each other, and with a word to the pool that they belong to.
#pragma once

#include <chrono>
#include <condition_variable>
#include <mutex>

#if defined(__clang__)
#define ZOR_THREAD_ATTRIBUTE(x) __attribute__((x))
#else
#define ZOR_THREAD_ATTRIBUTE(x)
#endif
#define ZOR_CAPABILITY(name) ZOR_THREAD_ATTRIBUTE(capability(name))
#define ZOR_SCOPED_CAPABILITY ZOR_THREAD_ATTRIBUTE(scoped_lockable)
#define ZOR_GUARDED_BY(x) ZOR_THREAD_ATTRIBUTE(guarded_by(x))
#define ZOR_REQUIRES(...) ZOR_THREAD_ATTRIBUTE(requires_capability(__VA_ARGS__))
#define ZOR_REQUIRES_SHARED(...) ZOR_THREAD_ATTRIBUTE(requires_shared_capability(__VA_ARGS__))
#define ZOR_ACQUIRE(...) ZOR_THREAD_ATTRIBUTE(acquire_capability(__VA_ARGS__))
#define ZOR_RELEASE(...) ZOR_THREAD_ATTRIBUTE(release_capability(__VA_ARGS__))
#define ZOR_EXCLUDES(...) ZOR_THREAD_ATTRIBUTE(locks_excluded(__VA_ARGS__))
#define ZOR_NO_THREAD_SAFETY_ANALYSIS ZOR_THREAD_ATTRIBUTE(no_thread_safety_analysis)

namespace zor::platform {

// Mutexes that clang's thread-safety analysis understands. The lint build turns every access to guarded state outside
// its lock into an error, so state is declared beside its mutex with ZOR_GUARDED_BY.

class ZOR_CAPABILITY("mutex") Mutex {
public:
    Mutex() = default;
    Mutex(const Mutex&) = delete;
    Mutex& operator=(const Mutex&) = delete;
    void lock() ZOR_ACQUIRE() { mutex_.lock(); }
    void unlock() ZOR_RELEASE() { mutex_.unlock(); }

private:
    friend class ConditionVariable;
    std::mutex mutex_;
};

/// May be locked again by the thread that holds it.
class ZOR_CAPABILITY("mutex") RecursiveMutex {
public:
    RecursiveMutex() = default;
    RecursiveMutex(const RecursiveMutex&) = delete;
    RecursiveMutex& operator=(const RecursiveMutex&) = delete;
    void lock() ZOR_ACQUIRE() { mutex_.lock(); }
    void unlock() ZOR_RELEASE() { mutex_.unlock(); }

private:
    std::recursive_mutex mutex_;
};

template <typename AnyMutex>
class ZOR_SCOPED_CAPABILITY BasicMutexLock {
public:
    explicit BasicMutexLock(AnyMutex& mutex) ZOR_ACQUIRE(mutex) : mutex_(mutex) { mutex_.lock(); }
    ~BasicMutexLock() ZOR_RELEASE() { mutex_.unlock(); }
    BasicMutexLock(const BasicMutexLock&) = delete;
    BasicMutexLock& operator=(const BasicMutexLock&) = delete;

private:
    AnyMutex& mutex_;
};
using MutexLock = BasicMutexLock<Mutex>;
using RecursiveMutexLock = BasicMutexLock<RecursiveMutex>;

/// Waits with a Mutex. Callers loop over their condition themselves, so that the analysis sees what the loop reads.
class ConditionVariable {
public:
    void wait(Mutex& mutex) ZOR_REQUIRES(mutex) {
        std::unique_lock<std::mutex> held(mutex.mutex_, std::adopt_lock);
        condition_.wait(held);
        held.release();
    }
    /// False when the time ran out first.
    template <typename Rep, typename Period>
    bool waitFor(Mutex& mutex, std::chrono::duration<Rep, Period> timeout) ZOR_REQUIRES(mutex) {
        std::unique_lock<std::mutex> held(mutex.mutex_, std::adopt_lock);
        const bool notified = condition_.wait_for(held, timeout) == std::cv_status::no_timeout;
        held.release();
        return notified;
    }
    void signal() { condition_.notify_one(); }
    void broadcast() { condition_.notify_all(); }

private:
    std::condition_variable condition_;
};

// Says that this thread is about to wait for something slow: a lock that is taken, a sync, the build of a large cache.
//
// The pool that serves clients keeps about as many threads running as there are processors. A thread that waits inside
// a handler is not running, so the pool lets another one take its place while a scope is open. On a thread that belongs
// to no pool a scope does nothing.

/// Whether the thread computes for long between its waits: a walk, or the writing of a large file.
enum class Load { light, heavy };

/// Implemented by whoever owns the thread.
class BlockingObserver {
public:
    virtual ~BlockingObserver() = default;
    // They do not fail: a thread that opens a scope may have counted itself already as one that waits.
    virtual void willBlock(Load load) noexcept = 0;
    virtual void didBlock() noexcept = 0;

    /// Makes `observer` (or nobody, with nullptr) the one that the scopes of this thread tell.
    static void setForThisThread(BlockingObserver* observer) { threadObserver_ = observer; }
    [[nodiscard]] static BlockingObserver* ofThisThread() { return threadObserver_; }

private:
    static inline thread_local BlockingObserver* threadObserver_ = nullptr;
};

class BlockingScope {
public:
    explicit BlockingScope(Load load = Load::light) : observer_(BlockingObserver::ofThisThread()) {
        if (observer_)
            observer_->willBlock(load);
    }
    ~BlockingScope() {
        if (observer_)
            observer_->didBlock();
    }
    BlockingScope(const BlockingScope&) = delete;
    BlockingScope& operator=(const BlockingScope&) = delete;

private:
    BlockingObserver* observer_;
};

} // namespace zor::platform
