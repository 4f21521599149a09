// SPDX-License-Identifier: Apache-2.0
#include "Processes.h"

#include "Statistics.h"

#include <cerrno>
#include <csignal>
#include <cstring>
#include <ctime>
#include <fcntl.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

namespace zor::bench {

void failWithErrno(const std::string& what) {
    throw Failure(what + ": " + ::strerrordesc_np(errno));
}

ChildProcess::ChildProcess(const std::function<void()>& body) : pid_(::fork()) {
    if (pid_ < 0)
        failWithErrno("fork");
    if (pid_ > 0)
        return;
    ::prctl(PR_SET_PDEATHSIG, SIGKILL);
    body();
    ::_exit(127);
}

ChildProcess::~ChildProcess() {
    if (pid_ < 0)
        return;
    ::kill(pid_, SIGKILL);
    while (::waitpid(pid_, nullptr, 0) < 0 && errno == EINTR) {
    }
}

double ChildProcess::processorSeconds() const {
    clockid_t clock = 0;
    timespec time{};
    if (const int error = ::clock_getcpuclockid(pid_, &clock); error != 0 || ::clock_gettime(clock, &time) != 0)
        throw Failure("the processor time of a process cannot be read");
    return static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_nsec) * 1e-9;
}

std::optional<int> ChildProcess::take(int options) {
    int status = 0;
    pid_t ended = 0;
    do {
        ended = ::waitpid(pid_, &status, options);
    } while (ended < 0 && errno == EINTR);
    if (ended != pid_)
        return std::nullopt;
    pid_ = -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

int ChildProcess::wait() {
    return take(0).value_or(-1);
}

std::optional<int> ChildProcess::waitFor(int milliseconds) {
    const auto begin = Clock::now();
    for (;;) {
        if (const auto status = take(WNOHANG))
            return status;
        if (secondsSince(begin) * 1000 > milliseconds)
            return std::nullopt;
        ::usleep(500);
    }
}

double runProgram(const std::vector<std::string>& command) {
    std::vector<char*> arguments;
    for (const std::string& word : command)
        arguments.push_back(const_cast<char*>(word.c_str()));
    arguments.push_back(nullptr);
    const auto begin = Clock::now();
    ChildProcess process([&] {
        const int nothing = ::open("/dev/null", O_WRONLY | O_CLOEXEC);
        ::dup2(nothing, STDOUT_FILENO);
        ::execvp(arguments.front(), arguments.data());
    });
    if (process.wait() != 0)
        throw Failure(command.front() + " failed");
    return secondsSince(begin);
}

int measuringProcessor() {
    cpu_set_t allowed;
    if (::sched_getaffinity(0, sizeof allowed, &allowed) != 0)
        failWithErrno("sched_getaffinity");
    int last = 0;
    for (int processor = 0; processor < CPU_SETSIZE; ++processor)
        if (CPU_ISSET(static_cast<unsigned>(processor), &allowed))
            last = processor;
    return last;
}

void pinThisThread(int processor) {
    cpu_set_t one;
    CPU_ZERO(&one);
    CPU_SET(static_cast<unsigned>(processor), &one);
    if (::sched_setaffinity(0, sizeof one, &one) != 0)
        failWithErrno("sched_setaffinity");
}

Pinned::Pinned(int processor) {
    if (::sched_getaffinity(0, sizeof before_, &before_) != 0)
        failWithErrno("sched_getaffinity");
    pinThisThread(processor);
}

Pinned::~Pinned() {
    ::sched_setaffinity(0, sizeof before_, &before_);
}

} // namespace zor::bench
