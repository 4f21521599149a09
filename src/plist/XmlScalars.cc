// SPDX-License-Identifier: Apache-2.0
#include "plist/XmlScalars.h"

#include <charconv>
#include <chrono>
#include <memory>

namespace zor::plist::xml {

namespace {

std::string_view trimmed(std::string_view text) {
    while (!text.empty() && isSpace(text.front()))
        text.remove_prefix(1);
    while (!text.empty() && isSpace(text.back()))
        text.remove_suffix(1);
    return text;
}

/// Takes a sign off; true for minus.
bool takeSign(std::string_view& text) {
    if (text.empty() || (text.front() != '-' && text.front() != '+'))
        return false;
    const bool minus = text.front() == '-';
    text.remove_prefix(1);
    return minus;
}

/// `count` decimal digits from `at`, or -1.
int digits(std::string_view text, std::size_t at, std::size_t count) {
    int number = 0;
    for (const char c : text.substr(at, count)) {
        if (c < '0' || c > '9')
            return -1;
        number = number * 10 + (c - '0');
    }
    return number;
}

/// The six bits a base64 character stands for, or -1.
int sextet(char c) {
    if (c >= 'A' && c <= 'Z')
        return c - 'A';
    if (c >= 'a' && c <= 'z')
        return c - 'a' + 26;
    if (c >= '0' && c <= '9')
        return c - '0' + 52;
    return c == '+' ? 62 : c == '/' ? 63 : -1;
}

} // namespace

std::optional<Value> parseInteger(std::string_view text) {
    text = trimmed(text);
    const bool minus = takeSign(text);
    int base = 10;
    if (text.starts_with("0x") || text.starts_with("0X")) {
        base = 16;
        text.remove_prefix(2);
    }
    std::uint64_t magnitude = 0;
    const char* end = std::to_address(text.end());
    const auto [stop, error] = std::from_chars(std::to_address(text.begin()), end, magnitude, base);
    if (error != std::errc() || stop != end)
        return std::nullopt;
    if (!minus)
        return Value(magnitude);
    constexpr std::uint64_t least = std::uint64_t{1} << 63;
    if (magnitude > least)
        return std::nullopt;
    return Value(static_cast<std::int64_t>(0 - magnitude));
}

std::optional<Value> parseReal(std::string_view text) {
    text = trimmed(text);
    const bool minus = takeSign(text);
    // The conversion takes a minus of its own.
    if (text.empty() || text.front() == '-')
        return std::nullopt;
    double number = 0;
    const char* end = std::to_address(text.end());
    const auto [stop, error] = std::from_chars(std::to_address(text.begin()), end, number);
    if (error != std::errc() || stop != end)
        return std::nullopt;
    return Value(minus ? -number : number);
}

std::optional<Value> parseDate(std::string_view text) {
    using namespace std::chrono;
    constexpr std::string_view form = "dddd-dd-ddTdd:dd:ddZ";
    text = trimmed(text);
    if (text.size() != form.size())
        return std::nullopt;
    for (std::size_t i = 0; i < form.size(); ++i)
        if (form[i] == 'd' ? digits(text, i, 1) < 0 : text[i] != form[i])
            return std::nullopt;

    const year_month_day day{year{digits(text, 0, 4)}, month{static_cast<unsigned>(digits(text, 5, 2))},
                             std::chrono::day{static_cast<unsigned>(digits(text, 8, 2))}};
    const int hour = digits(text, 11, 2);
    const int minute = digits(text, 14, 2);
    const int second = digits(text, 17, 2);
    if (!day.ok() || hour > 23 || minute > 59 || second > 59)
        return std::nullopt;
    constexpr sys_days reference{year{2001} / January / 1};
    const seconds since = sys_days{day} - reference + hours{hour} + minutes{minute} + seconds{second};
    return Value(Date{static_cast<double>(since.count())});
}

std::optional<Value> parseData(std::string_view text) {
    Data bytes;
    bytes.reserve(text.size() / 4 * 3);
    std::uint32_t bits = 0;
    int characters = 0;
    int padding = 0;
    for (const char c : text) {
        if (isSpace(c))
            continue;
        if (c == '=') {
            ++padding;
            continue;
        }
        const int six = sextet(c);
        if (six < 0 || padding != 0)
            return std::nullopt;
        bits = bits << 6 | static_cast<std::uint32_t>(six);
        if (++characters == 4) {
            bytes.push_back(static_cast<std::uint8_t>(bits >> 16));
            bytes.push_back(static_cast<std::uint8_t>(bits >> 8));
            bytes.push_back(static_cast<std::uint8_t>(bits));
            characters = 0;
        }
    }
    // A group cut short says so: two characters and "==" are one byte, three and "=" two.
    if (characters == 0 ? padding != 0 : characters == 1 || characters + padding != 4)
        return std::nullopt;
    if (characters >= 2)
        bytes.push_back(static_cast<std::uint8_t>(bits >> (characters == 2 ? 4 : 10)));
    if (characters == 3)
        bytes.push_back(static_cast<std::uint8_t>(bits >> 2));
    return Value(std::move(bytes));
}

} // namespace zor::plist::xml
