// SPDX-License-Identifier: Apache-2.0
#include "base/Log.h"

#include "plist/Text.h"

#include <cstdio>
#include <utility>
#include <vector>

namespace zor {

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

namespace {

thread_local LogSubject subject;

} // namespace

const LogSubject& LogSubject::current() {
    return subject;
}

LogSubject::Describe LogSubject::keptRequest() {
    if (!subject.request)
        return {};
    std::vector<std::pair<std::string, std::string>> fields;
    (*subject.request)([&](std::string_view name, std::string_view value) { fields.emplace_back(name, value); });
    return [fields = std::move(fields)](const Take& take) {
        for (const auto& [name, value] : fields)
            take(name, value);
    };
}

LogCodeScope::LogCodeScope(ErrorCode code) {
    subject.code = code;
}

LogCodeScope::~LogCodeScope() {
    subject.code.reset();
}

LogRequestScope::LogRequestScope(const LogSubject::Describe& describe) {
    subject.request = describe ? &describe : nullptr;
}

LogRequestScope::~LogRequestScope() {
    subject.request = nullptr;
}

bool isClientsMistake(ErrorCode code) {
    switch (code) {
    case ErrorCode::success:
    case ErrorCode::invalidObject:
    case ErrorCode::identifierMissing:
    case ErrorCode::notFound:
    case ErrorCode::replacedByItself:
    case ErrorCode::classesDiffer:
    case ErrorCode::infoKeyNotFound:
    case ErrorCode::alreadyExists:
    case ErrorCode::valueNotAllowed:
    case ErrorCode::cacheInputInvalid:
    case ErrorCode::notEntitled:
    case ErrorCode::usersDiffer:
    case ErrorCode::entitlementCountsDiffer:
    case ErrorCode::lockedAndNotRetried:
        return true;
    default:
        return false;
    }
}

namespace {

thread_local std::optional<std::uint32_t> provokingUserId;

/// Time, process and level, before the function's name.
constexpr std::size_t lineHeadBytes = 64;

/// The bytes of a line: an escape is up to four times as long as the character that it stands for.
std::size_t bytesInLog(const char* function, std::string_view message) {
    std::string shown = function;
    plist::appendEscaped(shown, message);
    return lineHeadBytes + shown.size();
}

} // namespace

Log::ClientScope::ClientScope(std::uint32_t userId) : outer_(provokingUserId) {
    provokingUserId = userId;
}

Log::ClientScope::~ClientScope() {
    provokingUserId = outer_;
}

void Log::write(int level, const char* function, const char* format, ...) const noexcept {
    std::va_list arguments;
    va_start(arguments, format);
    writeList(level, function, format, arguments);
    va_end(arguments);
}

void Log::writeList(int level, const char* function, const char* format, std::va_list arguments) const noexcept {
    try {
        writeText(level, function, formattedList(format, arguments));
    } catch (...) {
        linesLost_.fetch_add(1, std::memory_order_relaxed);
    }
}

void Log::writeText(int level, const char* function, std::string_view message) const noexcept {
    if (!writes(level))
        return;
    try {
        if (level <= logLevelError && provokingUserId && refusalGate_ &&
            !refusalGate_(*provokingUserId, bytesInLog(function, message)))
            return;
        sink_.write(level, function, message);
    } catch (...) {
        linesLost_.fetch_add(1, std::memory_order_relaxed);
    }
}

void Shown::show(const std::string& text) {
    text_ = text.c_str();
    if (text.size() > shownBytesMax) {
        copy_ = text.substr(0, shownBytesMax);
        text_ = copy_.c_str();
    }
}

} // namespace zor
