// SPDX-License-Identifier: Apache-2.0
// Text that others chose, for logs and terminals: nothing in it ends a line or steers what shows it.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

namespace zor::plist {

/// A tab steers no terminal, but it can move a column of a table, or stand for its end.
enum class Tabs : std::uint8_t { stay, escaped };

/// Appends `text`: newlines as \n, other control characters and bytes that are no UTF-8 as \xNN.
void appendEscaped(std::string& line, std::string_view text, Tabs tabs = Tabs::stay);

} // namespace zor::plist
