// SPDX-License-Identifier: Apache-2.0
// Texts made with formats that the compiler checks. Any thread.
#pragma once

#include <cstdarg>
#include <string>

namespace zor {

/// Formats into a string.
std::string formatted(const char* format, ...) __attribute__((format(printf, 1, 2)));
std::string formattedList(const char* format, std::va_list arguments) __attribute__((format(printf, 1, 0)));

} // namespace zor
