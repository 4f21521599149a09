// SPDX-License-Identifier: Apache-2.0
#include "Supervisor.h"

#include "Descriptors.h"
#include "Sandbox.h"
#include "Staging.h"

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <fcntl.h>
#include <poll.h>
#include <sched.h>
#include <sys/prctl.h>
#include <sys/signalfd.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

namespace zorvanerun {

using zor::platform::FileDescriptor;

namespace {

constexpr int passedOn[] = {SIGHUP, SIGINT, SIGQUIT, SIGTERM, SIGUSR1, SIGUSR2};

std::vector<char*> pointersTo(std::vector<std::string>& texts) {
    std::vector<char*> pointers;
    for (std::string& text : texts)
        pointers.push_back(text.data());
    pointers.push_back(nullptr);
    return pointers;
}

sigset_t signalSet() {
    sigset_t set;
    ::sigemptyset(&set);
    for (const int number : passedOn)
        ::sigaddset(&set, number);
    return set;
}

Failure failure(const std::string& what, zor::Errno error) {
    return {.what = withReason(what, error), .advice = "see what limits this process"};
}

int exitCodeOf(int status) {
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

/// The namespace's process 1 and, from when there is one, the program inside.
class Supervisor {
public:
    Supervisor(pid_t keeper, FileDescriptor channel, FileDescriptor signals, Notifications notifications)
        : keeper_(keeper), channel_(std::move(channel)), signals_(std::move(signals)),
          notifications_(std::move(notifications)) {}

    /// Waits for the end. nullopt when the program never began.
    std::optional<int> wait() {
        for (;;) {
            pollfd events[] = {{.fd = signals_.get(), .events = POLLIN, .revents = 0},
                               {.fd = channel_.get(), .events = POLLIN, .revents = 0},
                               notifications_.event()};
            if (::poll(events, 3, -1) < 0 && errno != EINTR)
                return end(SIGKILL);
            if (events[1].revents != 0)
                takeProgram();
            if (events[0].revents != 0)
                takeSignals();
            if (events[2].revents != 0)
                notifications_.pass();
            if (const auto status = ended())
                return *status;
        }
    }

private:
    void takeProgram() {
        program_ = receiveDescriptor(channel_.get());
        channel_.reset(); // one message, or none
        for (const int number : early_)
            pass(number);
        early_.clear();
    }

    void takeSignals() {
        signalfd_siginfo info{};
        while (::read(signals_.get(), &info, sizeof info) == static_cast<ssize_t>(sizeof info)) {
            const auto number = static_cast<int>(info.ssi_signo);
            if (number == SIGCHLD)
                continue; // the loop looks
            if (channel_.valid())
                early_.push_back(number);
            else
                pass(number);
        }
    }

    void pass(int number) const {
        if (program_.valid())
            (void)::syscall(SYS_pidfd_send_signal, program_.get(), number, nullptr, 0);
    }

    std::optional<int> end(int number) {
        ::kill(keeper_, number);
        ::waitpid(keeper_, nullptr, 0);
        return std::nullopt;
    }

    /// The inner optional is empty when the program never began.
    std::optional<std::optional<int>> ended() {
        int status = 0;
        pid_t waited = 0;
        do {
            waited = ::waitpid(keeper_, &status, WNOHANG);
        } while (waited < 0 && errno == EINTR);
        if (waited != keeper_)
            return std::nullopt;
        if (channel_.valid())
            takeProgram();
        if (!program_.valid())
            return std::optional<int>();
        notifications_.passRest();
        return exitCodeOf(status);
    }

    const pid_t keeper_;
    FileDescriptor channel_;
    FileDescriptor signals_;
    FileDescriptor program_;
    Notifications notifications_;
    std::vector<int> early_;
};

/// In a child of process 1: becomes the maker of the sandbox. Never returns.
[[noreturn]] void executeMaker(const std::vector<Mount>& mounts, InsideHandles handles,
                               const Notifications& notifications, std::vector<char*>& arguments,
                               std::vector<char*>& environment) {
    const char* failed = stage(mounts);
    if (!failed)
        failed = notifications.appear();
    if (!failed && !(keepOnExec(handles.program) && keepOnExec(handles.channel)))
        failed = "fcntl";
    // The signals stay blocked; only that of children is the maker's own to wait for.
    const sigset_t blocked = signalSet();
    if (!failed && ::sigprocmask(SIG_SETMASK, &blocked, nullptr) != 0)
        failed = "sigprocmask";
    if (!failed) {
        ::execve(arguments[0], arguments.data(), environment.data());
        failed = arguments[0];
    }
    std::fprintf(stderr, "zorvane-run: %s\n", printable(withReason(failed, zor::Errno::last())).c_str());
    ::_exit(exitFailure);
}

/// In process 1 of the namespace: waits for the end of the maker, or of the launcher. Its own end is that of all
/// others, whatever they are doing: so it executes nothing, and nothing that it is told can delay it. Never returns.
[[noreturn]] void keep(int launcher, pid_t maker) {
    const FileDescriptor end(static_cast<int>(::syscall(SYS_pidfd_open, maker, 0)));
    pollfd events[] = {{.fd = launcher, .events = POLLIN, .revents = 0},
                       {.fd = end.get(), .events = POLLIN, .revents = 0}};
    // The signal is for when this process was stopped; by the descriptor no end of the launcher is missed.
    if (maker < 0 || !end.valid() || ::prctl(PR_SET_PDEATHSIG, SIGKILL) != 0)
        ::_exit(exitFailure);
    while (events[0].revents == 0 && events[1].revents == 0)
        if (::poll(events, 2, -1) < 0 && errno != EINTR)
            ::_exit(exitFailure);
    int status = 0;
    if (events[0].revents != 0 || ::waitpid(maker, &status, 0) != maker)
        ::_exit(exitFailure);
    ::_exit(exitCodeOf(status));
}

} // namespace

Result<int> runSandboxed(const Options& options, const std::vector<Mount>& mounts, const ToldContainers& told,
                         Notifications notifications) {
    const FileDescriptor program(::open("/proc/self/exe", O_PATH | O_CLOEXEC));
    if (!program.valid())
        return std::unexpected(failure("cannot open this program", zor::Errno::last()));
    int ends[2] = {};
    if (::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends) != 0)
        return std::unexpected(failure("cannot make a socket", zor::Errno::last()));
    FileDescriptor channel(ends[0]);
    FileDescriptor inner(ends[1]);
    // A caller that ignores the end of its children would leave nothing to wait for, here and in the sandbox's maker.
    ::signal(SIGCHLD, SIG_DFL);
    sigset_t caught = signalSet();
    ::sigaddset(&caught, SIGCHLD);
    FileDescriptor signals(::signalfd(-1, &caught, SFD_CLOEXEC | SFD_NONBLOCK));
    if (!signals.valid() || ::sigprocmask(SIG_BLOCK, &caught, nullptr) != 0)
        return std::unexpected(failure("cannot catch signals", zor::Errno::last()));
    const InsideHandles handles{.program = program.get(), .channel = inner.get()};
    std::vector<std::string> arguments = sandboxArguments(options, mounts, told, notifications, handles);
    std::vector<std::string> environment = sandboxEnvironment(options, told);
    const std::vector<std::string> more = notifications.environment();
    environment.insert(environment.end(), more.begin(), more.end());
    std::vector<char*> argumentPointers = pointersTo(arguments);
    std::vector<char*> environmentPointers = pointersTo(environment);
    const FileDescriptor self(static_cast<int>(::syscall(SYS_pidfd_open, ::getpid(), 0)));
    // For what is started from here on, not for this process.
    if (!self.valid() || ::unshare(CLONE_NEWPID) != 0)
        return std::unexpected(failure("cannot make a namespace of processes", zor::Errno::last()));
    const pid_t keeper = ::fork();
    if (keeper < 0)
        return std::unexpected(failure("cannot make a process", zor::Errno::last()));
    if (keeper == 0) {
        const pid_t maker = ::fork();
        if (maker == 0)
            executeMaker(mounts, handles, notifications, argumentPointers, environmentPointers);
        inner.reset();
        keep(self.get(), maker);
    }
    inner.reset(); // or the channel would never end
    if (const auto exitCode =
            Supervisor(keeper, std::move(channel), std::move(signals), std::move(notifications)).wait())
        return *exitCode;
    return std::unexpected(Failure{
        .what = "the sandbox could not be made; " + options.bubblewrap + " or zorvane-run said why above",
        .advice = "install bubblewrap 0.8 or newer, and allow namespaces where this runs: a unit may not take away "
                  "CAP_SYS_ADMIN, CAP_NET_ADMIN, CAP_SETUID, CAP_SETGID or CAP_SETPCAP, nor restrict namespaces"});
}

} // namespace zorvanerun
