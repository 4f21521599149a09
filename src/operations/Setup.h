// SPDX-License-Identifier: Apache-2.0
// Bringing the store into a consistent state before any client is served, and the passes of the first launch after a
// boot over what lies on the disk.
#pragma once

#include "base/ContainerClass.h"
#include "base/Log.h"
#include "fs/PathResolver.h"
#include "fs/ZORFileManager.h"
#include "operations/DeathRow.h"
#include "operations/Deletion.h"
#include "operations/InfoValues.h"
#include "operations/LastingMoves.h"
#include "operations/ReplaceRecovery.h"
#include "operations/ZORContainerMigrator.h"
#include "operations/ZORGroupManager.h"
#include "platform/Device.h"
#include "store/Configuration.h"
#include "store/SetupProgress.h"
#include "store/ZORContainerCache.h"
#include "store/ZOREntitlementMapping.h"
#include "store/ZORWhitelist.h"

#include <cstdint>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace zor {

// Bringing the containers on disk in line with the entitlement map, at the first launch after a boot.
//
// A stop in the middle leaves the rest as it was and no marker; the next boot does all of it again, and writing an
// entry once more changes nothing. Before clients are served, on the thread that starts the daemon.

class FirstBootPasses {
public:
    struct Needs {
        const Log& log;
        ZORGlobalConfiguration& configuration;
        ZORContainerCache& cache;
        ZOREntitlementMapping& entitlements;
        MigrationMarkers& markers;
        InfoValues& infoValues;
        ContainerRemoval& removal;
        SetupReport& report;
    };
    explicit FirstBootPasses(const Needs& needs) : needs_(needs) {}

    // Failures are logged and passed over. Both give the number of containers that they changed.
    /// Moves the group identifiers that older systems kept in data containers into the map; once for the device.
    std::uint64_t migrateAppGroupIdsFromDataContainersToFile();
    /// Stages system containers that no identifier is entitled to for deletion.
    std::uint64_t reconcileSystemContainers();

private:
    /// False, logged, on failure.
    bool migrateGroupIdentifiers(const ZORMetadata& container);
    /// nullopt, logged, when that cannot be known.
    std::optional<std::set<std::string, std::less<>>> ownersOfSystemContainers();

    const Needs needs_;
};

// Entries of a class directory that are no containers go to death row, at the first launch after a boot.
//
// The owner of a class directory can rename anything to a name in it. So only entries of the owner of its containers
// go; another's directory stays, and the log says so.
//
// Directories are read in batches: no number of entries is too large for the memory. Every step may be repeated. On the
// thread that starts the daemon; entries are judged by several threads.

class OrphanCleanUp {
public:
    struct Needs {
        const Log& log;
        const platform::InternalBuildQuery& internalBuild;
        ZORFileManager& fileManager;
        ZORGlobalConfiguration& configuration;
        const ZORWhitelist& whitelist;
        SetupReport& report;
        DeathRow& deathRow;
    };
    explicit OrphanCleanUp(const Needs& needs) : needs_(needs) {}

    /// How many entries went.
    std::uint64_t _cleanupOrphanedDataForUser(std::uint32_t userId, ContainerClass containerClass);
    /// Copies across file systems that a stop cut short: hidden, so no listing shows them. In a directory of the
    /// daemon's.
    void discardCopyLeftovers(const FileURL& directory);

private:
    enum class Orphan : std::uint8_t { no, byName, noMetadata };
    /// `classDirectory` is open and holds the entry. Several threads may ask at once.
    Orphan orphanKind(int classDirectory, const FileURL& entry, ContainerClass containerClass);
    void reportOrphan(const FileURL& entry);
    /// `classDirectory` is open and holds the entries.
    void discard(const std::vector<FileURL>& leftovers, std::optional<std::uint32_t> owner);
    std::uint64_t removeOrphans(int classDirectory, const std::vector<FileURL>& entries, ContainerClass containerClass,
                                std::optional<std::uint32_t> owner);

    const Needs needs_;
};

// Bringing the store into a consistent state before any client is served: once a boot, and at every launch.
//
// Runs on the thread that starts the daemon, alone, which holds no identifier lock; only the entitlement and group
// passes take identifier locks, for what they clear and delete. Neither setup fails: what goes wrong is logged and the
// next step runs. Every step may be repeated, so a stop anywhere is mended by the next launch: the boot's work is
// marked as done only when all of it ran. A daemon that is told to end stops between two items.

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
