// SPDX-License-Identifier: Apache-2.0
// The names in a directory that only root writes to. Any thread.
#pragma once

#include <expected>
#include <string>
#include <vector>

namespace zor::platform {

/// All names but "." and "..", sorted by their bytes; `directory` is a real descriptor, its offset is not used. An
/// errno when not all could be read.
[[nodiscard]] std::expected<std::vector<std::string>, int> directoryNames(int directory);
/// The same for who can do without: none when it cannot be read.
[[nodiscard]] std::vector<std::string> directoryNamesIfAny(int directory);

} // namespace zor::platform
