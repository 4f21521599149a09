// SPDX-License-Identifier: Apache-2.0
#include "ipc/Identifiers.h"

#include "plist/Text.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <system_error>
#include <unistd.h>

namespace zor::ipc {

namespace {

constexpr std::uint64_t primeBits = 61;
constexpr std::uint64_t prime = (std::uint64_t{1} << primeBits) - 1;
/// So many bytes are a number below it.
constexpr std::size_t bytesOfTerm = 7;

/// Something below 2 to the power of 62 that leaves the same rest as the product.
std::uint64_t product(std::uint64_t one, std::uint64_t other) {
    __extension__ using Wide = unsigned __int128;
    const Wide whole = static_cast<Wide>(one) * other;
    const std::uint64_t sum =
        (static_cast<std::uint64_t>(whole) & prime) + static_cast<std::uint64_t>(whole >> primeBits);
    return (sum & prime) + (sum >> primeBits);
}

std::uint64_t secretNumber() {
    const UUID random = UUID::random();
    std::uint64_t number = 0;
    std::memcpy(&number, random.bytes().data(), sizeof number);
    return number & prime;
}

} // namespace

std::size_t hashOfIdentifier(std::string_view identifier) noexcept {
    // A polynomial whose terms are the identifier's, at a point that nobody knows: two of a thousand bytes meet there
    // by a chance of one in 2 to the power of 53.
    static const std::uint64_t point = secretNumber();
    std::uint64_t sum = identifier.size();
    while (!identifier.empty()) {
        std::uint64_t term = 0;
        const std::size_t bytes = std::min(bytesOfTerm, identifier.size());
        std::memcpy(&term, identifier.data(), bytes);
        sum = product(sum + term, point);
        identifier.remove_prefix(bytes);
    }
    return sum;
}

bool isIdentifier(std::string_view text) {
    if (text.size() > identifierBytesMax)
        return false;
    return plist::isAsciiWithoutNul(text.data(), text.size()) ||
           (text.find('\0') == std::string_view::npos && plist::isUtf8(text));
}

} // namespace zor::ipc

namespace zor {

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

UUID UUID::random() {
    UUID uuid;
    if (::getentropy(uuid.bytes_.data(), byteCount) != 0)
        throw std::system_error(errno, std::generic_category(), "the kernel gave no random bytes");
    uuid.bytes_[6] = static_cast<std::uint8_t>((uuid.bytes_[6] & 0x0f) | 0x40);
    uuid.bytes_[8] = static_cast<std::uint8_t>((uuid.bytes_[8] & 0x3f) | 0x80);
    return uuid;
}

std::optional<UUID> UUID::parse(std::string_view text) {
    if (text.size() != textLength)
        return std::nullopt;
    UUID uuid;
    std::size_t index = 0;
    for (std::uint8_t& byte : uuid.bytes_) {
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

std::optional<UUID> UUID::of(const plist::Value* value) {
    const plist::Data* data = value ? value->asData() : nullptr;
    if (!data || data->size() != byteCount)
        return std::nullopt;
    UUID uuid;
    std::copy(data->begin(), data->end(), uuid.bytes_.begin());
    return uuid;
}

std::string UUID::string() const {
    static constexpr char digits[] = "0123456789ABCDEF";
    std::string text(textLength, '-');
    std::size_t index = 0;
    for (const std::uint8_t byte : bytes_) {
        if (hyphenAt(index))
            ++index;
        text[index++] = digits[byte >> 4];
        text[index++] = digits[byte & 15];
    }
    return text;
}

} // namespace zor

namespace zor::ipc {

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

} // namespace zor::ipc
