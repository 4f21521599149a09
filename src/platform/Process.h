// SPDX-License-Identifier: Apache-2.0
// The daemon's own process as it knows it: where its log's lines go (base/Log.h says which are written), a queue for
// work beside its clients', and the count of work that is in progress.
#pragma once

#include <atomic>
#include <cstddef>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <utility>

namespace zor::platform {

class PlatformLog {
public:
    virtual ~PlatformLog() = default;
    /// Opens the log handle under a name with an initial level. False: there is no handle, and lines go to the default
    /// destination (standard error).
    virtual bool open(std::string_view name, int level) = 0;
    [[nodiscard]] virtual bool isOpen() const = 0;
    [[nodiscard]] virtual int level() const = 0;
    /// Sends lines to a file from now on. When a line would pass `fileBytesMax`, file is renamed to file.1, file.1 to
    /// file.2 and so on, `fileCount` files in all; with one file it is started anew.
    virtual void enableDiskLogging(const std::string& path, unsigned fileCount, std::size_t fileBytesMax) = 0;
    /// One event, one line: what steers or is not seen is escaped, but for tabs (plist/Text.h). Any thread.
    virtual void write(int level, std::string_view function, std::string_view message) = 0;
    /// The system's own log (syslog), for what happens before there is a handle.
    virtual void writeToSystemLog(int priority, std::string_view message) = 0;
};

// A serial queue with one thread of its own.

class WorkQueue {
public:
    enum class Priority { normal, background };
    virtual ~WorkQueue() = default;
    /// Gives the queue its thread; jobs that came before wait for it. False when the system has none.
    [[nodiscard]] virtual bool start() = 0;
    /// Runs `job` on the queue's thread after everything queued before it. Any thread, never blocks. Throws
    /// std::bad_alloc alone, and has queued nothing then.
    virtual void async(std::function<void()> job) = 0;
    /// After this returns, no further job begins until resume; a running one goes on. Calls pair, and do not nest.
    virtual void suspend() = 0;
    virtual void resume() = 0;
};

// Busy marks: while one is held, a request to stop (SIGTERM) waits. The kernel may still kill the daemon at any time.

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
