// SPDX-License-Identifier: Apache-2.0
#include "Notifications.h"

#include "Staging.h"

#include <algorithm>
#include <cerrno>
#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

namespace zorvanerun {

using zor::platform::FileDescriptor;

namespace {

/// Below a directory of which the sandbox has its own, so that nothing else can lie in its place.
constexpr const char* placeInside = "/dev/notify";
/// The service manager takes no longer ones.
constexpr std::size_t messageBytesMax = 4096;
constexpr int patienceMilliseconds = 1000;
/// Everybody inside may send.
constexpr mode_t socketMode = 0666;

constexpr std::string_view passedOn[] = {
    "READY=",       "RELOADING=", "STOPPING=",      "MONOTONIC_USEC=",     "STATUS=", "ERRNO=", "BUSERROR=",
    "EXIT_STATUS=", "WATCHDOG=",  "WATCHDOG_USEC=", "EXTEND_TIMEOUT_USEC="};

/// EINVAL for what is no name of a socket. A name that begins with @ is an abstract one.
zor::Errno addressOf(std::string_view name, sockaddr_un& address, socklen_t& length) {
    address.sun_family = AF_UNIX;
    if (name.empty() || name.size() >= sizeof address.sun_path || (name[0] != '/' && name[0] != '@'))
        return zor::Errno(EINVAL);
    name.copy(address.sun_path, name.size());
    length = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + name.size());
    if (name[0] == '@')
        address.sun_path[0] = '\0';
    else
        ++length;
    return zor::Errno();
}

FileDescriptor datagrams() {
    return FileDescriptor(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
}

/// The time within which the program has to say that it lives, where this process is the one that is watched.
std::string watchdogOfCaller() {
    const char* const time = std::getenv("WATCHDOG_USEC");
    const char* const process = std::getenv("WATCHDOG_PID");
    return time && (!process || std::to_string(::getpid()) == process) ? time : "";
}

} // namespace

Result<Notifications> Notifications::ofCaller() {
    Notifications made;
    const char* const name = std::getenv("NOTIFY_SOCKET");
    if (!name || *name == '\0')
        return made;
    sockaddr_un address{};
    socklen_t length = 0;
    zor::Errno error = addressOf(name, address, length);
    if (!error) {
        made.own_ = datagrams();
        made.manager_ = datagrams();
        if (!made.own_.valid() || !made.manager_.valid() ||
            ::connect(made.manager_.get(), reinterpret_cast<const sockaddr*>(&address), length) != 0)
            error = zor::Errno::last();
    }
    if (error)
        return std::unexpected(Failure{
            .what = withReason("the service manager's socket " + std::string(name) + " cannot be reached", error),
            .advice = "let the unit see it, or start this without NOTIFY_SOCKET in the environment"});
    made.watchdog_ = watchdogOfCaller();
    return made;
}

std::vector<std::string> Notifications::environment() const {
    std::vector<std::string> variables;
    if (areWanted())
        variables.push_back("NOTIFY_SOCKET=" + std::string(placeInside));
    if (areWanted() && !watchdog_.empty())
        variables.push_back("WATCHDOG_USEC=" + watchdog_);
    return variables;
}

std::vector<std::string> Notifications::arguments() const {
    return areWanted() ? std::vector<std::string>{"--bind", stagedSocket, placeInside} : std::vector<std::string>();
}

const char* Notifications::appear() const {
    if (!areWanted())
        return nullptr;
    sockaddr_un address{};
    socklen_t length = 0;
    const std::string path = stagedSocket;
    if (const zor::Errno error = addressOf(path, address, length)) {
        errno = error.number();
        return "bind";
    }
    if (::bind(own_.get(), reinterpret_cast<const sockaddr*>(&address), length) != 0)
        return "bind";
    return ::chmod(path.c_str(), socketMode) == 0 ? nullptr : "chmod";
}

pollfd Notifications::event() const {
    if (!waiting_.empty())
        return {.fd = manager_.get(), .events = POLLOUT, .revents = 0};
    return {.fd = own_.get(), .events = POLLIN, .revents = 0};
}

bool Notifications::pass() {
    if (!areWanted())
        return false;
    if (waiting_.empty()) {
        char message[messageBytesMax];
        // Without room for them, the kernel closes descriptors that come along.
        const ssize_t bytes = ::recv(own_.get(), message, sizeof message, 0);
        if (bytes < 0)
            return errno == EINTR;
        waiting_ = passedOnOf({message, static_cast<std::size_t>(bytes)});
        if (waiting_.empty())
            return true;
    }
    if (::send(manager_.get(), waiting_.data(), waiting_.size(), MSG_NOSIGNAL) < 0 &&
        (errno == EAGAIN || errno == EINTR))
        return false;
    waiting_.clear(); // a manager that is gone is told nothing
    return true;
}

void Notifications::passRest() {
    for (;;) {
        if (pass())
            continue;
        pollfd taking = event();
        if (waiting_.empty() || ::poll(&taking, 1, patienceMilliseconds) <= 0)
            return;
    }
}

std::string passedOnOf(std::string_view message) {
    std::string lines;
    while (!message.empty()) {
        const std::string_view line = message.substr(0, message.find('\n'));
        message.remove_prefix(std::min(line.size() + 1, message.size()));
        if (std::ranges::any_of(passedOn, [&](std::string_view name) { return line.starts_with(name); }))
            lines.append(line).append("\n");
    }
    return lines;
}

} // namespace zorvanerun
