// SPDX-License-Identifier: Apache-2.0
// Calls of the C interface that do not wait: a thread carries them out, one after the other.
//
// A call is a node that goes from list to list: waiting, under way, answered. All that a node needs is taken when the
// call is started, so that a call that was started is answered also where there is no memory left. The thread alone
// touches the session, and the answer of the call that is under way; all else is under the mutex, which is never held
// while somebody waits or a callback runs.
#include "CInterface.h"

#include "base/Mutex.h"
#include "os/FileDescriptor.h"

#include <cerrno>
#include <csignal>
#include <list>
#include <sys/eventfd.h>
#include <system_error>
#include <thread>
#include <unistd.h>
#include <utility>

namespace c = zorvane::c;
using zor::platform::FileDescriptor;
using zor::platform::MutexLock;

namespace {

/// A descriptor that is readable while it is raised. Any thread.
class Flag {
public:
    Flag() : descriptor_(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
        if (!descriptor_.valid())
            throw std::system_error(errno, std::generic_category(), "no descriptor for an event");
    }
    [[nodiscard]] int descriptor() const { return descriptor_.get(); }
    void raise() { (void)::eventfd_write(descriptor_.get(), 1); }
    void lower() {
        eventfd_t count = 0;
        (void)::eventfd_read(descriptor_.get(), &count);
    }

private:
    FileDescriptor descriptor_;
};

struct Call {
    std::uint64_t number = 0;
    std::unique_ptr<zorvane_request> request;
    zorvane_callback callback = nullptr;
    void* data = nullptr;
    bool cancelled = false;
    std::unique_ptr<zorvane_result> result;
    zorvane_error error{};
};
using Calls = std::list<Call>;

bool eraseCall(Calls& calls, std::uint64_t number) {
    return std::erase_if(calls, [&](const Call& call) { return call.number == number; }) != 0;
}

zorvane::ConnectOptions interruptible(zorvane::ConnectOptions options, const Flag& interrupt) {
    options.interruptDescriptor = interrupt.descriptor();
    return options;
}

} // namespace

struct zorvane_async {
public:
    explicit zorvane_async(zorvane::ConnectOptions options) : session_(interruptible(std::move(options), interrupt_)) {
        // A thread inherits the mask of its maker's.
        sigset_t all;
        sigset_t before;
        ::sigfillset(&all);
        ::pthread_sigmask(SIG_SETMASK, &all, &before);
        try {
            thread_ = std::thread([this] { work(); });
        } catch (...) {
            ::pthread_sigmask(SIG_SETMASK, &before, nullptr);
            throw;
        }
        ::pthread_sigmask(SIG_SETMASK, &before, nullptr);
    }
    ~zorvane_async() {
        {
            const MutexLock lock(mutex_);
            ending_ = true;
            interrupt_.raise();
            changed_.signal();
        }
        thread_.join();
    }
    zorvane_async(const zorvane_async&) = delete;
    zorvane_async& operator=(const zorvane_async&) = delete;

    [[nodiscard]] int descriptor() const { return answers_.descriptor(); }

    std::uint64_t start(std::unique_ptr<zorvane_request> request, zorvane_callback callback, void* data) {
        Calls one;
        one.push_back({.request = std::move(request), .callback = callback, .data = data, .result = {}});
        const MutexLock lock(mutex_);
        one.front().number = ++lastNumber_;
        waiting_.splice(waiting_.end(), one);
        changed_.signal();
        return lastNumber_;
    }

    std::size_t dispatch() {
        std::size_t count = 0;
        // Callbacks may start calls; their answers are the next turn's.
        for (std::size_t left = answeredCount(); left > 0; --left) {
            Calls one;
            {
                const MutexLock lock(mutex_);
                if (answered_.empty()) // a callback has cancelled the rest
                    break;
                one.splice(one.begin(), answered_, answered_.begin());
                lowerIfNoneIsLeft();
            }
            ++count;
            Call& call = one.front();
            if (!call.callback)
                continue;
            const bool failed = call.error.kind != ZORVANE_OK;
            call.callback(call.data, call.result.release(), failed ? &call.error : nullptr);
        }
        return count;
    }

    bool cancel(std::uint64_t number) {
        const MutexLock lock(mutex_);
        if (!running_.empty() && running_.front().number == number && !running_.front().cancelled) {
            running_.front().cancelled = true;
            interrupt_.raise();
            return true;
        }
        const bool erased = eraseCall(waiting_, number) || eraseCall(answered_, number);
        lowerIfNoneIsLeft();
        return erased;
    }

private:
    void work() {
        while (Call* const call = next()) {
            (void)session_.perform(call->request.get(), call->result, &call->error);
            settle(*call);
        }
    }

    /// The call that is under way from then on; nullptr at the end.
    Call* next() {
        const MutexLock lock(mutex_);
        while (waiting_.empty() && !ending_)
            changed_.wait(mutex_);
        if (ending_)
            return nullptr;
        running_.splice(running_.begin(), waiting_, waiting_.begin());
        return &running_.front();
    }

    void settle(const Call& call) {
        const MutexLock lock(mutex_);
        if (call.cancelled) {
            running_.clear();
            if (!ending_)
                interrupt_.lower();
            return;
        }
        answered_.splice(answered_.end(), running_);
        answers_.raise();
    }

    std::size_t answeredCount() {
        const MutexLock lock(mutex_);
        return answered_.size();
    }

    void lowerIfNoneIsLeft() ZOR_REQUIRES(mutex_) {
        if (answered_.empty())
            answers_.lower();
    }

    Flag answers_;
    Flag interrupt_;
    c::Session session_;
    zor::platform::Mutex mutex_;
    zor::platform::ConditionVariable changed_;
    Calls waiting_ ZOR_GUARDED_BY(mutex_);
    Calls running_ ZOR_GUARDED_BY(mutex_);
    Calls answered_ ZOR_GUARDED_BY(mutex_);
    std::uint64_t lastNumber_ ZOR_GUARDED_BY(mutex_) = 0;
    bool ending_ ZOR_GUARDED_BY(mutex_) = false;
    std::thread thread_;
};

zorvane_async* zorvane_async_new(const char* root, std::int64_t timeout_milliseconds, zorvane_error* error) {
    zorvane_async* made = nullptr;
    (void)c::guarded(error, [&] {
        made = new zorvane_async(c::connectOptions(root, timeout_milliseconds));
        return static_cast<int>(ZORVANE_OK);
    });
    return made;
}

void zorvane_async_free(zorvane_async* async) {
    delete async;
}

int zorvane_async_fd(const zorvane_async* async) {
    return async ? async->descriptor() : -1;
}

std::uint64_t zorvane_async_start(zorvane_async* async, zorvane_request* request, zorvane_callback callback, void* data,
                                  zorvane_error* error) {
    std::unique_ptr<zorvane_request> owned(request);
    std::uint64_t number = 0;
    (void)c::guarded(error, [&] {
        if (!async)
            throw c::Wrong{"there is no async object"};
        number = async->start(std::move(owned), callback, data);
        return static_cast<int>(ZORVANE_OK);
    });
    return number;
}

std::size_t zorvane_async_dispatch(zorvane_async* async) {
    return async ? async->dispatch() : 0;
}

int zorvane_async_cancel(zorvane_async* async, std::uint64_t call) {
    return async && async->cancel(call) ? 1 : 0;
}
