// SPDX-License-Identifier: Apache-2.0
// Names for people's eyes: identifiers and paths are bytes that others chose.
#pragma once

#include <string>

namespace zorvane {

/// Control characters shown as \xNN, so that a name cannot steer a terminal.
[[nodiscard]] std::string printable(const std::string& text);

} // namespace zorvane
