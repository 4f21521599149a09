// SPDX-License-Identifier: Apache-2.0
// The words that a shell may put in the place of the one that is being typed.
#pragma once

#include <CLI/CLI.hpp>
#include <span>
#include <string>

namespace zorvanectl {

/// Followed by the words of a command line up to the one that is typed, with which it ends.
inline constexpr const char* completionWord = "__complete";

/// Prints one candidate a line: the word, and after a tab what it means. No line: the shell's own, such as files. Words
/// that a shell would not take as they stand are left out, whoever chose them.
int complete(const CLI::App& app, std::span<const std::string> words);

} // namespace zorvanectl
