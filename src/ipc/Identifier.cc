// SPDX-License-Identifier: Apache-2.0
#include "ipc/Identifier.h"

#include "plist/Text.h"

namespace zor::ipc {

bool isIdentifier(std::string_view text) {
    if (text.size() > identifierBytesMax)
        return false;
    return plist::isAsciiWithoutNul(text.data(), text.size()) ||
           (text.find('\0') == std::string_view::npos && plist::isUtf8(text));
}

} // namespace zor::ipc
