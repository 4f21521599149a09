// SPDX-License-Identifier: Apache-2.0
#include "os/SignalDescriptor.h"

#include <cerrno>
#include <csignal>
#include <pthread.h>
#include <sys/signalfd.h>
#include <unistd.h>

namespace zor::platform {

SignalDescriptor::SignalDescriptor(std::initializer_list<int> signals) {
    sigset_t set;
    ::sigemptyset(&set);
    for (const int signal : signals)
        ::sigaddset(&set, signal);
    if (::pthread_sigmask(SIG_BLOCK, &set, nullptr) == 0)
        descriptor_.reset(::signalfd(-1, &set, SFD_CLOEXEC | SFD_NONBLOCK));
}

std::optional<int> SignalDescriptor::take() {
    signalfd_siginfo info{};
    ssize_t bytes = 0;
    do {
        bytes = ::read(descriptor_.get(), &info, sizeof info);
    } while (bytes < 0 && errno == EINTR);
    if (bytes != sizeof info)
        return std::nullopt;
    return static_cast<int>(info.ssi_signo);
}

} // namespace zor::platform
