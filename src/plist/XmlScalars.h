// SPDX-License-Identifier: Apache-2.0
// The texts of the XML form's scalar elements. Each reads the whole text, white space around it aside, and answers
// nullopt for anything else. No locale takes part.
#pragma once

#include "plist/Value.h"

#include <optional>
#include <string_view>

namespace zor::plist::xml {

/// True for the white space of XML.
[[nodiscard]] constexpr bool isSpace(char c) {
    return c == ' ' || c == '\t' || c == '\n' || c == '\r';
}

/// Decimal or 0x hexadecimal with an optional sign, from −2^63 to 2^64 − 1.
[[nodiscard]] std::optional<Value> parseInteger(std::string_view text);
/// Decimal with optional fraction and exponent; also inf and nan.
[[nodiscard]] std::optional<Value> parseReal(std::string_view text);
/// YYYY-MM-DDTHH:MM:SSZ
[[nodiscard]] std::optional<Value> parseDate(std::string_view text);
/// Base64 with padding, white space anywhere.
[[nodiscard]] std::optional<Value> parseData(std::string_view text);

} // namespace zor::plist::xml
