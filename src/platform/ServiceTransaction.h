// SPDX-License-Identifier: Apache-2.0
// Busy marks: while one is held, a request to stop (SIGTERM) waits. The kernel may still kill the daemon at any time.
#pragma once

#include <atomic>
#include <functional>
#include <memory>
#include <utility>

namespace zor::platform {

/// Counts the marks; the run loop reads the count. Any thread.
class ServiceTransactions {
public:
    /// A mark is held for as long as the object lives; movable, so it can travel into a queued job.
    class Mark {
    public:
        explicit Mark(ServiceTransactions& owner) : owner_(&owner) { owner.begin(); }
        Mark(Mark&& other) noexcept : owner_(std::exchange(other.owner_, nullptr)) {}
        Mark(const Mark&) = delete;
        Mark& operator=(const Mark&) = delete;
        Mark& operator=(Mark&&) = delete;
        ~Mark() {
            if (owner_)
                owner_->end();
        }

    private:
        ServiceTransactions* owner_;
    };

    [[nodiscard]] std::shared_ptr<Mark> hold() { return std::make_shared<Mark>(*this); }
    [[nodiscard]] unsigned count() const { return count_.load(std::memory_order_acquire); }
    /// Called (on the thread that ended it) whenever the last mark ends. Set once, before any mark.
    void onIdle(std::function<void()> callback) { onIdle_ = std::move(callback); }

private:
    void begin() { count_.fetch_add(1, std::memory_order_acq_rel); }
    void end() {
        if (count_.fetch_sub(1, std::memory_order_acq_rel) == 1 && onIdle_)
            onIdle_();
    }
    std::atomic<unsigned> count_{0};
    std::function<void()> onIdle_;
};

} // namespace zor::platform
