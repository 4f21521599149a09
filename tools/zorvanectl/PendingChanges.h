// SPDX-License-Identifier: Apache-2.0
// The daemon's status of single containers: changes of data protection that are under way or wait for an
// unlock, and info values that could not be written.
#pragma once

#include "zorvane/Client.h"

#include <cstdint>
#include <set>
#include <string>
#include <vector>

namespace zorvanectl {

struct PendingChange {
    /// The container's.
    std::string uuid;
    std::int64_t protectionClass = 0;
    /// It waits for an unlock; else it is being made.
    bool locked = false;
};
/// Empty also when the status does not say: it tells them to the owner of the root alone.
[[nodiscard]] std::vector<PendingChange> pendingChangesIn(const zorvane::Value& status);

/// UUIDs of containers of which the daemon shows info values that are not on the disk; empty as above.
[[nodiscard]] std::set<std::string> unsavedInfoIn(const zorvane::Value& status);

} // namespace zorvanectl
