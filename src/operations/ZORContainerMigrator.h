// SPDX-License-Identifier: Apache-2.0
// Brings the containers of an older system to where this one keeps them, at the first launch after a boot, before any
// client is served: bundle containers once, from the mobile user's home to the system's place and to the installer's
// ownership; well-known system containers to their fixed names, each time.
//
// No marker is written while something could not be read or written that the next boot may be able to.
//
// What a stop leaves: of the bundle migration, containers in either place, each whole, and no marker; the next boot
// goes on where it stopped. Of the well-known one, containers under either name; the same. Takes no identifier locks.
#pragma once

#include "base/ContainerClass.h"
#include "base/FileURL.h"
#include "base/Result.h"
#include "platform/Device.h"

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace zor {

class ZORMetadata;
struct StoreServices;

class ZORContainerMigrator {
public:
    ZORContainerMigrator(StoreServices& services, const platform::SystemVersionQuery& systemVersion)
        : services_(services), systemVersion_(systemVersion) {}
    ZORContainerMigrator(const ZORContainerMigrator&) = delete;
    ZORContainerMigrator& operator=(const ZORContainerMigrator&) = delete;

    // Markers: a file that says that something need not be done again, and to people when it was.
    void writeMigrationFileToDiskWithName(std::string_view name, const FileURL& directory);
    void writeMigrationFileToDiskWithName(std::string_view name);
    [[nodiscard]] bool existsMigrationFileWithName(std::string_view name);
    /// Whether the marker is known not to be there: one that cannot be examined makes nothing happen a second time.
    [[nodiscard]] bool isDue(std::string_view name);

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
    /// What was moved and given away is on the disk before the marker can be.
    int orderBeforeMarker(const FileURL& bundles);

    bool migrateWellknownOfClass(ContainerClass containerClass, Outcome& outcome);
    Result<bool> migrateWellknown(const std::shared_ptr<ZORMetadata>& record, ContainerClass containerClass,
                                  const FileURL& classDirectory);

    StoreServices& services_;
    const platform::SystemVersionQuery& systemVersion_;
};

} // namespace zor
