// SPDX-License-Identifier: Apache-2.0
// How names are shown.
#include "zorvane/Text.h"

#include "plist/Text.h"

namespace zorvane {

std::string printable(const std::string& text) {
    std::string shown;
    zor::plist::appendEscaped(shown, text, zor::plist::Tabs::escaped);
    return shown;
}

} // namespace zorvane
