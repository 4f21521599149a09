// SPDX-License-Identifier: Apache-2.0
#include "plist/Text.h"

#include <algorithm>

namespace zor::plist {

Utf8Character decodeUtf8(std::string_view text) {
    const auto first = static_cast<unsigned char>(text[0]);
    if (first < 0x80)
        return {.codePoint = first, .length = 1};

    std::size_t length = 0;
    char32_t codePoint = 0;
    char32_t least = 0;
    if (first >= 0xC2 && first <= 0xDF) {
        length = 2;
        codePoint = first & 0x1FU;
        least = 0x80;
    } else if ((first & 0xF0U) == 0xE0) {
        length = 3;
        codePoint = first & 0x0FU;
        least = 0x800;
    } else if (first >= 0xF0 && first <= 0xF4) {
        length = 4;
        codePoint = first & 0x07U;
        least = 0x10000;
    } else {
        return {};
    }
    if (text.size() < length)
        return {};
    for (std::size_t at = 1; at < length; ++at) {
        const auto next = static_cast<unsigned char>(text[at]);
        if ((next & 0xC0U) != 0x80)
            return {};
        codePoint = (codePoint << 6) | (next & 0x3FU);
    }
    const bool surrogate = codePoint >= 0xD800 && codePoint <= 0xDFFF;
    if (codePoint < least || codePoint > 0x10FFFF || surrogate)
        return {};
    return {.codePoint = codePoint, .length = length};
}

void appendUtf8(std::string& out, char32_t codePoint) {
    const auto put = [&out](char32_t byte) { out.push_back(static_cast<char>(byte)); };
    if (codePoint < 0x80) {
        put(codePoint);
    } else if (codePoint < 0x800) {
        put(0xC0 | (codePoint >> 6));
        put(0x80 | (codePoint & 0x3F));
    } else if (codePoint < 0x10000) {
        put(0xE0 | (codePoint >> 12));
        put(0x80 | ((codePoint >> 6) & 0x3F));
        put(0x80 | (codePoint & 0x3F));
    } else {
        put(0xF0 | (codePoint >> 18));
        put(0x80 | ((codePoint >> 12) & 0x3F));
        put(0x80 | ((codePoint >> 6) & 0x3F));
        put(0x80 | (codePoint & 0x3F));
    }
}

bool isUtf8(std::string_view text) {
    while (!text.empty()) {
        const Utf8Character character = decodeUtf8(text);
        if (character.length == 0)
            return false;
        text.remove_prefix(character.length);
    }
    return true;
}

namespace {

struct Range {
    char32_t first;
    char32_t last;
};

/// In order. U+0080 to U+009F steer terminals like the ones below U+0020 do; what turns the direction of writing makes
/// a name read as another, and so does what is not seen.
constexpr Range notShown[] = {
    {0x00, 0x1F},       {0x7F, 0x9F},                         // controls
    {0xAD, 0xAD},       {0x34F, 0x34F},                       // soft hyphen, grapheme joiner
    {0x61C, 0x61C},                                           // Arabic letter mark
    {0x115F, 0x1160},   {0x17B4, 0x17B5},   {0x180B, 0x180F}, // fillers and selectors of single scripts
    {0x200B, 0x200F},                                         // of no width, marks of direction
    {0x2028, 0x202E},                                         // ends of lines, embedding and override of direction
    {0x2060, 0x206F},                                         // joiners, invisible operators, isolates of direction
    {0x3164, 0x3164},   {0xFFA0, 0xFFA0},                     // Hangul fillers
    {0xFE00, 0xFE0F},   {0xFEFF, 0xFEFF},                     // variation selectors, byte order mark
    {0xFFF0, 0xFFFB},                                         // annotations
    {0x1BCA0, 0x1BCA3}, {0x1D173, 0x1D17A},                   // formats of shorthand and music
    {0xE0000, 0xE0FFF},                                       // tags, more variation selectors
};

void appendHex(std::string& line, unsigned char byte) {
    line += "\\x";
    line += hexDigits[byte >> 4];
    line += hexDigits[byte & 0xF];
}

} // namespace

bool isShown(char32_t character) {
    if (character >= 0x20 && character < 0x7F)
        return true;
    return std::ranges::none_of(
        notShown, [character](const Range& range) { return character >= range.first && character <= range.last; });
}

void appendEscaped(std::string& line, std::string_view text, Tabs tabs) {
    for (std::size_t i = 0; i < text.size();) {
        const Utf8Character character = decodeUtf8(text.substr(i));
        const bool isLeftTab = character.codePoint == '\t' && tabs == Tabs::stay;
        if (character.length > 0 && (isLeftTab || isShown(character.codePoint))) {
            line.append(text, i, character.length);
            i += character.length;
            continue;
        }
        const std::size_t end = i + std::max<std::size_t>(character.length, 1);
        for (; i < end; ++i) {
            if (text[i] == '\n')
                line += "\\n";
            else
                appendHex(line, static_cast<unsigned char>(text[i]));
        }
    }
}

} // namespace zor::plist
