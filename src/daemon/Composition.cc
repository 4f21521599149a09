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
    : entitlements(composition.log_, composition.fileManager_, composition.configuration_, services),
      groups(composition.log_, services),
      whitelist(ZORWhitelist::forSystem(composition.log_, composition.fileManager_)),
      migrator(services, composition.platform_.systemVersion), dataProtection(services),
      services{.log = composition.log_,
               .boundary = composition.boundary_,
               .locks = composition.locks_,
               .fileManager = composition.fileManager_,
               .durability = composition.durability_,
               .configuration = composition.configuration_,
               .cache = composition.cache_,
               .entitlements = entitlements,
               .groups = groups,
               .whitelist = whitelist,
               .migrator = migrator,
               .dataProtection = dataProtection,
               .internalBuild = composition.platform_.internalBuild,
               .sandbox = composition.platform_.sandbox,
               .assertions = composition.platform_.assertions,
               .deathRowQueue = composition.platform_.deathRowQueue,
               .lockStateQueue = composition.platform_.lockStateQueue,
               .transactions = composition.platform_.transactions,
               .sharedClientConnection = nullptr},
      dispatcher(composition.log_, composition.users_, services),
      upcallServer(services, composition.platform_.upcallPort) {
    services.sharedClientConnection = std::make_shared<ZORClientConnection>(
        services, ZORClientConnection::Client{.bundleIdentifier = "com.veltra.zorvaned.internal",
                                              .userId = 0,
                                              .allowOtherIdLookup = true,
                                              .entitledWipeIdentifiers = std::nullopt});
}

Composition::Late& Composition::late() {
    if (!late_)
        late_.emplace(*this);
    return *late_;
}

StoreServices& Composition::store() {
    return late().services;
}

Dispatcher& Composition::dispatcher() {
    return late().dispatcher;
}

UpcallServer& Composition::upcallServer() {
    return late().upcallServer;
}

const std::shared_ptr<ZORClientConnection>& Composition::sharedClientConnection() {
    return late().services.sharedClientConnection;
}

ZOREntitlementMapping& Composition::entitlements() {
    return late().entitlements;
}

ZORGroupManager& Composition::groups() {
    return late().groups;
}

const ZORWhitelist& Composition::whitelist() {
    return late().whitelist;
}

} // namespace zor
