// SPDX-License-Identifier: Apache-2.0
#include "os/NotifySocket.h"

#include "os/FileDescriptor.h"

#include <cerrno>
#include <charconv>
#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>

namespace zor::platform {

NotifySocket NotifySocket::ofEnvironment() {
    const char* const address = ::secure_getenv("NOTIFY_SOCKET");
    return NotifySocket(address ? address : "");
}

std::optional<std::chrono::microseconds> NotifySocket::watchdogOfEnvironment() {
    const auto number = [](const char* name) {
        const char* const text = ::secure_getenv(name);
        std::uint64_t value = 0;
        if (text)
            (void)std::from_chars(text, text + std::strlen(text), value);
        return value;
    };
    const std::uint64_t process = number("WATCHDOG_PID");
    const std::uint64_t patience = number("WATCHDOG_USEC");
    if (patience == 0 || (process != 0 && process != static_cast<std::uint64_t>(::getpid())))
        return std::nullopt;
    return std::chrono::microseconds(patience);
}

int NotifySocket::send(std::string_view state) const {
    if (address_.empty())
        return 0;
    sockaddr_un target{};
    if ((address_.front() != '/' && address_.front() != '@') || address_.size() >= sizeof target.sun_path)
        return EINVAL;
    target.sun_family = AF_UNIX;
    std::memcpy(target.sun_path, address_.data(), address_.size());
    if (address_.front() == '@')
        target.sun_path[0] = '\0';
    const auto targetBytes = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + address_.size());
    const FileDescriptor socket(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    if (!socket.valid())
        return errno;
    // A manager that does not read must not hold up a daemon that is ready.
    const timeval patience{.tv_sec = 5, .tv_usec = 0};
    (void)::setsockopt(socket.get(), SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience);
    for (;;) {
        const ssize_t sent = ::sendto(socket.get(), state.data(), state.size(), MSG_NOSIGNAL,
                                      reinterpret_cast<const sockaddr*>(&target), targetBytes);
        if (sent >= 0)
            return 0;
        if (errno != EINTR)
            return errno;
    }
}

} // namespace zor::platform
