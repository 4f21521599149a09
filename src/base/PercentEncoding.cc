// SPDX-License-Identifier: Apache-2.0
#include "base/PercentEncoding.h"

namespace zor::platform {

namespace {

constexpr std::string_view hexDigits = "0123456789ABCDEF";

bool staysAt(char c, std::size_t position) {
    const bool isLetter = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z');
    const bool isDigit = c >= '0' && c <= '9';
    return isLetter || isDigit || c == '-' || c == '_' || (c == '.' && position > 0);
}

} // namespace

std::string percentEncode(std::string_view text) {
    std::string encoded;
    encoded.reserve(text.size());
    for (std::size_t i = 0; i < text.size(); ++i) {
        if (staysAt(text[i], i)) {
            encoded += text[i];
            continue;
        }
        const auto byte = static_cast<unsigned char>(text[i]);
        encoded += '%';
        encoded += hexDigits[byte >> 4];
        encoded += hexDigits[byte & 0xF];
    }
    return encoded;
}

std::optional<std::string> percentDecode(std::string_view component) {
    std::string text;
    for (std::size_t i = 0; i < component.size(); ++i) {
        if (component[i] != '%') {
            text += component[i];
            continue;
        }
        if (component.size() - i < 3)
            return std::nullopt;
        const std::size_t high = hexDigits.find(component[i + 1]);
        const std::size_t low = hexDigits.find(component[i + 2]);
        if (high == std::string_view::npos || low == std::string_view::npos)
            return std::nullopt;
        text += static_cast<char>(high << 4 | low);
        i += 2;
    }
    // Only the one name that encoding gives counts, so that no string has two names.
    if (percentEncode(text) != component)
        return std::nullopt;
    return text;
}

} // namespace zor::platform
