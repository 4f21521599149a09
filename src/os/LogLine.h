// SPDX-License-Identifier: Apache-2.0
// The form of one log line: 2026-11-24T10:15:30.123+00:00 zorvaned[PID]: <LEVEL> FUNCTION: MESSAGE
//
// One event is one line, whatever a client put into a string that the message quotes. Any thread.
#pragma once

#include <cstddef>
#include <ctime>
#include <string>
#include <string_view>
#include <sys/types.h>

namespace zor::platform {

struct LogEvent {
    timespec time{};
    pid_t pid = 0;
    int level = 0;
    std::string_view function;
    std::string_view message;
};

/// The whole line with its newline, at most `bytesMax` long: what is too much is cut off at the end, and the line says
/// so.
[[nodiscard]] std::string formatLogLine(const LogEvent& event, std::size_t bytesMax);

} // namespace zor::platform
