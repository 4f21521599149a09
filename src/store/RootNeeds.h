// SPDX-License-Identifier: Apache-2.0
// The things that a system root has to hold before a daemon can serve it, and which the daemon does not make: it
// belongs to whoever builds the device. Immutable; any thread.
#pragma once

#include "os/SystemRoot.h"

#include <array>
#include <string>
#include <string_view>
#include <sys/types.h>
#include <vector>

namespace zor {

struct RootDirectory {
    std::string_view path; // from the root, without a leading slash
    mode_t mode;
    /// Belongs to the installer, else to root.
    bool isInstallers;
};

/// Parents before children.
inline constexpr std::array<RootDirectory, 4> rootDirectories = {{
    {"private", 0755, false},
    {"private/var", 0755, false},
    {"private/var/brevad", 0755, true},
    {"tmp", 01777, false},
}};

/// Those of them, and the user database, that are not there. An entry that cannot be looked at counts as there: the
/// daemon says later what it failed on.
[[nodiscard]] std::vector<std::string> missingOf(const platform::SystemRoot& root);
/// One line about them, with the command that makes them.
[[nodiscard]] std::string lineAboutMissing(const platform::SystemRoot& root, const std::vector<std::string>& missing);
/// That command.
[[nodiscard]] std::string initCommand(const platform::SystemRoot& root);

} // namespace zor
