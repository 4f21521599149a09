// SPDX-License-Identifier: Apache-2.0
// The command line, as a value.
#pragma once

#include <cstdint>
#include <expected>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zorvanerun {

/// Which network the program has: none but a loopback of its own, or the host's.
enum class Network : std::uint8_t { none, host };
/// "none" or "host".
[[nodiscard]] const char* networkName(Network network);
/// The network of that name.
[[nodiscard]] std::optional<Network> networkNamed(std::string_view name);

struct Options {
    std::string root = "/";
    std::string identifier;
    std::uint32_t user = 0;
    /// As it was given: a number or a name.
    std::string userText;
    // Named by hand; none: all that are registered.
    std::vector<std::string> applicationGroups;
    std::vector<std::string> systemGroups;
    /// The owner of the system container, where one is asked for by hand.
    std::optional<std::string> systemContainer;
    /// Directories that the program may read besides the system's own: its code, for instance.
    std::vector<std::string> readOnly;
    /// "NAME=VALUE" each, for the program; none of a name that means something on the way there.
    std::vector<std::string> environment;
    Network network = Network::none;
    std::string bubblewrap = "/usr/bin/bwrap";
    bool dryRun = false;
    /// Wait for as long as the daemon keeps the program from being started.
    bool wait = false;
    bool json = false;
    /// The program and its arguments; never empty.
    std::vector<std::string> command;
};

/// The words to say instead of running, and the exit code for them: a whole text, or what is wrong.
struct OptionsEnd {
    std::string text;
    int exitCode = 0;
};

[[nodiscard]] std::expected<Options, OptionsEnd> parseOptions(int argumentCount, char** arguments);

} // namespace zorvanerun
