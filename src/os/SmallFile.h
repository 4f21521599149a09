// SPDX-License-Identifier: Apache-2.0
// Reading a file of bounded size whole. Any thread.
#pragma once

#include <cstddef>
#include <expected>
#include <string>

namespace zor::platform {

/// Everything from the descriptor's offset on. EFBIG when that is more than `bytesMax`, EINVAL when it is no regular
/// file.
[[nodiscard]] std::expected<std::string, int> readSmallFile(int fd, std::size_t bytesMax);

} // namespace zor::platform
