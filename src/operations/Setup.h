// SPDX-License-Identifier: Apache-2.0
// Bringing the store into a consistent state before any client is served: once a boot, and at every launch.
//
// Runs on the thread that starts the daemon, alone, which holds no identifier lock; only the entitlement and group
// passes take identifier locks, for what they clear and delete. Neither setup fails: what goes wrong is logged and the
// next step runs. Every step may be repeated, so a stop anywhere is mended by the next launch: the boot's work is
// marked as done only when all of it ran. A daemon that is told to end stops between two items.
#pragma once

#include "base/FileURL.h"
#include "base/Log.h"
#include "fs/ZORFileManager.h"
#include "operations/BootPasses.h"
#include "operations/DeathRow.h"
#include "operations/LastingMoves.h"
#include "operations/ReplaceRecovery.h"
#include "operations/ZORContainerMigrator.h"
#include "operations/ZORGroupManager.h"
#include "platform/Device.h"
#include "store/SetupProgress.h"
#include "store/ZORContainerCache.h"
#include "store/ZORGlobalConfiguration.h"

#include <cstdint>
#include <optional>

namespace zor {

class Setup {
public:
    struct Needs {
        const Log& log;
        ZORFileManager& fileManager;
        ZORGlobalConfiguration& configuration;
        ZORContainerCache& cache;
        platform::SandboxUserState& sandbox;
        const LastingMoves& moves;
        SetupReport& report;
        DeathRow& deathRow;
        ReplaceRecovery& recovery;
        OrphanCleanUp& orphans;
        ZORContainerMigrator& migrator;
        FirstBootPasses& entitlementPasses;
        ZORGroupManager& groups;
    };
    explicit Setup(const Needs& needs) : needs_(needs) {}

    void rebootContainerManagerSetup();
    void containerManagerSetup();

private:
    // Passes; each gives the number of items it changed.
    std::uint64_t migrateBundles();
    std::uint64_t migrateWellknown();
    std::uint64_t discardAtBoot(const std::optional<FileURL>& url, const char* what,
                                std::optional<std::uint32_t> owner);
    std::uint64_t cleanUpUsers();
    std::uint64_t cleanUpSystem();
    std::uint64_t recoverReplaces();
    std::uint64_t sweepStaging();
    std::uint64_t removeDanglingMappings();
    /// Whether what is not found of a user's containers has gone: the user's home is there, and holds the place of
    /// them.
    bool showsContainers(std::uint32_t userId);
    void makeDirectoriesDurable();

    const Needs needs_;
};

} // namespace zor
