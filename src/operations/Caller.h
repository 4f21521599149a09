// SPDX-License-Identifier: Apache-2.0
// In whose name an operation runs: who sent the message, and what it may ask for beyond its own. A value of one thread.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace zor {

struct Caller {
    std::optional<std::string> bundleIdentifier;
    std::uint32_t userId = 0;
    bool allowOtherIdLookup = false;
    std::optional<std::vector<std::string>> entitledWipeIdentifiers;
    /// The client may ask for its own identifier only, whatever its powers are.
    bool onlyOwnIdentifier = false;

    /// An owner of the root, as whom root and the daemon's own user are reported.
    [[nodiscard]] bool ownsRoot() const { return userId == 0; }

    /// The caller for whom the daemon itself acts: what a boot brings in line, what the kernel asks.
    static Caller daemonItself() {
        return {.bundleIdentifier = "com.veltra.zorvaned.internal", .userId = 0, .allowOtherIdLookup = true};
    }
};

} // namespace zor
