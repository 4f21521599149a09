// SPDX-License-Identifier: Apache-2.0
// Users as people name them on a command line.
#pragma once

#include "os/SystemRoot.h"

#include <cstdint>
#include <expected>
#include <string>

namespace zor::platform {

/// A user id as it stands, or that of a name in the root's user database; else in words what is wrong. Any thread.
[[nodiscard]] std::expected<std::uint32_t, std::string> userNumberOf(const SystemRoot& root, const std::string& text);

} // namespace zor::platform
