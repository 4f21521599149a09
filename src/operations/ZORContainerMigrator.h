// SPDX-License-Identifier: Apache-2.0
// Brings the containers of an older system to where this one keeps them, at the first launch after a boot, before any
// client is served: bundle containers once, from the mobile user's home to the system's place and to the installer's
// ownership; well-known system containers to their fixed names, each time.
//
// No marker is written while something could not be read or written that the next boot may be able to.
//
// A stop leaves, of the bundle migration, containers in either place, each whole, and no marker; the next boot goes on
// where it stopped. A stop of the well-known one leaves containers under either name; the next boot goes on in the same
// way. Takes no identifier locks.
#pragma once

#include "base/ContainerClass.h"
#include "base/ZORError.h"
#include "fs/PathResolver.h"
#include "operations/DeathRow.h"
#include "operations/LastingMoves.h"
#include "store/Configuration.h"
#include "store/SetupProgress.h"
#include "store/ZORContainerCache.h"
#include "store/ZORWhitelist.h"

#include <cstdint>
#include <memory>
#include <optional>

namespace zor {

class ZORContainerMigrator {
public:
    struct Needs {
        const Log& log;
        ZORFileManager& fileManager;
        ZORGlobalConfiguration& configuration;
        ZORContainerCache& cache;
        const ZORWhitelist& whitelist;
        MigrationMarkers& markers;
        const LastingMoves& moves;
        DeathRow& deathRow;
        SetupReport& report;
    };
    explicit ZORContainerMigrator(const Needs& needs) : needs_(needs) {}
    ZORContainerMigrator(const ZORContainerMigrator&) = delete;
    ZORContainerMigrator& operator=(const ZORContainerMigrator&) = delete;

    struct Outcome {
        bool succeeded = true;
        /// The last error met; one that is set beside success was left behind on the way.
        std::optional<ZORError> error;
        /// Containers whose record or place was changed.
        std::uint64_t migrated = 0;
    };
    Outcome performMigrationWithError();
    Outcome performWhitelistMigrationWithError();

private:
    /// Why nothing may be concluded from the old place's not being there: its home is not, or an encryption hides it.
    /// Nothing is done then, and the next boot looks again.
    [[nodiscard]] std::optional<ZORError> cannotLook(const FileURL& former);
    [[nodiscard]] bool mayHoldBundles(const FileURL& former);
    Result<void> moveFormerBundles(const FileURL& former, const FileURL& bundles);
    /// Whether a directory belongs to another than the old owner of bundles.
    bool isOfAnother(const FileURL& directory);
    /// Whether the old place's class directories or containers do, all or some.
    bool holdsOfOthers(const FileURL& former);
    Result<void> moveEachFormerBundle(const FileURL& former);
    Result<void> moveFormerBundle(const FileURL& container, const FileURL& target);
    struct Count {
        std::uint64_t errors = 0;
        std::uint64_t migrated = 0;
        /// Those errors that the next boot may not meet: no marker then.
        std::uint64_t unfinished = 0;
        std::optional<ZORError> last;
    };
    void adoptBundlesOfClass(ContainerClass containerClass, Count& count);
    Result<void> adoptBundle(const FileURL& container);

    bool migrateWellknownOfClass(ContainerClass containerClass, Outcome& outcome);
    Result<bool> migrateWellknown(const std::shared_ptr<ZORMetadata>& record, ContainerClass containerClass,
                                  const FileURL& classDirectory);

    const Needs needs_;
};

} // namespace zor
