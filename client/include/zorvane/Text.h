// SPDX-License-Identifier: Apache-2.0
// Names for people's eyes: identifiers and paths are bytes that others chose.
#pragma once

#include <string>

namespace zorvane {

/// Newlines shown as \n; other control characters, characters that turn the direction of writing or are not seen, and
/// bytes that are no UTF-8, as \xNN for each byte: so that a name cannot steer a terminal, or look like two or another.
[[nodiscard]] std::string printable(const std::string& text);

} // namespace zorvane
