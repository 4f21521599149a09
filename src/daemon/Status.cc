// SPDX-License-Identifier: Apache-2.0
#include "daemon/Status.h"

#include "ipc/Keys.h"
#include "platform/EntitlementKeys.h"

namespace zor {

namespace powers = platform::entitlementKeys;

namespace {

plist::Dictionary describe(const platform::Identity& identity) {
    plist::Dictionary peer{
        {"Pid", static_cast<std::int64_t>(identity.pid)},
        {"EffectiveUserID", identity.effectiveUserId},
        {"Explanation", identity.explanation},
        {"Known", identity.grant != nullptr},
    };
    if (!identity.grant)
        return peer;
    if (identity.grant->identifier)
        peer.set("Identifier", *identity.grant->identifier);
    peer.set("KernelAgent", identity.grant->kernelAgent);
    if (const auto& entitlements = identity.grant->entitlements) {
        peer.set("MaySendEveryCommand", entitlements->isTrue(powers::allowed));
        peer.set("MayLookUpOtherIdentifiers",
                 entitlements->isTrue(powers::allowed) || entitlements->isTrue(powers::otherIdLookup));
        peer.set("Entitlements", *entitlements);
    }
    return peer;
}

} // namespace

plist::Dictionary Status::forPeer(platform::Peer& peer) {
    plist::Dictionary status{
        {std::string(ipc::keys::statusPeer), describe(peer.identify(platform::Peer::Explain::yes))}};
    if (composition_.platform().peers.ownsRoot(peer.kernelUserId()))
        status.set(ipc::keys::statusCounters, counters());
    return status;
}

plist::Dictionary Status::counters() {
    const platform::Platform& platform = composition_.platform();
    const auto messages = composition_.dispatcher().counts();
    const auto cache = composition_.cache().counts();
    plist::Dictionary counters{
        {"Version", ZORVANE_VERSION},
        {"InternalBuild", platform.internalBuild.isInternalBuild()},
        {"LockState", static_cast<std::int64_t>(platform.lockState.currentState())},
        {"BusyMarks", static_cast<std::uint64_t>(platform.transactions.count())},
        {"MessagesServed", messages.served},
        {"MessagesRefused", messages.refused},
        {"ClassCaches", static_cast<std::uint64_t>(cache.classCaches)},
        {"CachedContainers", static_cast<std::uint64_t>(cache.records)},
        {"LockedIdentifiers", static_cast<std::uint64_t>(composition_.locks().identifiersInUse())},
        {"EntitlementEntries", static_cast<std::uint64_t>(composition_.entitlements().entryCount())},
        {"ProtectionClassesSupported", platform.protection.supported()},
    };
    if (const auto lost = composition_.entitlements().lostFile())
        counters.set("UnreadableEntitlementFile", lost->path());
    platformCounters_(counters);
    return counters;
}

} // namespace zor
