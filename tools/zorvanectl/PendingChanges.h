// SPDX-License-Identifier: Apache-2.0
// The changes of data protection that the daemon's status says are under way or wait for an unlock.
#pragma once

#include "zorvane/Client.h"

#include <cstdint>
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

} // namespace zorvanectl
