// SPDX-License-Identifier: Apache-2.0
#include "Supervisor.h"

#include "Descriptors.h"
#include "Sandbox.h"

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <fcntl.h>
#include <net/if.h>
#include <poll.h>
#include <sched.h>
#include <spawn.h>
#include <sys/ioctl.h>
#include <sys/prctl.h>
#include <sys/signalfd.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>
#include <utility>

namespace zorvanerun {

using zor::platform::FileDescriptor;

namespace {

constexpr const char* adviceOnSandbox =
    "install bubblewrap 0.8 or newer, use a kernel of 5.12 or newer, and allow namespaces where this runs: a unit may "
    "not take away CAP_SYS_ADMIN, CAP_NET_ADMIN, CAP_SETUID, CAP_SETGID or CAP_SETPCAP, nor restrict namespaces";

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

void closePassed(int count) {
    for (int fd = firstPassed; fd < firstPassed + count; ++fd)
        ::close(fd);
}

/// The program's namespaces that need nothing of the daemon's answer: they cost more than all its mounts. False, errno
/// set.
bool makeNamespaces(Network network) {
    const bool ownNetwork = network == Network::none;
    if (::unshare(CLONE_NEWIPC | CLONE_NEWUTS | (ownNetwork ? CLONE_NEWNET : 0)) != 0)
        return false;
    if (!ownNetwork)
        return true;
    ifreq loopback{.ifr_ifrn = {.ifrn_name = "lo"}, .ifr_ifru = {}};
    loopback.ifr_flags = IFF_UP; // the kernel gives it its addresses then
    const FileDescriptor socket(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    return socket.valid() && ::ioctl(socket.get(), SIOCSIFFLAGS, &loopback) == 0;
}

/// In process 1 of the namespace: starts the maker, and waits for its end or that of the launcher. Its own end is that
/// of all others, whatever they are doing: so it executes nothing, and nothing that it is told can delay it. Never
/// returns.
[[noreturn]] void keep(int launcher, InsideHandles handles, Network network, int passed, std::vector<char*>& command) {
    // By the signal also while this process is stopped, or waits for the maker's beginning; by the descriptor no end of
    // the launcher is missed.
    pollfd events[] = {{.fd = launcher, .events = POLLIN, .revents = 0}, {.fd = -1, .events = POLLIN, .revents = 0}};
    if (::prctl(PR_SET_PDEATHSIG, SIGKILL) != 0 || ::poll(events, 1, 0) != 0)
        ::_exit(exitFailure);
    if (!makeNamespaces(network)) {
        const std::string why = withReason("the namespaces of the sandbox cannot be made", zor::Errno::last());
        std::fprintf(stderr, "zorvane-run: %s\n", why.c_str());
        ::_exit(exitFailure);
    }
    for (const int fd : {handles.program, handles.channel, handles.arguments})
        if (!keepOnExec(fd))
            ::_exit(exitFailure);
    for (int fd = firstPassed; fd < firstPassed + passed; ++fd)
        if (!keepOnExec(fd))
            ::_exit(exitFailure);
    // The signals are blocked for it: they are for the program. That of children is the maker's own to wait for.
    posix_spawnattr_t attributes;
    const sigset_t blocked = signalSet();
    sigset_t usual;
    ::sigemptyset(&usual);
    ::sigaddset(&usual, SIGPIPE);
    char* nothing = nullptr;
    pid_t maker = -1;
    if (::posix_spawnattr_init(&attributes) != 0 || ::posix_spawnattr_setsigmask(&attributes, &blocked) != 0 ||
        ::posix_spawnattr_setsigdefault(&attributes, &usual) != 0 ||
        ::posix_spawnattr_setflags(&attributes, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF) != 0)
        ::_exit(exitFailure);
    if (const int error = ::posix_spawn(&maker, command[0], nullptr, &attributes, command.data(), &nothing)) {
        std::fprintf(stderr, "zorvane-run: %s\n", printable(withReason(command[0], zor::Errno(error))).c_str());
        ::_exit(exitFailure);
    }
    for (const int fd : {handles.channel, handles.arguments})
        ::close(fd); // or neither would ever end
    closePassed(passed);
    const FileDescriptor end(static_cast<int>(::syscall(SYS_pidfd_open, maker, 0)));
    events[1].fd = end.get();
    if (!end.valid())
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

Failure noSandbox(const std::string& step) {
    return {.what = withReason("the sandbox cannot be made: " + step, zor::Errno::last()), .advice = adviceOnSandbox};
}

Supervisor::Supervisor(Supervisor&& other) noexcept
    : bubblewrap_(std::move(other.bubblewrap_)), keeper_(std::exchange(other.keeper_, -1)), status_(other.status_),
      arguments_(std::move(other.arguments_)), channel_(std::move(other.channel_)), signals_(std::move(other.signals_)),
      program_(std::move(other.program_)), early_(std::move(other.early_)) {}

Supervisor::~Supervisor() {
    if (keeper_ < 0)
        return;
    ::kill(keeper_, SIGKILL);
    while (::waitpid(keeper_, nullptr, 0) < 0 && errno == EINTR) {
    }
}

Result<Supervisor> Supervisor::begin(const Options& options, const PassedSockets& passed) {
    const FileDescriptor program(::open("/proc/self/exe", O_PATH | O_CLOEXEC));
    if (!program.valid())
        return std::unexpected(failure("cannot open this program", zor::Errno::last()));
    int ends[2] = {};
    if (::socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, ends) != 0)
        return std::unexpected(failure("cannot make a socket", zor::Errno::last()));
    Supervisor made;
    made.bubblewrap_ = options.bubblewrap;
    made.channel_.reset(ends[0]);
    FileDescriptor inner(ends[1]);
    if (::pipe2(ends, O_CLOEXEC) != 0)
        return std::unexpected(failure("cannot make a pipe", zor::Errno::last()));
    FileDescriptor arguments(ends[0]);
    made.arguments_.reset(ends[1]);
    const InsideHandles handles{.program = program.get(), .channel = inner.get(), .arguments = arguments.get()};
    std::vector<std::string> command = makerCommand(options, passed, handles);
    std::vector<char*> commandPointers = pointersTo(command);
    const FileDescriptor self(static_cast<int>(::syscall(SYS_pidfd_open, ::getpid(), 0)));
    // A caller that ignores the end of its children would leave nothing to wait for, here and in the sandbox's maker.
    ::signal(SIGCHLD, SIG_DFL);
    ::signal(SIGPIPE, SIG_IGN); // a maker that has ended is told nothing
    // For the one process that is started here: a process whose next child is to be in another namespace can have no
    // threads, and home directories are asked on one.
    const FileDescriptor processes(::open("/proc/self/ns/pid", O_RDONLY | O_CLOEXEC));
    if (!self.valid() || !processes.valid() || ::unshare(CLONE_NEWPID) != 0)
        return std::unexpected(noSandbox("a namespace of processes"));
    made.keeper_ = ::fork();
    if (made.keeper_ < 0)
        return std::unexpected(failure("cannot make a process", zor::Errno::last()));
    if (made.keeper_ > 0 && ::setns(processes.get(), CLONE_NEWPID) != 0)
        return std::unexpected(noSandbox("setns"));
    if (made.keeper_ == 0) {
        made.arguments_.reset();
        made.channel_.reset();
        keep(self.get(), handles, options.network, passed.count, commandPointers);
    }
    closePassed(passed.count);
    return made;
}

Result<int> Supervisor::run(const std::vector<std::string>& arguments, Notifications notifications) {
    tell(arguments);
    sigset_t caught = signalSet();
    ::sigaddset(&caught, SIGCHLD);
    signals_.reset(::signalfd(-1, &caught, SFD_CLOEXEC | SFD_NONBLOCK));
    if (!signals_.valid() || ::sigprocmask(SIG_BLOCK, &caught, nullptr) != 0)
        return std::unexpected(failure("cannot catch signals", zor::Errno::last()));
    if (const auto exitCode = wait(notifications))
        return *exitCode;
    return std::unexpected(
        Failure{.what = "the sandbox could not be made; " + bubblewrap_ + " or zorvane-run said why above",
                .advice = adviceOnSandbox});
}

void Supervisor::tell(const std::vector<std::string>& arguments) {
    std::string bytes;
    for (const std::string& argument : arguments)
        bytes.append(argument).push_back('\0');
    for (std::string_view rest = bytes; !rest.empty();) {
        const ssize_t written = ::write(arguments_.get(), rest.data(), rest.size());
        if (written < 0 && errno != EINTR)
            break; // the maker has ended; the wait for it says so
        rest.remove_prefix(static_cast<std::size_t>(std::max<ssize_t>(written, 0)));
    }
    arguments_.reset();
}

/// Waits for the end. nullopt when the program never began.
std::optional<int> Supervisor::wait(Notifications& notifications) {
    while (!ended()) {
        pollfd events[] = {{.fd = signals_.get(), .events = POLLIN, .revents = 0},
                           {.fd = channel_.get(), .events = POLLIN, .revents = 0},
                           notifications.event()};
        if (::poll(events, 3, -1) < 0 && errno != EINTR)
            return std::nullopt;
        if (events[1].revents != 0)
            takeProgram();
        if (events[0].revents != 0)
            takeSignals();
        if (events[2].revents != 0)
            notifications.pass();
    }
    if (channel_.valid())
        takeProgram();
    if (!program_.valid())
        return std::nullopt;
    notifications.passRest();
    return exitCodeOf(status_);
}

void Supervisor::takeProgram() {
    program_ = receiveDescriptor(channel_.get());
    channel_.reset(); // one message, or none
    for (const int number : early_)
        pass(number);
    early_.clear();
}

void Supervisor::takeSignals() {
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

void Supervisor::pass(int number) const {
    if (program_.valid())
        (void)::syscall(SYS_pidfd_send_signal, program_.get(), number, nullptr, 0);
}

bool Supervisor::ended() {
    pid_t waited = 0;
    do {
        waited = ::waitpid(keeper_, &status_, WNOHANG);
    } while (waited < 0 && errno == EINTR);
    if (waited != keeper_)
        return false;
    keeper_ = -1;
    return true;
}

} // namespace zorvanerun
