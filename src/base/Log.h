// SPDX-License-Identifier: Apache-2.0
// The daemon's log: the level gate, and printf formats that the compiler checks.
//
// Levels are those of the classic system log: 3 errors and refusals, 5 notable events, 7 debug traces. Levels 3 and 5
// are written also when no log could be opened (to standard error); level 7 only to an open log whose level is 7 or
// more. Any thread. Lines that a client provokes are limited for each user id while a ClientScope is open on the
// thread.
//
// Writing a line never throws: who holds a lock, or gives one back, may say so. A line for which there is no memory is
// lost, and counted.
#pragma once

#include "ipc/Protocol.h"
#include "platform/Process.h"

#include <atomic>
#include <cstdarg>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

namespace zor {

// Texts made with formats that the compiler checks. Any thread.

/// Formats into a string.
std::string formatted(const char* format, ...) __attribute__((format(printf, 1, 2)));
std::string formattedList(const char* format, std::va_list arguments) __attribute__((format(printf, 1, 0)));

/// The subject of a thread's log lines, for sinks that keep more of a line than its text. Costs nothing until a line is
/// written; each thread has its own.
struct LogSubject {
    std::optional<ErrorCode> code = {};
    /// Fields of the request; empty outside of one.
    using Take = std::function<void(std::string_view name, std::string_view value)>;
    using Describe = std::function<void(const Take&)>;
    const Describe* request = nullptr;

    /// The subject of this thread, now.
    [[nodiscard]] static const LogSubject& current();
    /// A copy of the request's fields, for work that goes on after the request. Empty outside of one.
    [[nodiscard]] static Describe keptRequest();
};

/// While open, lines of this thread are about an error of this code.
class LogCodeScope {
public:
    explicit LogCodeScope(ErrorCode code);
    ~LogCodeScope();
    LogCodeScope(const LogCodeScope&) = delete;
    LogCodeScope& operator=(const LogCodeScope&) = delete;
};

/// While open, lines of this thread belong to a request, which outlives this; to none when `describe` is empty.
class LogRequestScope {
public:
    explicit LogRequestScope(const LogSubject::Describe& describe);
    ~LogRequestScope();
    LogRequestScope(const LogRequestScope&) = delete;
    LogRequestScope& operator=(const LogRequestScope&) = delete;
};

/// Whether this code also comes up on a healthy device: a client asks for a thing that is not there, or that it may not
/// have.
[[nodiscard]] bool isClientsMistake(ErrorCode code);

inline constexpr int logLevelError = 3;
inline constexpr int logLevelNotice = 5;
inline constexpr int logLevelDebug = 7;

/// A string that a client may have chosen, in a log line: cut here, so that a line stays readable.
inline constexpr std::size_t shownBytesMax = 1024;

class Log {
public:
    /// Decides whether the line of a refusal that a user id provoked, of so many bytes, is written; may write the line
    /// that says how many were not.
    using RefusalGate = std::function<bool(std::uint32_t userId, std::size_t bytes)>;

    explicit Log(platform::PlatformLog& sink) : sink_(sink) {}
    Log(const Log&) = delete;
    Log& operator=(const Log&) = delete;

    void limitRefusals(RefusalGate gate) { refusalGate_ = std::move(gate); }

    [[nodiscard]] bool writes(int level) const {
        return sink_.isOpen() ? level <= sink_.level() : level <= logLevelNotice;
    }
    void write(int level, const char* function, const char* format, ...) const noexcept
        __attribute__((format(printf, 4, 5)));
    void writeList(int level, const char* function, const char* format, std::va_list arguments) const noexcept
        __attribute__((format(printf, 4, 0)));
    void writeText(int level, const char* function, std::string_view message) const noexcept;

    /// Lines that were lost here for want of memory, since the start.
    [[nodiscard]] std::uint64_t linesLost() const { return linesLost_.load(std::memory_order_relaxed); }

    /// While open, level-3 lines of this thread count as provoked by `userId`.
    class ClientScope {
    public:
        explicit ClientScope(std::uint32_t userId);
        ~ClientScope();
        ClientScope(const ClientScope&) = delete;
        ClientScope& operator=(const ClientScope&) = delete;

    private:
        std::optional<std::uint32_t> outer_;
    };

private:
    platform::PlatformLog& sink_;
    RefusalGate refusalGate_;
    mutable std::atomic<std::uint64_t> linesLost_{0};
};

/// The text that "%s" prints for an object: at most shownBytesMax bytes; an absent one is "(null)". Copies only what it
/// must cut. Lives as long as the full expression it is written in.
class Shown {
public:
    Shown(const char* text) : text_(text ? text : absent) {}
    Shown(const std::string& text) { show(text); }
    Shown(const std::string* text) : text_(absent) {
        if (text)
            show(*text);
    }
    Shown(const std::optional<std::string>& text) : Shown(text ? &*text : nullptr) {}
    Shown(const Shown& other) : copy_(other.copy_), text_(copy_.empty() ? other.text_ : copy_.c_str()) {}
    Shown& operator=(const Shown&) = delete;
    [[nodiscard]] const char* text() const { return text_; }

private:
    static constexpr const char* absent = "(null)";
    void show(const std::string& text);

    std::string copy_;
    const char* text_ = absent;
};
#define ZOR_SHOWN(object) (::zor::Shown(object).text())

} // namespace zor

/// Writes a line under the current function's name; the arguments are evaluated only when the line is written.
#define ZOR_LOG(log, level, ...)                                                                                       \
    do {                                                                                                               \
        if ((log).writes(level))                                                                                       \
            (log).write(level, __func__, __VA_ARGS__);                                                                 \
    } while (false)
