// SPDX-License-Identifier: Apache-2.0
// The status socket's answers: it tells every peer whom the daemon takes it for and why; the owners of the root, also
// how the daemon is doing.
#pragma once

#include "daemon/Composition.h"
#include "platform/Service.h"
#include "plist/Value.h"
#include "service/StatusSocket.h"

#include <chrono>
#include <functional>

namespace zor {

class Status {
public:
    /// `platformCounters` adds what only the platform's own objects count.
    Status(Composition& composition, std::function<void(plist::Dictionary&)> platformCounters)
        : composition_(composition), platformCounters_(std::move(platformCounters)) {}

    /// The dictionary for one peer: "Peer" and "Daemon"; and, where the peer may know them, "Counters" and, in full
    /// detail, the entitlement map and what it makes of groups.
    [[nodiscard]] plist::Dictionary forPeer(platform::Peer& peer, platform::StatusSocket::Detail detail);

private:
    [[nodiscard]] plist::Dictionary daemon() const;
    [[nodiscard]] plist::Dictionary counters();
    void addProtection(plist::Dictionary& counters);
    void addSetup(plist::Dictionary& counters);
    void addDeathRow(plist::Dictionary& counters);
    void addUnsavedInfo(plist::Dictionary& counters);
    void addEntitlements(plist::Dictionary& status);

    Composition& composition_;
    const std::chrono::steady_clock::time_point started_ = std::chrono::steady_clock::now();
    const std::function<void(plist::Dictionary&)> platformCounters_;
};

} // namespace zor
