// SPDX-License-Identifier: Apache-2.0
#include "service/PassedAlong.h"

#include <csignal>
#include <ctime>
#include <pthread.h>
#include <sys/socket.h>
#include <unistd.h>

namespace zor::platform {

namespace {

// A thread that does not handle it ignores it, so a stray one does no harm.
constexpr int interruptSignal = SIGURG;

/// No honest close takes this long; an early interrupt does no harm. The later ones are for what is waited for next.
constexpr timespec firstInterrupt = {.tv_sec = 0, .tv_nsec = 1'000'000};
constexpr timespec interruptEvery = {.tv_sec = 0, .tv_nsec = 10'000'000};

// Older headers do not have it.
#ifdef SO_PASSRIGHTS
constexpr int passRights = SO_PASSRIGHTS;
#else
constexpr int passRights = 83;
#endif

void handleInterrupt() {
    struct sigaction action = {};
    action.sa_handler = [](int) {};
    action.sa_flags = SA_RESTART;
    ::sigaction(interruptSignal, &action, nullptr);
}

/// Interrupts the thread that made it.
class InterruptTimer {
public:
    InterruptTimer() {
        allowInterrupts();
        sigevent event = {};
        event.sigev_notify = SIGEV_THREAD_ID;
        event.sigev_signo = interruptSignal;
        event._sigev_un._tid = ::gettid();
        made_ = ::timer_create(CLOCK_MONOTONIC, &event, &timer_) == 0;
    }
    ~InterruptTimer() {
        if (made_)
            ::timer_delete(timer_);
    }
    InterruptTimer(const InterruptTimer&) = delete;
    InterruptTimer& operator=(const InterruptTimer&) = delete;

    void begin() const { set({.it_interval = interruptEvery, .it_value = firstInterrupt}); }
    void stop() const { set({}); }

private:
    void set(const itimerspec& times) const {
        if (made_)
            ::timer_settime(timer_, 0, &times, nullptr);
    }

    timer_t timer_ = nullptr;
    bool made_ = false;
};

const InterruptTimer& timerOfThisThread() {
    thread_local const InterruptTimer timer;
    return timer;
}

} // namespace

void refuseDescriptors(int listening) {
    const int off = 0;
    // A kernel that does not know the option leaves it to the interrupts.
    (void)::setsockopt(listening, SOL_SOCKET, passRights, &off, sizeof off);
}

void allowInterrupts() {
    [[maybe_unused]] static const bool handled = (handleInterrupt(), true);
    sigset_t set;
    ::sigemptyset(&set);
    ::sigaddset(&set, interruptSignal);
    ::pthread_sigmask(SIG_UNBLOCK, &set, nullptr);
}

void interruptThread(pid_t threadId) {
    ::tgkill(::getpid(), threadId, interruptSignal);
}

InterruptedScope::InterruptedScope() {
    timerOfThisThread().begin();
}

InterruptedScope::~InterruptedScope() {
    timerOfThisThread().stop();
}

void PeerSocket::reset() noexcept {
    if (!socket_.valid())
        return;
    const InterruptedScope whatPeersPassed;
    socket_.reset();
}

} // namespace zor::platform
