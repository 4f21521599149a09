// SPDX-License-Identifier: Apache-2.0
// How names are shown.
#include "zorvane/Text.h"

#include <cstdio>

namespace zorvane {

std::string printable(const std::string& text) {
    std::string shown;
    for (const char character : text) {
        const auto byte = static_cast<unsigned char>(character);
        if (byte >= 0x20 && byte != 0x7f) {
            shown += character;
            continue;
        }
        char escaped[8];
        std::snprintf(escaped, sizeof escaped, "\\x%02x", byte);
        shown += escaped;
    }
    return shown;
}

} // namespace zorvane
