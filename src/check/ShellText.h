// SPDX-License-Identifier: Apache-2.0
// Command lines for people to type.
#pragma once

#include <string>
#include <string_view>

namespace zor::check {

/// One word of a shell's, whatever bytes it holds; nothing in it steers a terminal.
[[nodiscard]] std::string shellQuoted(std::string_view text);

/// A program of the system's that takes "--root", for this root.
[[nodiscard]] std::string programFor(std::string_view program, std::string_view root);

/// `command`, in this directory and nowhere else: the directory lies where a client may put a link in its place
/// meanwhile, and root types this.
[[nodiscard]] std::string inDirectory(std::string_view directory, std::string_view command);

} // namespace zor::check
