// SPDX-License-Identifier: Apache-2.0
// Text that others chose, for logs and terminals: nothing in it ends a line, steers what shows it, turns the direction
// in which it is read, or stays unseen.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

namespace zor::plist {

/// Whether a character may be shown as it is: no control character (a tab is one), none that turns the direction of
/// writing, ends a line or is not seen. Every escaping of text asks here.
[[nodiscard]] bool isShown(char32_t character);

/// A tab steers no terminal, but it can move a column of a table, or stand for its end.
enum class Tabs : std::uint8_t { stay, escaped };

/// Appends `text`: newlines as \n; other control characters, characters that turn the direction of writing, end a line
/// or are not seen, and bytes that are no UTF-8, as \xNN for each byte.
void appendEscaped(std::string& line, std::string_view text, Tabs tabs = Tabs::stay);

} // namespace zor::plist
