// SPDX-License-Identifier: Apache-2.0
#include "daemon/base/Log.h"

#include <cstdio>

namespace zor {

namespace {
thread_local std::optional<std::uint32_t> provokingUserId;
}

Log::ClientScope::ClientScope(std::uint32_t userId) : outer_(provokingUserId) {
    provokingUserId = userId;
}

Log::ClientScope::~ClientScope() {
    provokingUserId = outer_;
}

bool Log::writes(int level) const {
    if (!sink_.isOpen())
        return level <= logLevelNotice;
    return sink_.level() >= level;
}

void Log::write(int level, const char* function, const char* format, ...) const {
    std::va_list arguments;
    va_start(arguments, format);
    writeText(level, function, formattedList(format, arguments));
    va_end(arguments);
}

void Log::writeText(int level, const char* function, std::string_view message) const {
    if (!writes(level))
        return;
    if (level <= logLevelError && provokingUserId && refusalGate_ && !refusalGate_(*provokingUserId))
        return;
    sink_.write(level, function, message);
}

std::string formattedList(const char* format, std::va_list arguments) {
    std::va_list again;
    va_copy(again, arguments);
    char small[512];
    const int length = std::vsnprintf(small, sizeof small, format, arguments);
    std::string text;
    if (length >= 0 && static_cast<std::size_t>(length) < sizeof small) {
        text.assign(small, static_cast<std::size_t>(length));
    } else if (length >= 0) {
        text.resize(static_cast<std::size_t>(length));
        std::vsnprintf(text.data(), text.size() + 1, format, again);
    }
    va_end(again);
    return text;
}

std::string formatted(const char* format, ...) {
    std::va_list arguments;
    va_start(arguments, format);
    std::string text = formattedList(format, arguments);
    va_end(arguments);
    return text;
}

Shown::Shown(const std::string& text) : text_(text.c_str()) {
    if (text.size() > shownBytesMax) {
        copy_ = text.substr(0, shownBytesMax);
        text_ = copy_.c_str();
    }
}

} // namespace zor
