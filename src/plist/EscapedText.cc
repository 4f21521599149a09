// SPDX-License-Identifier: Apache-2.0
#include "plist/EscapedText.h"

#include "plist/Utf8.h"

#include <algorithm>

namespace zor::plist {

namespace {

constexpr std::string_view hexDigits = "0123456789abcdef";

/// U+0080 to U+009F steer terminals like the ones below U+0020 do.
bool isControl(char32_t character) {
    return character < 0x20 || (character >= 0x7F && character < 0xA0);
}

void appendHex(std::string& line, unsigned char byte) {
    line += "\\x";
    line += hexDigits[byte >> 4];
    line += hexDigits[byte & 0xF];
}

} // namespace

void appendEscaped(std::string& line, std::string_view text, Tabs tabs) {
    for (std::size_t i = 0; i < text.size();) {
        const Utf8Character character = decodeUtf8(text.substr(i));
        const bool isLeftTab = character.codePoint == '\t' && tabs == Tabs::stay;
        if (character.length > 0 && (isLeftTab || !isControl(character.codePoint))) {
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
