// SPDX-License-Identifier: Apache-2.0
// Which system unit a process belongs to, from the text of /proc/PID/cgroup. Pure function.
#pragma once

#include <string>
#include <string_view>

namespace zor::platform {

/// The first name in the process's path that is no slice: units of the system manager lie in slices only. So a unit
/// that a user's own manager started, whatever its name, is not it; what lies deeper than a system unit belongs to that
/// unit. Empty when there is none.
[[nodiscard]] std::string systemUnitInCgroups(std::string_view cgroups);

} // namespace zor::platform
