// SPDX-License-Identifier: Apache-2.0
#include "daemon/Operations.h"

namespace zor {

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
      recovery({store.log, store.fileManager, store.configuration, store.cache, moves, deathRow, setup}),
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
