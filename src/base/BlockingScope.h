// SPDX-License-Identifier: Apache-2.0
// Says that this thread is about to wait for something slow: a lock that is taken, a sync, the build of a large cache.
//
// The pool that serves clients keeps about as many threads running as there are processors. A thread that waits inside
// a handler is not running, so the pool lets another one take its place while a scope is open. On a thread that belongs
// to no pool a scope does nothing.
#pragma once

namespace zor::platform {

/// Implemented by whoever owns the thread.
class BlockingObserver {
public:
    virtual ~BlockingObserver() = default;
    // They do not fail: who opens a scope may have counted himself already as one that waits.
    virtual void willBlock() noexcept = 0;
    virtual void didBlock() noexcept = 0;

    /// Makes `observer` (or nobody, with nullptr) the one that the scopes of this thread tell.
    static void setForThisThread(BlockingObserver* observer) { threadObserver_ = observer; }
    [[nodiscard]] static BlockingObserver* ofThisThread() { return threadObserver_; }

private:
    static inline thread_local BlockingObserver* threadObserver_ = nullptr;
};

class BlockingScope {
public:
    BlockingScope() : observer_(BlockingObserver::ofThisThread()) {
        if (observer_)
            observer_->willBlock();
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
