// SPDX-License-Identifier: Apache-2.0
// Errors of the daemon's own domain, and Result: the value of an operation, or its ZORError. An operation logs an
// error or hands it on, as its description says. A code, once given out, keeps its meaning: clients get it as
// "ReplyError".
#pragma once

#include "base/ErrorCode.h"
#include "base/Log.h"
#include "base/Try.h"
#include "platform/Errno.h"

#include <cstdint>
#include <expected>
#include <memory>
#include <optional>
#include <string>
#include <utility>

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
    /// Whether its POSIX number, or that of what caused it, is one of those.
    [[nodiscard]] bool isOwnShortage() const;
    /// The number that a client gets as "ReplyError": the code, sign-extended from 32 bits. There 1 is success, so
    /// EPERM leaves as EACCES.
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

enum class LogFlag { no, yes };

/// An error of ZORErrorDomain. With LogFlag::yes exactly one level-3 line is written, here and nowhere else.
/// `underlying` is copied; nullptr when there is no cause.
ZORError makeError(const Log& log, Here here, ErrorCode code, const ZORError* underlying, LogFlag flag,
                   const char* format, ...) __attribute__((format(printf, 6, 7)));

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

} // namespace zor
