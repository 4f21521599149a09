// SPDX-License-Identifier: Apache-2.0
// The entitlements of each identifier: the persistent map from which every decision about shared containers is made.
//
// One file, loaded once, written whole. The map is touched only on the entitlement queue, which public operations enter
// synchronously; it is a mutex here, since nothing ever runs on it by itself, and nobody waits for the disk on it.
// Operations whose names begin with _onQueue_ run inside it and never enter it again. No container is looked for or
// moved here: a change is planned, the caller does what it means for containers, the change is applied to the map, and
// it is saved when the caller has let its locks go. Readers see each change whole, or not yet.
//
// Changes are numbered as they are applied, and one save takes along all that have been applied when it begins: the
// others' savers find that done. No client is told of a change before it is saved, not even one that asks for what
// another client's unsaved change has stored already.
//
// A stop during a save leaves the old file or the new one. A file that is there but cannot be read is moved aside
// before anything is saved: as long as it lies there, nothing may be deleted because the map does not mention it
// (lostFile). Only a second one, found while the first still lies aside, is written over.
#pragma once

#include "base/Mutex.h"
#include "base/ZORError.h"
#include "base/ZORLocks.h"
#include "plist/Value.h"
#include "store/Configuration.h"
#include "store/EntitlementFile.h"
#include "store/SetupProgress.h"

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zor {

class ZOREntitlementMapping {
public:
    using Identifiers = std::optional<std::vector<std::string>>;

    /// Loads the map.
    ZOREntitlementMapping(const Log& log, ZORFileManager& fileManager, ZORGlobalConfiguration& configuration,
                          MigrationMarkers& markers);
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
    /// Whether anything is stored about groups of the type, whatever it is.
    [[nodiscard]] bool mayHaveGroups(std::string_view identifier, GroupType type) ZOR_EXCLUDES(entitlementQueue_);
    /// The identifiers that refer to each group.
    [[nodiscard]] GroupReferences groupReferences(GroupType type) ZOR_EXCLUDES(entitlementQueue_);
    /// The children recorded for an identifier.
    [[nodiscard]] std::vector<std::string> childrenOf(const std::string& identifier) ZOR_EXCLUDES(entitlementQueue_);
    /// A copy of the whole map.
    [[nodiscard]] plist::Dictionary entitlementMappingDict() ZOR_EXCLUDES(entitlementQueue_);
    [[nodiscard]] std::size_t entryCount() ZOR_EXCLUDES(entitlementQueue_);

    /// All that registering, changing or (`entitlements` nullptr) removing the entitlements of one identifier would
    /// store and release. Holds as long as nobody changes the map.
    struct Plan {
        std::string identifier;
        // To be stored, in this order.
        std::vector<plist::Dictionary> values;
        std::vector<std::string> keys;
        bool releasesSystemContainer = false;
        /// The groups of one type before and after. Both absent: the entitlements are not among the change, or say
        /// nothing of such groups.
        struct Groups {
            GroupType type;
            Identifiers before{};
            Identifiers after{};
        };
        std::array<Groups, 2> groups{{{GroupType::application}, {GroupType::system}}};

        void add(std::string_view key, plist::Dictionary value);
    };
    [[nodiscard]] Plan plan(const plist::Dictionary* entitlements, const std::string& identifier,
                            const plist::Dictionary* options, const AllIdentifiersWriteLock& lock)
        ZOR_EXCLUDES(entitlementQueue_);
    /// A change of the map by its number; later ones have larger numbers.
    using Change = std::uint64_t;
    /// Puts a plan that was made under the same lock into the map. The change that has to be saved before anybody is
    /// told; nullopt when the file says all of it. Error 59 for more than the file may hold: nothing has changed then.
    Result<std::optional<Change>> apply(const Plan& plan, const AllIdentifiersWriteLock& lock)
        ZOR_EXCLUDES(entitlementQueue_);
    /// Returns when the file holds the change, and those before it. `before` runs when it has been settled which
    /// changes are saved, and before they are: it makes durable what must not come after them. Error 59 when the file
    /// cannot be written: the map keeps the change, and the next call saves it even when it changes nothing. The caller
    /// holds no lock.
    Result<void> save(Change change, const std::function<void()>& before = {}) ZOR_EXCLUDES(saving_, entitlementQueue_);
    /// Whether a change would store nothing, and nothing is left to be saved that it would have stored.
    [[nodiscard]] bool changesNothing(const plist::Dictionary* entitlements, const std::string& identifier,
                                      const plist::Dictionary* options) ZOR_EXCLUDES(entitlementQueue_);
    /// Whether a peer with this identifier has to be registered as it comes: it has never been, or it was registered so
    /// and processing it with these arguments would change something. One short visit to the queue: asked for every
    /// message.
    [[nodiscard]] bool callerRegistrationIsDue(const std::string& identifier, const plist::Dictionary& entitlements,
                                               const plist::Dictionary& options) ZOR_EXCLUDES(entitlementQueue_);
    /// A number that changes with each change of the answer of callerRegistrationIsDue for the identifier; never 0. An
    /// answer holds while the number is the one that was read before the question. Two atomic reads.
    [[nodiscard]] std::uint64_t generation(std::string_view identifier) const {
        return generation_.load(std::memory_order_acquire) +
               generationOfGroup_[identifierGroupOf(identifier)].load(std::memory_order_acquire);
    }

    /// Stores a value under each key (an empty dictionary removes the key) and saves once, when anything changed. Error
    /// 60 when the counts differ, 59 as above.
    Result<void> _setEntitlementDictionaryValues(const std::vector<plist::Dictionary>& values,
                                                 const std::vector<std::string>& identifiers)
        ZOR_EXCLUDES(saving_, entitlementQueue_);
    /// Adds what an older system kept to what is stored for an identifier, of which nothing goes. Error 59.
    Result<void> uniteEntitlements(const std::string& identifier, const plist::Dictionary& older)
        ZOR_EXCLUDES(saving_, entitlementQueue_);

    /// Whether the group identifiers that older systems kept in data containers are in the map, since this boot at the
    /// latest, or there is nobody for whom they would have to be. As long as not, groups may be in use that the map
    /// does not mention. Asked of the disk each time; enters no queue.
    [[nodiscard]] bool groupIdsAreMigrated();
    /// This process has done that migration, whether or not it could be marked as done.
    void setGroupIdsMigrated(bool migrated) { groupIdsAreMigrated_ = migrated; }

    /// The place of an entitlement file that could not be read, while it lies there. Asked of the disk each time.
    [[nodiscard]] std::optional<FileURL> lostFile();

private:
    [[nodiscard]] plist::Dictionary _readEntitlementMappingFromDisk();
    Result<void> _writeEntitlementMappingToDisk(const plist::Dictionary& map) ZOR_REQUIRES(saving_);
    ZORError notWritten(const ZORError& cause) const;
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

    enum class SayStaging { no, yes };
    /// The values of a plan. Whether the identifier's own entitlements are among them.
    bool _onQueue_stage(Plan& plan, const plist::Dictionary* entitlements, const std::string& identifier,
                        const plist::Dictionary* options, SayStaging say) const ZOR_REQUIRES(entitlementQueue_);
    void _onQueue_stageChildBundles(Plan& plan, const std::string& identifier, const plist::Dictionary* options,
                                    SayStaging say) const ZOR_REQUIRES(entitlementQueue_);
    void _onQueue_stageFlag(Plan& plan, std::string_view key, const std::string& identifier,
                            const plist::Dictionary* options) const ZOR_REQUIRES(entitlementQueue_);
    /// The containers that go with the old entitlements.
    void _onQueue_stageReleases(Plan& plan, const plist::Dictionary* entitlements, const std::string& identifier) const
        ZOR_REQUIRES(entitlementQueue_);
    [[nodiscard]] bool _onQueue_changesNothing(const plist::Dictionary* entitlements, const std::string& identifier,
                                               const plist::Dictionary* options) const ZOR_REQUIRES(entitlementQueue_);
    void _onQueue_countChange(const std::vector<std::string>& keys, const std::vector<std::string>& whose)
        ZOR_REQUIRES(entitlementQueue_);
    /// `whose`: the identifiers that are told of the change.
    Result<std::optional<Change>> _onQueue_apply(const std::vector<plist::Dictionary>& values,
                                                 const std::vector<std::string>& keys,
                                                 const std::vector<std::string>& whose) ZOR_REQUIRES(entitlementQueue_);
    /// The value that was there. An empty one removes the key.
    std::optional<plist::Value> _onQueue_store(const std::string& key, std::optional<plist::Value> value)
        ZOR_REQUIRES(entitlementQueue_);
    [[nodiscard]] bool _onQueue_isSaved(const std::string& identifier) const ZOR_REQUIRES(entitlementQueue_);

    const Log& log_;
    ZORFileManager& fileManager_;
    ZORGlobalConfiguration& configuration_;
    MigrationMarkers& markers_;
    const FileURL entitlementMappingFileUrl_;
    const FileURL unreadableFileUrl_;
    /// The file that could not be read had its name still when that was last looked at. Set while the map is loaded.
    std::atomic<bool> fileIsUnread_{false};
    std::atomic<bool> groupIdsAreMigrated_{false};
    // Raised on the queue, before the map changes: by what may concern every identifier, and by what concerns those of
    // one group.
    std::atomic<std::uint64_t> generation_{1};
    std::array<std::atomic<std::uint64_t>, identifierGroupCount> generationOfGroup_{};
    /// Held while the file is written, never under the entitlement queue.
    platform::Mutex saving_;
    platform::Mutex entitlementQueue_;
    plist::Dictionary entitlementMappingDict_ ZOR_GUARDED_BY(entitlementQueue_);
    /// Memory of the map's keys and values.
    std::size_t heldBytes_ ZOR_GUARDED_BY(entitlementQueue_) = 0;
    /// The last that was applied, and the last that the file holds.
    Change applied_ ZOR_GUARDED_BY(entitlementQueue_) = 0;
    Change saved_ ZOR_GUARDED_BY(entitlementQueue_) = 0;
    /// No change at all may be answered with success before the file holds this one: its save has failed, or an
    /// exception has ended it half-way.
    Change owed_ ZOR_GUARDED_BY(entitlementQueue_) = 0;
    /// Those told of a change that is not saved: the last one of each.
    std::map<std::string, Change, std::less<>> unsaved_ ZOR_GUARDED_BY(entitlementQueue_);
};

} // namespace zor
