// SPDX-License-Identifier: Apache-2.0
// The names in a directory that only root writes to. Any thread.
#pragma once

#include <string>
#include <vector>

namespace zor::platform {

/// All names but "." and "..", sorted by their bytes; `directory` is a real descriptor, its offset is not used. Empty
/// when it cannot be read.
[[nodiscard]] std::vector<std::string> directoryNames(int directory);

} // namespace zor::platform
