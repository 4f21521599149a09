// SPDX-License-Identifier: Apache-2.0
// The two ways in which an operation fails: with an error of the daemon's own domain, or with an exception that its
// boundary turns into one.
//
// Result is the value of an operation, or its ZORError. An operation logs an error or hands it on, as its description
// says. A code, once given out, keeps its meaning: clients get it as "ReplyError".
#pragma once

#include "base/Log.h"
#include "ipc/Protocol.h"
#include "platform/Device.h"
#include "platform/Errno.h"

#include <cstdarg>
#include <cstdint>
#include <exception>
#include <expected>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace zor {

enum class ErrorDomain : std::uint8_t { zor, posix };

/// The place at which an error is made.
struct Here {
    const char* function;
    int line;
};
#define ZOR_HERE (::zor::Here{__func__, __LINE__})

class ZORError {
public:
    ZORError(Here here, ErrorDomain domain, int code, std::optional<std::string> description,
             std::shared_ptr<const ZORError> underlying = nullptr)
        : domain_(domain), code_(code), line_(here.line), function_(here.function),
          description_(std::move(description)), underlying_(std::move(underlying)) {}

    [[nodiscard]] ErrorDomain domain() const { return domain_; }
    [[nodiscard]] const char* domainName() const { return domain_ == ErrorDomain::zor ? "ZORErrorDomain" : "POSIX"; }
    [[nodiscard]] int code() const { return code_; }
    [[nodiscard]] const std::optional<std::string>& description() const { return description_; }
    [[nodiscard]] const ZORError* underlying() const { return underlying_.get(); }
    [[nodiscard]] const char* functionName() const { return function_; }
    [[nodiscard]] int sourceFileLine() const { return line_; }

    [[nodiscard]] bool is(ErrorCode code) const {
        return domain_ == ErrorDomain::zor && code_ == static_cast<int>(code);
    }
    [[nodiscard]] bool isPosix(int number) const { return domain_ == ErrorDomain::posix && code_ == number; }
    /// Whether its POSIX number, or its cause's, is a shortage of this process or system (platform/Errno.h).
    [[nodiscard]] bool isOwnShortage() const;
    /// The number that a client gets as "ReplyError": the code, sign-extended from 32 bits. EPERM leaves as EACCES, and
    /// an errno whose number is one of the daemon's codes with 1000 added.
    [[nodiscard]] ErrorCode replyCode() const;
    /// For a line: domain, code and description, without the cause.
    [[nodiscard]] std::string text() const;

private:
    ErrorDomain domain_;
    int code_;
    int line_;
    const char* function_;
    std::optional<std::string> description_;
    std::shared_ptr<const ZORError> underlying_;
};

/// A code, and the line that gives it.
struct CodeOfLine {
    ErrorCode code;
    int line;
    CodeOfLine(ErrorCode given, int at = __builtin_LINE()) : code(given), line(at) {}
};

/// Says what went wrong in one operation, under its name: makes its errors and writes its lines. A value; any thread.
class Reporter {
public:
    /// `function` lives for ever.
    Reporter(const Log& log, const char* function) : log_(log), function_(function) {}

    /// An error of ZORErrorDomain. Exactly one level-3 line is written, here and nowhere else.
    ZORError error(CodeOfLine code, const char* format, ...) const __attribute__((format(printf, 3, 4)));
    /// The same, with a copy of its cause; nullptr: there is none.
    ZORError error(CodeOfLine code, const ZORError* cause, const char* format, ...) const
        __attribute__((format(printf, 4, 5)));
    /// The same without its line, for one that a healthy device meets all the time: a caller that minds it writes the
    /// line (logError).
    [[nodiscard]] ZORError unlogged(CodeOfLine code, const char* format, ...) const
        __attribute__((format(printf, 3, 4)));
    void write(int level, const char* format, ...) const noexcept __attribute__((format(printf, 3, 4)));

private:
    [[nodiscard]] ZORError make(CodeOfLine code, const ZORError* cause, const char* format,
                                std::va_list arguments) const __attribute__((format(printf, 4, 0)));

    const Log& log_;
    const char* const function_;
};

/// An error of the POSIX domain; never logs.
ZORError posixError(Here here, Errno error, const char* format, ...) __attribute__((format(printf, 3, 4)));

/// The level-3 line of an error that was made without one.
void logError(const Log& log, const ZORError& error);

template <typename T>
class [[nodiscard]] Result : public std::expected<T, ZORError> {
public:
    using std::expected<T, ZORError>::expected;
    Result(ZORError error) : std::expected<T, ZORError>(std::unexpect, std::move(error)) {}
};

template <>
class [[nodiscard]] Result<void> : public std::expected<void, ZORError> {
public:
    using std::expected<void, ZORError>::expected;
    Result(ZORError error) : std::expected<void, ZORError>(std::unexpect, std::move(error)) {}
};

template <typename T>
ZORError takeError(Result<T>& result) {
    return std::move(result).error();
}

// Exceptions of this daemon, and the boundary at which an operation turns one into error 40.
//
// An exception means that something happened which the code has no road for: memory ran out, an invariant of a library
// was broken. It is caught once, at the boundary of the operation; what the operation holds is released by unwinding.
// Only std::exception and what derives from it counts; anything else passes through and is nobody's to swallow.

/// The functions on the calling thread's stack, innermost first.
std::vector<std::string> callStackSymbols();

class ZORException : public std::exception {
public:
    ZORException(std::string name, std::string reason);
    [[nodiscard]] const char* what() const noexcept override { return description_.c_str(); }
    [[nodiscard]] const std::string& name() const { return name_; }
    [[nodiscard]] const std::string& reason() const { return reason_; }
    [[nodiscard]] const std::vector<std::string>& callStack() const { return callStack_; }

private:
    std::string name_;
    std::string reason_;
    std::string description_;
    std::vector<std::string> callStack_;
};

class ExceptionBoundary {
public:
    ExceptionBoundary(const Log& log, const platform::InternalBuildQuery& internalBuild,
                      platform::CrashAnnotation& crash)
        : log_(log), internalBuild_(internalBuild), crash_(crash) {}

    /// Runs `body`; an exception becomes error 40, logged under `here`. On internal builds the process ends instead.
    template <typename Body>
    auto run(Here here, Body&& body) -> decltype(body()) {
        try {
            return body();
        } catch (const std::exception& exception) {
            return caught(here, exception);
        }
    }

    /// Error 40 for an exception, built and logged; ends the process on internal builds.
    ZORError caught(Here here, const std::exception& exception);

private:
    [[noreturn]] void reportFatal(const std::exception& exception);

    const Log& log_;
    const platform::InternalBuildQuery& internalBuild_;
    platform::CrashAnnotation& crash_;
};

} // namespace zor
