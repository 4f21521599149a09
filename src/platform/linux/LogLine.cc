// SPDX-License-Identifier: Apache-2.0
#include "platform/linux/LogLine.h"

#include <cstdio>

namespace zor::platform {

namespace {

constexpr std::string_view cutMark = " [cut]\n";
constexpr std::string_view hexDigits = "0123456789abcdef";

unsigned char byteAt(std::string_view text, std::size_t position) {
    return static_cast<unsigned char>(text[position]);
}

/// How long the well-formed UTF-8 sequence at `position` is; 0 where there is none.
std::size_t sequenceBytes(std::string_view text, std::size_t position) {
    const unsigned char first = byteAt(text, position);
    std::size_t count = 0;
    // The second byte's range keeps out overlong forms, surrogates and what lies above U+10FFFF.
    unsigned char secondLow = 0x80;
    unsigned char secondHigh = 0xBF;
    if (first < 0x80)
        return 1;
    if (first >= 0xC2 && first <= 0xDF) {
        count = 2;
    } else if (first >= 0xE0 && first <= 0xEF) {
        count = 3;
        secondLow = first == 0xE0 ? 0xA0 : 0x80;
        secondHigh = first == 0xED ? 0x9F : 0xBF;
    } else if (first >= 0xF0 && first <= 0xF4) {
        count = 4;
        secondLow = first == 0xF0 ? 0x90 : 0x80;
        secondHigh = first == 0xF4 ? 0x8F : 0xBF;
    }
    if (count == 0 || text.size() - position < count)
        return 0;
    if (byteAt(text, position + 1) < secondLow || byteAt(text, position + 1) > secondHigh)
        return 0;
    for (std::size_t i = 2; i < count; ++i) {
        if ((byteAt(text, position + i) & 0xC0) != 0x80)
            return 0;
    }
    return count;
}

/// U+0080 to U+009F steer terminals like the ones below U+0020 do.
bool isControl(std::string_view text, std::size_t position, std::size_t bytes) {
    const unsigned char first = byteAt(text, position);
    if (bytes == 1)
        return (first < 0x20 && first != '\t') || first == 0x7F;
    return bytes == 2 && first == 0xC2 && byteAt(text, position + 1) < 0xA0;
}

void appendHex(std::string& line, unsigned char byte) {
    line += "\\x";
    line += hexDigits[byte >> 4];
    line += hexDigits[byte & 0xF];
}

} // namespace

void appendEscaped(std::string& line, std::string_view text) {
    for (std::size_t i = 0; i < text.size();) {
        const std::size_t bytes = sequenceBytes(text, i);
        if (bytes > 0 && !isControl(text, i, bytes)) {
            line.append(text, i, bytes);
            i += bytes;
            continue;
        }
        const std::size_t end = i + (bytes == 0 ? 1 : bytes);
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
