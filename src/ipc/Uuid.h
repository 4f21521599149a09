// SPDX-License-Identifier: Apache-2.0
// A UUID in a message is data of exactly 16 bytes; anything else is no UUID.
#pragma once

#include "plist/Value.h"

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace zor::ipc {

using UuidBytes = std::array<std::uint8_t, 16>;

[[nodiscard]] plist::Value uuidValue(const UuidBytes& uuid);
/// nullopt when `value` is nullptr or no UUID.
[[nodiscard]] std::optional<UuidBytes> uuidOf(const plist::Value* value);
[[nodiscard]] std::optional<UuidBytes> uuidOf(const plist::Dictionary& dictionary, std::string_view key);
/// Upper-case hexadecimal digits with hyphens, 36 characters: the form that names container directories.
[[nodiscard]] std::string uuidText(const UuidBytes& uuid);
/// Reads 36 characters, digits of either case. nullopt for anything else.
[[nodiscard]] std::optional<UuidBytes> uuidOfText(std::string_view text);

} // namespace zor::ipc
