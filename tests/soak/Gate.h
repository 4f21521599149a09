// SPDX-License-Identifier: Apache-2.0
// A lock that many share and one may want alone. Who wants it alone gets it next: a lock that prefers sharers would
// never be free of clients that ask without pause.
#pragma once

#include <condition_variable>
#include <mutex>

namespace zor::soak {

/// For std::shared_lock and std::unique_lock.
class Gate {
public:
    void lock_shared() {
        std::unique_lock lock(mutex_);
        changed_.wait(lock, [&] { return !wantedAlone_; });
        ++inside_;
    }
    void unlock_shared() {
        const std::lock_guard lock(mutex_);
        --inside_;
        changed_.notify_all();
    }
    void lock() {
        std::unique_lock lock(mutex_);
        wantedAlone_ = true;
        changed_.wait(lock, [&] { return inside_ == 0; });
    }
    void unlock() {
        const std::lock_guard lock(mutex_);
        wantedAlone_ = false;
        changed_.notify_all();
    }

private:
    std::mutex mutex_;
    std::condition_variable changed_;
    bool wantedAlone_ = false;
    int inside_ = 0;
};

} // namespace zor::soak
