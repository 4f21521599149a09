// SPDX-License-Identifier: Apache-2.0
#include "PendingChanges.h"

#include "Output.h"
#include "platform/Device.h"

namespace zorvanectl {

std::vector<PendingChange> pendingChangesIn(const zorvane::Value& status) {
    std::vector<PendingChange> changes;
    const nlohmann::json counters = toJson(status).value("Counters", nlohmann::json::object());
    for (const auto& change : counters.value("PendingProtectionChanges", nlohmann::json::array()))
        changes.push_back({.uuid = change.value("UUID", ""),
                           .protectionClass = change.value("ProtectionClass", std::int64_t{0}),
                           .locked = counters.value("LockState", 0) == zor::platform::DeviceLockState::locked});
    return changes;
}

std::set<std::string> unsavedInfoIn(const zorvane::Value& status) {
    const nlohmann::json counters = toJson(status).value("Counters", nlohmann::json::object());
    return counters.value("UnsavedInfo", std::set<std::string>());
}

} // namespace zorvanectl
