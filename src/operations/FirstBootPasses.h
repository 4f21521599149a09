// SPDX-License-Identifier: Apache-2.0
// Bringing the containers on disk in line with the entitlement map, at the first launch after a boot.
//
// A stop in the middle leaves the rest as it was and no marker; the next boot does all of it again, and writing an
// entry once more changes nothing. Before clients are served, on the thread that starts the daemon.
#pragma once

#include "base/Log.h"
#include "operations/ContainerRemoval.h"
#include "operations/InfoValues.h"
#include "store/MigrationMarkers.h"
#include "store/SetupReport.h"
#include "store/ZORContainerCache.h"
#include "store/ZOREntitlementMapping.h"
#include "store/ZORGlobalConfiguration.h"

#include <cstdint>
#include <optional>
#include <set>
#include <string>

namespace zor {

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

} // namespace zor
