// SPDX-License-Identifier: Apache-2.0
// The subject of a thread's log lines: an error's code, and the request that provoked them. For sinks that keep
// more of a line than its text. Costs nothing until a line is written; each thread has its own.
#pragma once

#include "base/ErrorCode.h"

#include <functional>
#include <optional>
#include <string_view>

namespace zor {

struct LogSubject {
    std::optional<ErrorCode> code = {};
    /// Fields of the request; empty outside of one.
    using Take = std::function<void(std::string_view name, std::string_view value)>;
    const std::function<void(const Take&)>* request = nullptr;

    /// The subject of this thread, now.
    [[nodiscard]] static const LogSubject& current();
};

/// While open, lines of this thread are about an error of this code.
class LogCodeScope {
public:
    explicit LogCodeScope(ErrorCode code);
    ~LogCodeScope();
    LogCodeScope(const LogCodeScope&) = delete;
    LogCodeScope& operator=(const LogCodeScope&) = delete;
};

/// While open, lines of this thread belong to a request, which outlives this.
class LogRequestScope {
public:
    explicit LogRequestScope(const std::function<void(const LogSubject::Take&)>& describe);
    ~LogRequestScope();
    LogRequestScope(const LogRequestScope&) = delete;
    LogRequestScope& operator=(const LogRequestScope&) = delete;
};

/// Whether a client that asks for what is not there, or for what it may not have, comes to this code on a healthy
/// device.
[[nodiscard]] bool isClientsMistake(ErrorCode code);

} // namespace zor
