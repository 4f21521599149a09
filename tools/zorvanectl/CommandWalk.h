// SPDX-License-Identifier: Apache-2.0
// The place in the description of the commands that a command line, not finished or not right, has come to. Pure
// functions.
#pragma once

#include <CLI/CLI.hpp>
#include <cstddef>
#include <map>
#include <optional>
#include <span>
#include <string>
#include <vector>

namespace zorvanectl {

struct Place {
    const CLI::App* command = nullptr;
    /// The option that waits for its value.
    const CLI::Option* awaiting = nullptr;
    /// Words that were neither commands nor options.
    std::size_t positionals = 0;
    bool optionsHaveEnded = false;
    /// The options that were given, by their long names without dashes.
    std::map<std::string, std::string> values;
    /// The mistake in the first word that is known nowhere, with the nearest one that is.
    std::optional<std::string> mistake;
};
[[nodiscard]] Place placeAfter(const CLI::App& app, std::span<const std::string> words);

/// Those of a command and of the ones above it, which it takes, too; without positionals.
[[nodiscard]] std::vector<const CLI::Option*> optionsOf(const CLI::App& command);
/// The positional that the next word is for; nullptr when there is none.
[[nodiscard]] const CLI::Option* nextPositional(const Place& place);
/// Those that are not hidden.
[[nodiscard]] std::vector<const CLI::App*> subcommandsOf(const CLI::App& command);
/// "zorvanectl info get".
[[nodiscard]] std::string fullNameOf(const CLI::App& command);
/// Without dashes.
[[nodiscard]] std::string nameOf(const CLI::Option& option);

/// "; is 'list' meant?", or nothing where nothing is near.
[[nodiscard]] std::string suggestion(const std::string& word, const std::vector<std::string>& known);

} // namespace zorvanectl
