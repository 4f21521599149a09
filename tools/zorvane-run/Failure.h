// SPDX-License-Identifier: Apache-2.0
// Why this program could not start another one: what happened and where, and what to do about it.
#pragma once

#include "platform/Errno.h"
#include "zorvane/Text.h"

#include <expected>
#include <string>

namespace zorvanerun {

struct Failure {
    /// One sentence for people, without a full stop.
    std::string what;
    std::string advice;
};

template <typename T>
using Result = std::expected<T, Failure>;

/// "WHAT: what the error means".
[[nodiscard]] std::string withReason(const std::string& what, zor::Errno error);
using zorvane::printable;

// Exit codes of the program's own; any other is that of the program it ran, 128 and the number for a signal.
inline constexpr int exitDone = 0;
inline constexpr int exitFailure = 125;
inline constexpr int exitCannotExecute = 126;
inline constexpr int exitNotFound = 127;

} // namespace zorvanerun
