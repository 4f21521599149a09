// SPDX-License-Identifier: Apache-2.0
#include "daemon/Composition.h"

namespace zor {

Composition::Composition(platform::Platform platform, fs::Durability::Probe probe)
    : platform_(platform), log_(platform.log),
      refusals_(
          platform.users, [this](uid_t uid, std::uint64_t linesLeftOut) { sayLeftOut(uid, linesLeftOut); },
          [this](std::chrono::milliseconds delay) { refusalsEnd_.set(delay); }),
      refusalsEnd_(platform.runLoop, [this] { refusals_.reportEnded(); }),
      boundary_(log_, platform.internalBuild, platform.crash), users_(log_, platform.passwords, platform.users),
      locks_(log_), fileManager_(log_, platform.root, platform.disk, platform.protection),
      durability_(platform.disk, probe), configuration_(log_, fileManager_, platform.passwords, platform.users),
      cache_(log_, fileManager_, configuration_, durability_, boundary_) {
    log_.limitRefusals([this](std::uint32_t uid, std::size_t bytes) { return refusals_.admit(uid, bytes); });
}

void Composition::sayLeftOut(uid_t uid, std::uint64_t lines) const {
    const std::string whose = uid == ipc::strangersUserId ? "users that are not known" : "user " + std::to_string(uid);
    log_.write(logLevelNotice, "RefusalLimiter", "Left out %llu refusals of %s", static_cast<unsigned long long>(lines),
               whose.c_str());
}

Composition::Late::Late(Composition& composition)
    : operations(
          {{composition.log_, composition.boundary_, composition.locks_, composition.cache_, composition.replaces_},
           composition.fileManager_,
           composition.durability_,
           composition.configuration_},
          composition.platform_),
      sharedClientConnection(std::make_shared<ZORClientConnection>(operations, Caller::daemonItself())),
      dispatcher(composition.log_, composition.users_, operations),
      upcallServer(composition.upcallNeeds(operations), composition.platform_.upcallPort) {}

Composition::Late& Composition::late() {
    if (!late_)
        late_.emplace(*this);
    return *late_;
}

Operations& Composition::store() {
    return late().operations;
}

Dispatcher& Composition::dispatcher() {
    return late().dispatcher;
}

UpcallServer& Composition::upcallServer() {
    return late().upcallServer;
}

UpcallServer::Needs Composition::upcallNeeds() {
    return upcallNeeds(store());
}

UpcallServer::Needs Composition::upcallNeeds(Operations& operations) {
    return {.log = log_,
            .boundary = boundary_,
            .fileManager = fileManager_,
            .configuration = configuration_,
            .creation = operations.creation};
}

const std::shared_ptr<ZORClientConnection>& Composition::sharedClientConnection() {
    return late().sharedClientConnection;
}

Operations::Operations(const Store& store, const platform::Platform& platform)
    : configuration(store.configuration), internalBuild(platform.internalBuild), peers(platform.peers),
      setup(store.boundary), whitelist(ZORWhitelist::forSystem(store.log, store.fileManager)),
      markers(store.log, store.fileManager, store.configuration, platform.systemVersion),
      entitlements(store.log, store.fileManager, store.configuration, markers),
      moves(store.log, store.fileManager, store.durability), mappings(store.log, platform.sandbox),
      deathRow({store.log,
                store.boundary,
                store.fileManager,
                store.durability,
                store.configuration,
                {platform.transactions, platform.deathRowQueue}}),
      recovery(
          {store.log, store.fileManager, store.configuration, store.cache, moves, deathRow, setup, store.replaces}),
      maker({store.log, store.fileManager, store.durability, store.configuration, whitelist, deathRow}),
      creation({store, store.configuration, entitlements, limits, moves, deathRow, recovery, maker}),
      removal({store, store.fileManager, store.configuration, moves, mappings, deathRow, recovery}),
      groups({store, store.configuration, entitlements, recovery, maker, creation, removal, setup}),
      entitlementChange({store, store.configuration, entitlements, removal, groups}),
      deletion({store, creation, removal, entitlementChange}),
      replace({store, store.fileManager, store.configuration, whitelist, moves, mappings, deathRow, recovery}),
      wipe({store.log, store.boundary, creation, replace}), infoValues({store, store.fileManager, limits}),
      structure({store, store.fileManager, moves, mappings, recovery}),
      diskUsage({store, store.fileManager, infoValues}), listing({store, limits}),
      retryTest({store.log, store.boundary, creation, infoValues, deletion}),
      dataProtection({store,
                      platform.assertions,
                      limits,
                      infoValues,
                      {store, store.fileManager, {platform.transactions, platform.lockStateQueue}}}),
      entitlementPasses(
          {store.log, store.configuration, store.cache, entitlements, markers, infoValues, removal, setup}),
      migrator(
          {store.log, store.fileManager, store.configuration, store.cache, whitelist, markers, moves, deathRow, setup}),
      orphans({store.log, platform.internalBuild, store.fileManager, store.configuration, whitelist, setup, deathRow}),
      settingUp({store.log, store.fileManager, store.configuration, store.cache, platform.sandbox, moves, setup,
                 deathRow, recovery, orphans, migrator, entitlementPasses, groups}) {}

} // namespace zor
