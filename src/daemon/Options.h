// SPDX-License-Identifier: Apache-2.0
// The daemon's command line.
#pragma once

#include <cstddef>
#include <expected>
#include <optional>
#include <string>

namespace zor {

struct DaemonOptions {
    std::string rootDirectory = "/";
    bool foreground = false;
    int logLevel = 5;
    bool forgetBoot = false;
    /// Containers that one user may have; see StoreLimits.
    std::optional<std::size_t> containersPerUser;
};

/// Why the daemon does not start from this command line: a text to show and the exit status (0 for --help and
/// --version).
struct OptionsEnd {
    std::string text;
    int exitStatus = 0;
};

[[nodiscard]] std::expected<DaemonOptions, OptionsEnd> parseDaemonOptions(int argumentCount, char** arguments);

} // namespace zor
