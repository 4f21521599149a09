// SPDX-License-Identifier: Apache-2.0
// What the container operations call: one object of each service, made by the composition and alive as long as it.
#pragma once

#include "base/ZORException.h"
#include "base/ZORLocks.h"
#include "fs/Durability.h"
#include "fs/ZORFileManager.h"
#include "platform/Device.h"
#include "platform/RunLoop.h"
#include "store/DeathRowReport.h"
#include "store/SetupReport.h"
#include "store/StoreLimits.h"
#include "store/WaitingReplaces.h"
#include "store/ZORContainerCache.h"
#include "store/ZORGlobalConfiguration.h"

#include <atomic>
#include <chrono>
#include <functional>
#include <memory>

namespace zor {

class ZORClientConnection;
class ZORContainerMigrator;
class ZORDataProtectionManager;
class ZOREntitlementMapping;
class ZORGroupManager;
class ZORWhitelist;

struct StoreServices {
    const Log& log;
    ExceptionBoundary& boundary;
    ZORLocks& locks;
    ZORFileManager& fileManager;
    fs::Durability& durability;
    ZORGlobalConfiguration& configuration;
    ZORContainerCache& cache;
    ZOREntitlementMapping& entitlements;
    ZORGroupManager& groups;
    const ZORWhitelist& whitelist;
    ZORContainerMigrator& migrator;
    ZORDataProtectionManager& dataProtection;
    const platform::InternalBuildQuery& internalBuild;
    platform::SandboxUserState& sandbox;
    platform::TerminationAssertionService& assertions;
    platform::WorkQueue& deathRowQueue;
    platform::WorkQueue& lockStateQueue;
    platform::ServiceTransactions& transactions;
    /// The daemon's own client. It is made over these services, so it comes last; nothing runs before it is there.
    std::shared_ptr<ZORClientConnection> sharedClientConnection;
    SetupReport setup{boundary};
    DeathRowReport deathRow{};
    /// A bundle in which nothing has changed for so long counts as filled: longer than an installation pauses, less
    /// than somebody waits for a second look.
    std::chrono::milliseconds usageSettledTime{10'000};
    StoreLimits limits{};
    /// A pass over death row that nobody is told of is queued and has not begun.
    std::atomic<bool> deletionPassWaits{false};
    WaitingReplaces waitingReplaces{};
    /// Some record's info may not be on the disk: worth a look through the cache.
    std::atomic<bool> someInfoIsNotSaved{false};
};

/// Runs `job` later on a queue; the daemon counts as busy until it has run.
void ZORDispatchAsyncWithTransaction(platform::ServiceTransactions& transactions, platform::WorkQueue& queue,
                                     std::function<void()> job);

} // namespace zor
