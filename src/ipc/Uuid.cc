// SPDX-License-Identifier: Apache-2.0
#include "ipc/Uuid.h"

#include <algorithm>

namespace zor::ipc {

namespace {

constexpr std::size_t textLength = 36;

bool hyphenAt(std::size_t index) {
    return index == 8 || index == 13 || index == 18 || index == 23;
}

int digitValue(char character) {
    if (character >= '0' && character <= '9')
        return character - '0';
    if (character >= 'a' && character <= 'f')
        return character - 'a' + 10;
    if (character >= 'A' && character <= 'F')
        return character - 'A' + 10;
    return -1;
}

} // namespace

plist::Value uuidValue(const UuidBytes& uuid) {
    return plist::Data(uuid.begin(), uuid.end());
}

std::optional<UuidBytes> uuidOf(const plist::Value* value) {
    const plist::Data* data = value ? value->asData() : nullptr;
    UuidBytes uuid;
    if (!data || data->size() != uuid.size())
        return std::nullopt;
    std::copy(data->begin(), data->end(), uuid.begin());
    return uuid;
}

std::optional<UuidBytes> uuidOf(const plist::Dictionary& dictionary, std::string_view key) {
    return uuidOf(dictionary.find(key));
}

std::string uuidText(const UuidBytes& uuid) {
    static constexpr char digits[] = "0123456789ABCDEF";
    std::string text(textLength, '-');
    std::size_t index = 0;
    for (const std::uint8_t byte : uuid) {
        if (hyphenAt(index))
            ++index;
        text[index++] = digits[byte >> 4];
        text[index++] = digits[byte & 15];
    }
    return text;
}

std::optional<UuidBytes> uuidOfText(std::string_view text) {
    if (text.size() != textLength)
        return std::nullopt;
    UuidBytes uuid;
    std::size_t index = 0;
    for (std::uint8_t& byte : uuid) {
        if (hyphenAt(index) && text[index++] != '-')
            return std::nullopt;
        const int high = digitValue(text[index++]);
        const int low = digitValue(text[index++]);
        if (high < 0 || low < 0)
            return std::nullopt;
        byte = static_cast<std::uint8_t>(high << 4 | low);
    }
    return uuid;
}

} // namespace zor::ipc
