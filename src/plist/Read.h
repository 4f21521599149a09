// SPDX-License-Identifier: Apache-2.0
// Reads a property list of either form, for files: the first bytes say which it is. Messages are binary only
// (Binary.h).
#pragma once

#include "plist/Errors.h"
#include "plist/Value.h"

#include <cstdint>
#include <expected>
#include <span>

namespace zor::plist {

[[nodiscard]] std::expected<Value, ReadError> readPropertyList(std::span<const std::uint8_t> bytes);

} // namespace zor::plist
