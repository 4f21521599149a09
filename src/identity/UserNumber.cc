// SPDX-License-Identifier: Apache-2.0
#include "identity/UserNumber.h"

#include "identity/LinuxPasswordDatabase.h"

#include <charconv>

namespace zor::platform {

std::expected<std::uint32_t, std::string> userNumberOf(const SystemRoot& root, const std::string& text) {
    std::uint32_t number = 0;
    const char* const end = text.data() + text.size();
    const auto [last, failure] = std::from_chars(text.data(), end, number);
    if (failure == std::errc() && last == end)
        return number;
    if (const auto entry = LinuxPasswordDatabase(root).entryForName(text))
        return entry->uid;
    return std::unexpected("'" + text + "' is neither a user id nor a user of " +
                           (root.isDeviceRoot() ? "this system" : root.path("etc/passwd")));
}

} // namespace zor::platform
