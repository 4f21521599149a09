// SPDX-License-Identifier: Apache-2.0
#include "platform/linux/LogLine.h"

#include "plist/Utf8.h"

#include <algorithm>
#include <cstdio>

namespace zor::platform {

namespace {

constexpr std::string_view cutMark = " [cut]\n";
constexpr std::string_view hexDigits = "0123456789abcdef";

unsigned char byteAt(std::string_view text, std::size_t position) {
    return static_cast<unsigned char>(text[position]);
}

/// U+0080 to U+009F steer terminals like the ones below U+0020 do.
bool isControl(char32_t character) {
    return (character < 0x20 && character != '\t') || (character >= 0x7F && character < 0xA0);
}

void appendHex(std::string& line, unsigned char byte) {
    line += "\\x";
    line += hexDigits[byte >> 4];
    line += hexDigits[byte & 0xF];
}

} // namespace

void appendEscaped(std::string& line, std::string_view text) {
    for (std::size_t i = 0; i < text.size();) {
        const plist::Utf8Character character = plist::decodeUtf8(text.substr(i));
        if (character.length > 0 && !isControl(character.codePoint)) {
            line.append(text, i, character.length);
            i += character.length;
            continue;
        }
        const std::size_t end = i + std::max<std::size_t>(character.length, 1);
        for (; i < end; ++i) {
            if (text[i] == '\n')
                line += "\\n";
            else
                appendHex(line, byteAt(text, i));
        }
    }
}

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
