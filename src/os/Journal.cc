// SPDX-License-Identifier: Apache-2.0
#include "os/Journal.h"

#include "base/LogSubject.h"
#include "plist/Text.h"

#include <cstdlib>
#include <cstring>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <syslog.h>

namespace zor::platform {

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

} // namespace zor::platform
