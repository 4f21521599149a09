// SPDX-License-Identifier: Apache-2.0
// Every operation on the store, made once. A member may call those that stand above it, which it was given by
// reference, and none below it.
//
// Lives as long as the composition that made it. The members that are no operations are the data that several share.
#pragma once

#include "base/ZORError.h"
#include "base/ZORLocks.h"
#include "daemon/Platform.h"
#include "fs/Durability.h"
#include "fs/ZORFileManager.h"
#include "operations/Basics.h"
#include "operations/ContainerMaker.h"
#include "operations/Creation.h"
#include "operations/DeathRow.h"
#include "operations/Deletion.h"
#include "operations/DiskUsage.h"
#include "operations/EntitlementChange.h"
#include "operations/InfoValues.h"
#include "operations/LastingMoves.h"
#include "operations/Listing.h"
#include "operations/Replace.h"
#include "operations/ReplaceRecovery.h"
#include "operations/Sequences.h"
#include "operations/Setup.h"
#include "operations/Structure.h"
#include "operations/ZORContainerMigrator.h"
#include "operations/ZORDataProtectionManager.h"
#include "operations/ZORGroupManager.h"
#include "store/Configuration.h"
#include "store/SetupProgress.h"
#include "store/ZORContainerCache.h"
#include "store/ZOREntitlementMapping.h"
#include "store/ZORWhitelist.h"

namespace zor {

struct Operations {
    /// The services that lie below all of them.
    struct Store : RecordNeeds {
        ZORFileManager& fileManager;
        const fs::Durability& durability;
        ZORGlobalConfiguration& configuration;
    };
    /// Reads the entitlement file and the table of well-known containers.
    Operations(const Store& store, const platform::Platform& platform);
    Operations(const Operations&) = delete;
    Operations& operator=(const Operations&) = delete;

    ZORGlobalConfiguration& configuration;
    const platform::InternalBuildQuery& internalBuild;
    platform::PeerIdentity& peers;
    StoreLimits limits{};
    SetupReport setup;
    const ZORWhitelist whitelist;
    MigrationMarkers markers;
    ZOREntitlementMapping entitlements;

    LastingMoves moves;
    SandboxMappings mappings;
    DeathRow deathRow;
    ReplaceRecovery recovery;
    ContainerMaker maker;
    Creation creation;
    ContainerRemoval removal;
    ZORGroupManager groups;
    EntitlementChange entitlementChange;
    Deletion deletion;
    Replace replace;
    Wipe wipe;
    InfoValues infoValues;
    Structure structure;
    DiskUsage diskUsage;
    Listing listing;
    RetryTest retryTest;
    ZORDataProtectionManager dataProtection;
    FirstBootPasses entitlementPasses;
    ZORContainerMigrator migrator;
    OrphanCleanUp orphans;
    Setup settingUp;
};

} // namespace zor
