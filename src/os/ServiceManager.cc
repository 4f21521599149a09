// SPDX-License-Identifier: Apache-2.0
#include "os/ServiceManager.h"

#include "base/Log.h"
#include "os/FileDescriptor.h"
#include "plist/Text.h"

#include <cerrno>
#include <charconv>
#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <optional>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <sys/un.h>
#include <syslog.h>
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

Errno NotifySocket::send(std::string_view state) const {
    if (address_.empty())
        return Errno();
    sockaddr_un target{};
    if ((address_.front() != '/' && address_.front() != '@') || address_.size() >= sizeof target.sun_path)
        return Errno(EINVAL);
    target.sun_family = AF_UNIX;
    std::memcpy(target.sun_path, address_.data(), address_.size());
    if (address_.front() == '@')
        target.sun_path[0] = '\0';
    const auto targetBytes = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + address_.size());
    const FileDescriptor socket(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    if (!socket.valid())
        return Errno::last();
    // A manager that does not read must not hold up a daemon that is ready.
    const timeval patience{.tv_sec = 5, .tv_usec = 0};
    (void)::setsockopt(socket.get(), SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience);
    for (;;) {
        const ssize_t sent = ::sendto(socket.get(), state.data(), state.size(), MSG_NOSIGNAL,
                                      reinterpret_cast<const sockaddr*>(&target), targetBytes);
        if (sent >= 0)
            return Errno();
        if (errno != EINTR)
            return Errno::last();
    }
}

namespace {

constexpr const char* journalSocket = "/run/systemd/journal/socket";

/// A newline ends a field, so what clients chose has none.
void addField(std::string& entry, std::string_view name, std::string_view value) {
    entry += name;
    entry += '=';
    plist::appendEscaped(entry, value);
    entry += '\n';
}

/// The work that a healthy device does all day is no error there, whatever its level in the log file: that a client
/// asked for what is not there, or for what it may not have.
int priorityOf(int level, const LogSubject& subject) {
    if (level != LOG_ERR)
        return level;
    if (subject.code)
        return isClientsMistake(*subject.code) ? LOG_NOTICE : LOG_ERR;
    return subject.request ? LOG_WARNING : LOG_ERR;
}

} // namespace

Journal Journal::at(const std::string& path) {
    FileDescriptor socket(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (!socket.valid() || path.size() >= sizeof address.sun_path)
        return {};
    std::memcpy(address.sun_path, path.data(), path.size());
    if (::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0)
        return {};
    return Journal(std::move(socket));
}

Journal Journal::ofEnvironment(int standardError) {
    const char* const stream = ::secure_getenv("JOURNAL_STREAM");
    struct stat status{};
    if (!stream || ::fstat(standardError, &status) != 0 ||
        std::to_string(status.st_dev) + ":" + std::to_string(status.st_ino) != stream)
        return {};
    return at(journalSocket);
}

bool Journal::write(const JournalLine& line) const {
    const LogSubject& subject = LogSubject::current();
    std::string entry;
    addField(entry, "PRIORITY", std::to_string(priorityOf(line.level, subject)));
    addField(entry, "SYSLOG_IDENTIFIER", "zorvaned");
    addField(entry, "CODE_FUNC", line.function);
    addField(entry, "ZORVANE_LEVEL", std::to_string(line.level));
    if (subject.code)
        addField(entry, "ZORVANE_CODE", std::to_string(static_cast<std::int64_t>(*subject.code)));
    if (subject.request)
        (*subject.request)([&](std::string_view name, std::string_view value) { addField(entry, name, value); });
    addField(entry, "MESSAGE", line.message);
    return ::send(socket_.get(), entry.data(), entry.size(), MSG_NOSIGNAL) >= 0;
}

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
