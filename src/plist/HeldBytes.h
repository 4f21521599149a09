// SPDX-License-Identifier: Apache-2.0
// What a value costs to keep.
#pragma once

#include "plist/Value.h"

namespace zor::plist {

/// About what it takes in memory, in bytes, itself and all below it.
[[nodiscard]] std::size_t heldBytes(const Value& value);
[[nodiscard]] std::size_t heldBytes(const Dictionary& dictionary);

} // namespace zor::plist
