// SPDX-License-Identifier: Apache-2.0
#include "service/PassedSockets.h"

#include <charconv>
#include <cstdlib>
#include <fcntl.h>
#include <optional>
#include <unistd.h>

namespace zor::platform {

namespace {

/// More than the daemon knows names for; a number beyond it is a mistake of the environment.
constexpr int socketsMax = 64;

std::optional<int> parseNumber(std::string_view text) {
    int number = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
    if (error != std::errc() || end != text.data() + text.size() || text.empty())
        return std::nullopt;
    return number;
}

std::string variable(const char* name) {
    const char* const value = ::secure_getenv(name);
    return value ? value : "";
}

} // namespace

PassedSockets PassedSockets::of(const Variables& variables, int firstDescriptor) {
    PassedSockets passed;
    const auto pid = parseNumber(variables.pid);
    const auto count = parseNumber(variables.count);
    if (!pid || *pid != ::getpid() || !count || *count < 0 || *count > socketsMax)
        return passed;
    std::string_view rest = variables.names;
    for (int i = 0; i < *count; ++i) {
        const std::size_t colon = rest.find(':');
        const std::string_view name = rest.substr(0, colon);
        rest = colon == std::string_view::npos ? std::string_view() : rest.substr(colon + 1);
        const int fd = firstDescriptor + i;
        if (::fcntl(fd, F_SETFD, FD_CLOEXEC) == 0)
            passed.sockets_.push_back({.name = std::string(name), .socket = FileDescriptor(fd)});
    }
    return passed;
}

PassedSockets PassedSockets::ofEnvironment() {
    const Variables variables{
        .pid = variable("LISTEN_PID"), .count = variable("LISTEN_FDS"), .names = variable("LISTEN_FDNAMES")};
    for (const char* const name : {"LISTEN_PID", "LISTEN_FDS", "LISTEN_FDNAMES"})
        ::unsetenv(name);
    return of(variables);
}

FileDescriptor PassedSockets::take(std::string_view name) {
    for (Passed& passed : sockets_) {
        if (passed.socket.valid() && passed.name == name)
            return std::move(passed.socket);
    }
    return {};
}

} // namespace zor::platform
