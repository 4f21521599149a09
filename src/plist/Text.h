// SPDX-License-Identifier: Apache-2.0
// UTF-8, and text of others made fit to be shown. Any thread.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string>
#include <string_view>

namespace zor::plist {

// UTF-8 as the readers, the writer and the descriptions need it. Strict: no overlong forms, no surrogates, nothing
// above U+10FFFF. Pure functions.

/// One decoded character; `length` 0 means that the bytes at this place are no UTF-8.
struct Utf8Character {
    char32_t codePoint = 0;
    std::size_t length = 0;
};

/// Decodes the first character of `text`, which must not be empty.
Utf8Character decodeUtf8(std::string_view text);
/// Appends a Unicode scalar value.
void appendUtf8(std::string& out, char32_t codePoint);
bool isUtf8(std::string_view text);

/// True when every byte is 1 to 127. The common case by far, so it is inline and looks at eight bytes at a time.
inline bool isAsciiWithoutNul(const char* bytes, std::size_t count) {
    constexpr std::uint64_t high = 0x8080808080808080U;
    constexpr std::uint64_t ones = 0x0101010101010101U;
    std::size_t at = 0;
    for (; at + 8 <= count; at += 8) {
        std::uint64_t word = 0;
        std::memcpy(&word, bytes + at, sizeof word);
        // A zero byte borrows from above and shows as a set high bit; with all bytes below 128 nothing else does.
        if (((word | (word - ones)) & high) != 0)
            return false;
    }
    for (; at < count; ++at)
        if (static_cast<signed char>(bytes[at]) <= 0)
            return false;
    return true;
}

// Text that others chose, for logs and terminals: nothing in it ends a line, steers what shows it, turns the direction
// in which it is read, or stays unseen.

/// Whether a character may be shown as it is: no control character (a tab is one), none that turns the direction of
/// writing, ends a line or is not seen. Every escaping of text asks here.
[[nodiscard]] bool isShown(char32_t character);

/// As escapes and the text of data have them.
inline constexpr std::string_view hexDigits = "0123456789abcdef";

/// A tab steers no terminal, but it can move a column of a table, or stand for its end.
enum class Tabs : std::uint8_t { stay, escaped };

/// Appends `text`: newlines as \n; other control characters, characters that turn the direction of writing, end a line
/// or are not seen, and bytes that are no UTF-8, as \xNN for each byte.
void appendEscaped(std::string& line, std::string_view text, Tabs tabs = Tabs::stay);

} // namespace zor::plist
