// SPDX-License-Identifier: Apache-2.0
// Texts made of other texts. Any thread.
#pragma once

#include <cstdarg>
#include <optional>
#include <string>
#include <string_view>

namespace zor {

// Texts made with formats that the compiler checks. Any thread.

/// Formats into a string.
std::string formatted(const char* format, ...) __attribute__((format(printf, 1, 2)));
std::string formattedList(const char* format, std::va_list arguments) __attribute__((format(printf, 1, 0)));

} // namespace zor

namespace zor::platform {

// Turns any string into one path component and back: for names that a client chose and a directory has to hold.

/// The longest name a directory can hold. An encoded string that is longer has no file.
inline constexpr std::size_t componentBytesMax = 255;

/// Letters, digits, "-", "_" and "." stay; every other byte, and a "." in the first place, becomes "%" and two
/// upper-case hexadecimal digits. Different strings give different names, none of them hidden, none with a slash. An
/// empty string stays empty, which is no name.
[[nodiscard]] std::string percentEncode(std::string_view text);

/// The string that percentEncode turned into `component`; nothing when it made no such name.
[[nodiscard]] std::optional<std::string> percentDecode(std::string_view component);

} // namespace zor::platform
