// SPDX-License-Identifier: Apache-2.0
// What each identifier is entitled to: the persistent map from which every decision about shared containers is made.
//
// One file, loaded once, written whole after each change. The map is touched only on the entitlement queue, which
// public operations enter synchronously; it is a mutex here, since nothing ever runs on it by itself. Operations whose
// names begin with _onQueue_ run inside it and never enter it again.
//
// Storing and asking is in ZOREntitlementMapping.cc; what a change of entitlements makes of containers is in
// ZOREntitlementProcessing.cc; what a boot brings in line, in FirstBootPasses.cc.
//
// A stop during a save leaves the old file or the new one. A file that is there but cannot be read is moved aside
// before anything is saved: as long as it lies there, nothing may be deleted because the map does not mention it
// (lostFile). Only a second one, found while the first still lies aside, is written over.
#pragma once

#include "base/Mutex.h"
#include "base/Result.h"
#include "operations/StoreServices.h"
#include "plist/Value.h"
#include "store/EntitlementFile.h"
#include "store/ZORGlobalConfiguration.h"

#include <atomic>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

namespace zor {

class ZOREntitlementMapping {
public:
    using Identifiers = std::optional<std::vector<std::string>>;

    /// Loads the map. `services` may still be in the making; it is used from the first change on.
    ZOREntitlementMapping(const Log& log, ZORFileManager& fileManager, ZORGlobalConfiguration& configuration,
                          StoreServices& services);
    ZOREntitlementMapping(const ZOREntitlementMapping&) = delete;
    ZOREntitlementMapping& operator=(const ZOREntitlementMapping&) = delete;

    [[nodiscard]] bool entitlementsExistForIdentifier(std::string_view identifier) ZOR_EXCLUDES(entitlementQueue_);
    [[nodiscard]] bool identifierHasCallerRegisteredEntitlements(std::string_view identifier)
        ZOR_EXCLUDES(entitlementQueue_);
    [[nodiscard]] bool identifierHasSystemContainer(std::string_view identifier) ZOR_EXCLUDES(entitlementQueue_);
    [[nodiscard]] Identifiers appGroupIdentifiersForIdentifier(std::string_view identifier)
        ZOR_EXCLUDES(entitlementQueue_);
    /// Without those that do not begin with "systemgroup.".
    [[nodiscard]] Identifiers systemGroupIdentifiersForIdentifier(std::string_view identifier)
        ZOR_EXCLUDES(entitlementQueue_);

    /// Registers, changes or (`entitlements` nullptr) removes the entitlements of one identifier, under the
    /// all-identifiers lock held for writing; what changes nothing takes neither that lock nor the disk. System and
    /// group containers that nothing refers to afterwards are staged for deletion. `options` may be nullptr.
    /// Codes: success; 18 without an identifier; 11 for an identifier that is a key of the map's own, or a parent that
    /// is no string; 59 when the file cannot be written; 40.
    ErrorCode processEntitlements(const plist::Dictionary* entitlements, const std::string* identifier,
                                  const plist::Dictionary* options) ZOR_EXCLUDES(entitlementQueue_);
    /// Whether a peer with this identifier has to be registered as it comes: it has never been, or it was registered so
    /// and processing it with these arguments would change something. One short visit to the queue: asked for every
    /// message.
    [[nodiscard]] bool callerRegistrationIsDue(const std::string& identifier, const plist::Dictionary& entitlements,
                                               const plist::Dictionary& options) ZOR_EXCLUDES(entitlementQueue_);
    /// Another one after each change of what callerRegistrationIsDue tells; never 0. An answer of it holds while the
    /// generation is the one that was read before it was asked for. One atomic read.
    [[nodiscard]] std::uint64_t generation() const { return generation_.load(std::memory_order_acquire); }
    /// Removes what is stored for an identifier and for the children recorded for it. The caller holds the
    /// all-identifiers lock, or knows why it need not.
    void removeEntitlementDictionariesForIdentifierAndItsChildren(const std::string& identifier)
        ZOR_EXCLUDES(entitlementQueue_);

    /// A copy of the whole map.
    [[nodiscard]] plist::Dictionary entitlementMappingDict() ZOR_EXCLUDES(entitlementQueue_);

    /// Stores a value under each key (an empty dictionary removes the key) and saves once, when anything changed. Error
    /// 60 when the counts differ, 59 when the save fails: the map in memory then keeps the change, and the next call
    /// saves it even when it changes nothing.
    Result<void> _setEntitlementDictionaryValues(const std::vector<plist::Dictionary>& values,
                                                 const std::vector<std::string>& identifiers)
        ZOR_EXCLUDES(entitlementQueue_);

    // The first launch after a boot (FirstBootPasses.cc), before clients are served. Failures are logged and passed
    // over. Both give the number of containers that they changed.
    /// Moves the group identifiers that older systems kept in data containers into the map; once for the device.
    std::uint64_t migrateAppGroupIdsFromDataContainersToFile() ZOR_EXCLUDES(entitlementQueue_);
    /// Whether that has been done, at this boot at the latest, or there is nobody for whom it would have to be. As long
    /// as not, groups may be in use that the map does not mention. Asked of the disk each time; enters no queue.
    [[nodiscard]] bool groupIdsAreMigrated();
    /// Stages system containers that no identifier is entitled to for deletion.
    std::uint64_t reconcileSystemContainers() ZOR_EXCLUDES(entitlementQueue_);

    /// Where an entitlement file that could not be read lies, while it does. Asked of the disk each time.
    [[nodiscard]] std::optional<FileURL> lostFile();
    [[nodiscard]] std::size_t entryCount() ZOR_EXCLUDES(entitlementQueue_);

private:
    [[nodiscard]] plist::Dictionary _readEntitlementMappingFromDisk();
    Result<void> _writeEntitlementMappingToDisk() ZOR_REQUIRES(entitlementQueue_);
    /// An error, not logged, when it could not be moved. One that lies aside already lets this one stay.
    Result<void> moveUnreadableFileAside();
    [[nodiscard]] bool unreadFileIsInPlace();

    /// A group entitlement as a list without repetitions; what is neither an array of strings nor a string is said and
    /// ignored. `entitlements` may be nullptr.
    [[nodiscard]] Identifiers _copyApplicationGroupEntitlementForIdentifier(std::string_view identifier,
                                                                            const plist::Dictionary* entitlements,
                                                                            std::string_view groupKey) const;
    [[nodiscard]] const plist::Dictionary* entitlementsOf(std::string_view identifier) const
        ZOR_REQUIRES(entitlementQueue_);
    [[nodiscard]] bool _onQueue_identifierHasCallerRegisteredEntitlements(std::string_view identifier) const
        ZOR_REQUIRES(entitlementQueue_);
    [[nodiscard]] bool _onQueue_identifierHasSystemContainer(std::string_view identifier) const
        ZOR_REQUIRES(entitlementQueue_);
    [[nodiscard]] Identifiers _onQueue_appGroupIdentifiersForIdentifier(std::string_view identifier) const
        ZOR_REQUIRES(entitlementQueue_);
    [[nodiscard]] Identifiers _onQueue_systemGroupIdentifiersForIdentifier(std::string_view identifier) const
        ZOR_REQUIRES(entitlementQueue_);

    /// What a call of processEntitlements will store, in this order.
    struct StagedChange {
        std::vector<plist::Dictionary> values;
        std::vector<std::string> keys;
        /// The identifier's own entitlements are among it.
        bool entitlementsChange = false;

        [[nodiscard]] bool empty() const { return keys.empty(); }
        void add(std::string_view key, plist::Dictionary value);
    };
    enum class SayStaging { no, yes };

    [[nodiscard]] StagedChange _onQueue_stage(const plist::Dictionary* entitlements, const std::string& identifier,
                                              const plist::Dictionary* options, SayStaging say) const
        ZOR_REQUIRES(entitlementQueue_);
    void _onQueue_stageChildBundles(StagedChange& staged, const std::string& identifier,
                                    const plist::Dictionary* options, SayStaging say) const
        ZOR_REQUIRES(entitlementQueue_);
    void _onQueue_stageFlag(StagedChange& staged, std::string_view key, const std::string& identifier,
                            const plist::Dictionary* options) const ZOR_REQUIRES(entitlementQueue_);
    /// False, logged, on failure.
    bool migrateGroupIdentifiers(const ZORMetadata& container) ZOR_EXCLUDES(entitlementQueue_);
    /// nullopt, logged, when that cannot be known.
    std::optional<std::set<std::string, std::less<>>> ownersOfSystemContainers() ZOR_EXCLUDES(entitlementQueue_);

    ErrorCode _onQueue_processEntitlements(const plist::Dictionary* entitlements, const std::string& identifier,
                                           const plist::Dictionary* options) ZOR_REQUIRES(entitlementQueue_);
    Result<void> _onQueue_process(const plist::Dictionary* entitlements, const std::string& identifier,
                                  const plist::Dictionary* options) ZOR_REQUIRES(entitlementQueue_);
    void _onQueue_releaseSystemContainer(const plist::Dictionary* entitlements, const std::string& identifier)
        ZOR_REQUIRES(entitlementQueue_);
    void _onQueue_releaseGroups(const plist::Dictionary* entitlements, const std::string& identifier)
        ZOR_REQUIRES(entitlementQueue_);
    Result<void> _onQueue_setEntitlementDictionaryValues(const std::vector<plist::Dictionary>& values,
                                                         const std::vector<std::string>& identifiers)
        ZOR_REQUIRES(entitlementQueue_);

    const Log& log_;
    ZORFileManager& fileManager_;
    ZORGlobalConfiguration& configuration_;
    StoreServices& services_;
    const FileURL entitlementMappingFileUrl_;
    const FileURL unreadableFileUrl_;
    /// The file that could not be read had its name still when that was last looked at. Set while the map is loaded.
    std::atomic<bool> fileIsUnread_{false};
    /// This process has done the migration, whether or not it could be marked as done.
    std::atomic<bool> groupIdsAreMigrated_{false};
    /// Raised on the queue, before the map changes.
    std::atomic<std::uint64_t> generation_{1};
    platform::Mutex entitlementQueue_;
    plist::Dictionary entitlementMappingDict_ ZOR_GUARDED_BY(entitlementQueue_);
    /// The last save failed: the map is ahead of the file, and no change may be answered with success before one
    /// succeeds.
    bool unsaved_ ZOR_GUARDED_BY(entitlementQueue_) = false;
};

} // namespace zor
