// SPDX-License-Identifier: Apache-2.0
// Names for people's eyes: identifiers and paths are bytes that others chose.
#pragma once

#include <string>

namespace zorvane {

/// Newlines shown as \n, other control characters and bytes that are no UTF-8 as \xNN, so that a name cannot steer a
/// terminal or look like two.
[[nodiscard]] std::string printable(const std::string& text);

} // namespace zorvane
