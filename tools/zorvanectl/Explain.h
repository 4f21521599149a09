// SPDX-License-Identifier: Apache-2.0
// The codes that 'explain' knows.
#pragma once

#include <string>
#include <utility>
#include <vector>

namespace zorvanectl {

/// Code and meaning; the daemon's, then the findings'.
[[nodiscard]] std::vector<std::pair<std::string, std::string>> explainedCodes();

} // namespace zorvanectl
