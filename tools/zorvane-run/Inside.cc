// SPDX-License-Identifier: Apache-2.0
#include "Inside.h"

#include "Descriptors.h"
#include "Failure.h"
#include "Fence.h"

#include <cerrno>
#include <charconv>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <grp.h>
#include <linux/capability.h>
#include <optional>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace zorvanerun {

namespace {

/// The kernel's set of signals.
constexpr std::size_t signalSetBytes = 8;
/// Only its owner may change what a program makes.
constexpr mode_t usualUmask = 022;

enum Argument : int { optionAt = 1, channelAt, userAt, networkAt, passedAt, programAt };

int say(const std::string& what, int exitCode) {
    std::fprintf(stderr, "zorvane-run: %s\n", printable(what).c_str());
    return exitCode;
}

template <typename Number>
bool parse(const char* text, Number& number) {
    const char* const end = text + std::strlen(text);
    const auto [last, error] = std::from_chars(text, end, number);
    return error == std::errc() && last == end;
}

/// Every set of them that a process has, of every capability that the kernel knows.
bool dropCapabilities() {
    __user_cap_header_struct header{.version = _LINUX_CAPABILITY_VERSION_3, .pid = 0};
    const __user_cap_data_struct none[_LINUX_CAPABILITY_U32S_3] = {};
    return ::prctl(PR_CAP_AMBIENT, PR_CAP_AMBIENT_CLEAR_ALL, 0, 0, 0) == 0 && ::syscall(SYS_capset, &header, none) == 0;
}

bool dropBoundingSet() {
    unsigned long capability = 0;
    while (::prctl(PR_CAPBSET_DROP, capability, 0, 0, 0) == 0)
        ++capability;
    return errno == EINVAL && capability > 0; // the first that the kernel does not know
}

bool hasNothingLeft(uid_t user) {
    uid_t userIds[3] = {};
    gid_t groupIds[3] = {};
    if (::getresuid(&userIds[0], &userIds[1], &userIds[2]) != 0 ||
        ::getresgid(&groupIds[0], &groupIds[1], &groupIds[2]) != 0 || ::getgroups(0, nullptr) != 0)
        return false;
    for (int i = 0; i < 3; ++i)
        if (userIds[i] != user || groupIds[i] != user)
            return false;
    __user_cap_header_struct header{.version = _LINUX_CAPABILITY_VERSION_3, .pid = 0};
    __user_cap_data_struct data[_LINUX_CAPABILITY_U32S_3] = {};
    if (::syscall(SYS_capget, &header, data) != 0)
        return false;
    for (const __user_cap_data_struct& part : data)
        if (part.effective != 0 || part.permitted != 0 || part.inheritable != 0)
            return false;
    return ::prctl(PR_GET_NO_NEW_PRIVS, 0, 0, 0, 0) == 1 && ::setresuid(0, 0, 0) != 0;
}

/// In this order: each step needs a power that a later one takes away. Judged by what is left, not by what was called.
bool become(uid_t user) {
    return ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 && ::prctl(PR_SET_KEEPCAPS, 0, 0, 0, 0) == 0 &&
           dropBoundingSet() && ::setgroups(0, nullptr) == 0 && ::setresgid(user, user, user) == 0 &&
           ::setresuid(user, user, user) == 0 && dropCapabilities() && hasNothingLeft(user);
}

/// A caller that ignores a signal, or has it blocked, means itself.
void takeSignals() {
    // Also of those that the C library keeps to itself: it ignores them in what it starts. All zero is the default, in
    // the kernel's form of an action, which is not larger.
    const struct sigaction usual{};
    for (int number = 1; number <= SIGRTMAX; ++number)
        (void)::syscall(SYS_rt_sigaction, number, &usual, nullptr, signalSetBytes); // two have none, and say so
    sigset_t none;
    ::sigemptyset(&none);
    ::sigprocmask(SIG_SETMASK, &none, nullptr);
}

} // namespace

int runInside(int argumentCount, char** arguments) {
    int channel = -1;
    std::uint32_t user = 0;
    int passed = 0;
    std::optional<Network> network;
    if (argumentCount <= Argument::programAt || !parse(arguments[Argument::channelAt], channel) || channel < 0 ||
        !parse(arguments[Argument::userAt], user) || user == 0 ||
        !(network = networkNamed(arguments[Argument::networkAt])) || !parse(arguments[Argument::passedAt], passed) ||
        passed < 0)
        return say("the option is for the use of zorvane-run itself", exitFailure);
    if (!leaveKeys())
        return say(withReason("cannot leave the caller's keys", zor::Errno::last()), exitFailure);
    if (!become(user))
        return say(withReason("cannot become user " + std::to_string(user), zor::Errno::last()), exitFailure);
    // As the user: a container may be closed to everybody else.
    const char* const home = std::getenv("HOME");
    const std::string directory = home ? home : "HOME";
    if (!home || ::chdir(home) != 0 || ::setenv("PWD", directory.c_str(), 1) != 0)
        return say(withReason("cannot go to " + directory, zor::Errno::last()), exitFailure);
    ::umask(usualUmask);
    takeSignals();
    const zor::platform::FileDescriptor self(static_cast<int>(::syscall(SYS_pidfd_open, ::getpid(), 0)));
    if (!self.valid() || !sendDescriptor(channel, self.get()))
        return say(withReason("cannot report", zor::Errno::last()), exitFailure);
    if (passed > 0 && ::setenv("LISTEN_PID", std::to_string(::getpid()).c_str(), 1) != 0)
        return say(withReason("cannot tell of the passed sockets", zor::Errno::last()), exitFailure);
    if (!closeOnExecFrom(firstPassed + passed))
        return say(withReason("cannot close descriptors", zor::Errno::last()), exitFailure);
    if (!fence(*network))
        return say(withReason("the kernel does not take the rules for system calls", zor::Errno::last()), exitFailure);
    char** const program = arguments + Argument::programAt;
    ::execvp(program[0], program);
    const zor::Errno error = zor::Errno::last();
    return say(withReason("cannot execute " + std::string(program[0]), error),
               error == ENOENT || error == ENOTDIR ? exitNotFound : exitCannotExecute);
}

} // namespace zorvanerun
