// SPDX-License-Identifier: Apache-2.0
#include "os/LogLine.h"

#include "plist/EscapedText.h"

#include <cstdio>

namespace zor::platform {

using plist::appendEscaped;

namespace {

constexpr std::string_view cutMark = " [cut]\n";

unsigned char byteAt(std::string_view text, std::size_t position) {
    return static_cast<unsigned char>(text[position]);
}

} // namespace

std::string formatLogLine(const LogEvent& event, std::size_t bytesMax) {
    tm calendar{};
    ::gmtime_r(&event.time.tv_sec, &calendar);
    char head[96];
    std::snprintf(head, sizeof head, "%04d-%02d-%02dT%02d:%02d:%02d.%03ld+00:00 zorvaned[%d]: <%d> ",
                  calendar.tm_year + 1900, calendar.tm_mon + 1, calendar.tm_mday, calendar.tm_hour, calendar.tm_min,
                  calendar.tm_sec, event.time.tv_nsec / 1'000'000, static_cast<int>(event.pid), event.level);
    std::string line = head;
    line.reserve(line.size() + event.function.size() + event.message.size() + 3);
    appendEscaped(line, event.function);
    line += ": ";
    // No escape is shorter than what it stands for, so the rest cannot reach the line.
    appendEscaped(line, event.message.substr(0, bytesMax));
    if (line.size() < bytesMax && event.message.size() <= bytesMax) {
        line += '\n';
        return line;
    }
    std::size_t kept = bytesMax > cutMark.size() ? bytesMax - cutMark.size() : 0;
    kept = kept < line.size() ? kept : line.size();
    while (kept > 0 && kept < line.size() && (byteAt(line, kept) & 0xC0) == 0x80)
        --kept;
    line.resize(kept);
    line += cutMark;
    return line;
}

} // namespace zor::platform
