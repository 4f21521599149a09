// SPDX-License-Identifier: Apache-2.0
#include "base/Format.h"

#include <cstdio>

namespace zor {

std::string formattedList(const char* format, std::va_list arguments) {
    std::va_list again;
    va_copy(again, arguments);
    char small[512];
    const int length = std::vsnprintf(small, sizeof small, format, arguments);
    std::string text;
    if (length >= 0 && static_cast<std::size_t>(length) < sizeof small) {
        text.assign(small, static_cast<std::size_t>(length));
    } else if (length >= 0) {
        text.resize(static_cast<std::size_t>(length));
        std::vsnprintf(text.data(), text.size() + 1, format, again);
    }
    va_end(again);
    return text;
}

std::string formatted(const char* format, ...) {
    std::va_list arguments;
    va_start(arguments, format);
    std::string text = formattedList(format, arguments);
    va_end(arguments);
    return text;
}

} // namespace zor

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
