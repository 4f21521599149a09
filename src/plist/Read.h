// SPDX-License-Identifier: Apache-2.0
// Reads property lists of either form, for files: the first bytes say which it is. Messages are binary only (Binary.h).
//
// The XML form is read only: registry files and metadata files that people and packages wrote. The one element "plist"
// holds one value: dict, array, string, integer, real, true, false, date or data. The document may name the usual
// document type but may not declare anything: an internal subset is refused, so there are no entities but the five
// predefined ones and nothing can grow or be fetched. Every value takes at least seven bytes of input, so memory stays
// in proportion without further accounts; nesting and size are bounded by Errors.h. Pure; any thread.
#pragma once

#include "plist/Errors.h"
#include "plist/Value.h"

#include <cstdint>
#include <expected>
#include <span>

namespace zor::plist {

[[nodiscard]] std::expected<Value, ReadError> readPropertyList(std::span<const std::uint8_t> bytes);

[[nodiscard]] std::expected<Value, ReadError> readXml(std::span<const std::uint8_t> bytes);

} // namespace zor::plist
