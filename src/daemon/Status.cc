// SPDX-License-Identifier: Apache-2.0
#include "daemon/Status.h"

#include "ipc/Protocol.h"
#include "platform/Service.h"

#include <unistd.h>

namespace zor {

namespace powers = platform::entitlementKeys;

namespace {

plist::Dictionary describe(const platform::Identity& identity) {
    plist::Dictionary peer{
        {"Pid", static_cast<std::int64_t>(identity.pid)},
        {"EffectiveUserID", identity.effectiveUserId},
        {std::string(ipc::keys::peerExplanation), identity.explanation},
        {std::string(ipc::keys::peerKnown), identity.grant != nullptr},
    };
    if (!identity.grant)
        return peer;
    if (identity.grant->identifier)
        peer.set(ipc::keys::peerIdentifier, *identity.grant->identifier);
    peer.set("KernelAgent", identity.grant->kernelAgent);
    peer.set("OnlyOwnIdentifier", identity.grant->onlyOwnIdentifier);
    if (const auto& entitlements = identity.grant->entitlements) {
        peer.set(ipc::keys::peerMaySendEveryCommand, entitlements->isTrue(powers::allowed));
        peer.set("MayLookUpOtherIdentifiers",
                 entitlements->isTrue(powers::allowed) || entitlements->isTrue(powers::otherIdLookup));
        peer.set("Entitlements", *entitlements);
    }
    return peer;
}

} // namespace

plist::Dictionary Status::forPeer(platform::Peer& peer, platform::StatusSocket::Detail detail) {
    plist::Dictionary status{
        {std::string(ipc::keys::statusPeer), describe(peer.identify(platform::Peer::Explain::yes))},
        {std::string(ipc::keys::statusDaemon), daemon()}};
    if (!composition_.platform().peers.ownsRoot(peer.kernelUserId()))
        return status;
    status.set(ipc::keys::statusCounters, counters());
    if (detail == platform::StatusSocket::Detail::full)
        addEntitlements(status);
    else
        status.set(ipc::keys::statusEntitlementsLeftOut, true);
    return status;
}

plist::Dictionary Status::daemon() const {
    const auto up = std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() - started_);
    return {{"Version", ZORVANE_VERSION},
            {"Pid", static_cast<std::int64_t>(::getpid())},
            {std::string(ipc::keys::daemonUptimeMilliseconds), static_cast<std::uint64_t>(up.count())}};
}

void Status::addEntitlements(plist::Dictionary& status) {
    plist::Dictionary map = composition_.entitlements().entitlementMappingDict();
    const auto references = [&](GroupType type) {
        std::vector<plist::Dictionary::Entry> groups;
        for (const auto& [group, holders] : groupReferencesIn(map, type, nullptr))
            groups.emplace_back(group, plist::Array(holders.begin(), holders.end()));
        return plist::Dictionary::fromUnsorted(std::move(groups));
    };
    status.set(ipc::keys::statusGroupReferences,
               plist::Dictionary{{std::string(ipc::keys::statusApplicationGroups), references(GroupType::application)},
                                 {std::string(ipc::keys::statusSystemGroups), references(GroupType::system)}});
    status.set(ipc::keys::statusEntitlements, std::move(map));
}

void Status::addProtection(plist::Dictionary& counters) {
    plist::Array pending;
    for (const auto& change : composition_.store().dataProtection.pending())
        pending.emplace_back(plist::Dictionary{{"UUID", change.uuid.string()},
                                               {"Identifier", change.identifier},
                                               {"UserID", change.userId},
                                               {"ContainerClass", static_cast<std::uint64_t>(change.containerClass)},
                                               {"ProtectionClass", change.dataProtectionClass}});
    counters.set("PendingProtectionChanges", std::move(pending));
    const auto held = composition_.platform().assertions.held();
    counters.set("HeldAssertions", plist::Array(held.begin(), held.end()));
}

void Status::addUnsavedInfo(plist::Dictionary& counters) {
    if (!composition_.store().infoValues.someIsNotSaved())
        return;
    plist::Array uuids;
    for (const UUID& uuid : composition_.cache().withUnsavedInfo())
        uuids.emplace_back(uuid.string());
    counters.set("UnsavedInfo", std::move(uuids));
}

void Status::addDeathRow(plist::Dictionary& counters) {
    const DeathRow::Left left = composition_.store().deathRow.left();
    counters.set("UndeletedItems", left.count);
    counters.set("UndeletedPaths", plist::Array(left.paths.begin(), left.paths.end()));
}

void Status::addSetup(plist::Dictionary& counters) {
    plist::Array passes;
    for (const auto& pass : composition_.store().setup.passes())
        passes.emplace_back(plist::Dictionary{{"Pass", pass.name},
                                              {"Changed", pass.changed},
                                              {"Microseconds", pass.microseconds},
                                              {"Failed", pass.failed}});
    counters.set("LastSetup", std::move(passes));
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
    addProtection(counters);
    addSetup(counters);
    addDeathRow(counters);
    addUnsavedInfo(counters);
    if (const auto lost = composition_.entitlements().lostFile())
        counters.set("UnreadableEntitlementFile", lost->path());
    platformCounters_(counters);
    return counters;
}

} // namespace zor
