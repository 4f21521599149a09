// SPDX-License-Identifier: Apache-2.0
// The passes of the first launch after a boot over what lies on the disk.
#pragma once

#include "base/ContainerClass.h"
#include "base/FileURL.h"
#include "base/Log.h"
#include "fs/ZORFileManager.h"
#include "operations/ContainerRemoval.h"
#include "operations/DeathRow.h"
#include "operations/InfoValues.h"
#include "platform/Device.h"
#include "store/SetupProgress.h"
#include "store/ZORContainerCache.h"
#include "store/ZOREntitlementMapping.h"
#include "store/ZORGlobalConfiguration.h"
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
// The owner of a class directory can rename anything to a name in it. So only what belongs to the owner of its
// containers goes; another's directory stays, and is said.
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

} // namespace zor
