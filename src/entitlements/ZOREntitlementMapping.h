// SPDX-License-Identifier: Apache-2.0
// What each identifier is entitled to: the persistent map from which every decision about shared containers is made.
//
// One file, loaded once, written whole after each change. The map is touched only on the entitlement queue, which
// public operations enter synchronously; it is a mutex here, since nothing ever runs on it by itself. Operations whose
// names begin with _onQueue_ run inside it and never enter it again.
//
// A stop during a save leaves the old file or the new one. A file that is there but cannot be read is moved aside,
// never written over: as long as it lies there, nothing may be deleted because the map does not mention it (lostFile).
#pragma once

#include "daemon/base/Result.h"
#include "platform/Mutex.h"
#include "plist/Value.h"
#include "store/ZORGlobalConfiguration.h"

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zor {

/// Keys of the map that are no identifiers.
namespace entitlementMapKeys {
inline constexpr std::string_view childPluginBundleIds = "com.veltra.Zorvane.ChildPluginBundleIDs";
inline constexpr std::string_view registeredByCaller = "com.veltra.Zorvane.EntitlementsRegisteredByCaller";
inline constexpr std::string_view placeholder = "com.veltra.Zorvane.PlaceholderEntitlements";
} // namespace entitlementMapKeys

/// Keys inside an identifier's entitlements.
namespace entitlementKeys {
inline constexpr std::string_view applicationGroups = "com.veltra.security.application-groups";
inline constexpr std::string_view systemGroups = "com.veltra.security.system-groups";
inline constexpr std::string_view systemGroupContainers = "com.veltra.security.system-group-containers";
inline constexpr std::string_view systemContainer = "com.veltra.security.system-container";
} // namespace entitlementKeys

class ZOREntitlementMapping {
public:
    using Identifiers = std::optional<std::vector<std::string>>;

    /// Loads the map.
    ZOREntitlementMapping(const Log& log, ZORFileManager& fileManager, ZORGlobalConfiguration& configuration);
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

    /// Stores a value under each key (an empty dictionary removes the key) and saves once, when anything changed. Error
    /// 60 when the counts differ, 59 when the save fails: the map in memory then keeps the change, and the next call
    /// saves it even when it changes nothing.
    Result<void> _setEntitlementDictionaryValues(const std::vector<plist::Dictionary>& values,
                                                 const std::vector<std::string>& identifiers)
        ZOR_EXCLUDES(entitlementQueue_);

    /// Where an entitlement file that could not be read lies, while it does. Asked of the disk each time.
    [[nodiscard]] std::optional<FileURL> lostFile();
    [[nodiscard]] std::size_t entryCount() ZOR_EXCLUDES(entitlementQueue_);

private:
    [[nodiscard]] plist::Dictionary _readEntitlementMappingFromDisk();
    Result<void> _writeEntitlementMappingToDisk() ZOR_REQUIRES(entitlementQueue_);
    void moveUnreadableFileAside();

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

    const Log& log_;
    ZORFileManager& fileManager_;
    ZORGlobalConfiguration& configuration_;
    const FileURL entitlementMappingFileUrl_;
    platform::Mutex entitlementQueue_;
    plist::Dictionary entitlementMappingDict_ ZOR_GUARDED_BY(entitlementQueue_);
    /// The last save failed: the map is ahead of the file, and no change may be answered with success before one
    /// succeeds.
    bool unsaved_ ZOR_GUARDED_BY(entitlementQueue_) = false;
};

} // namespace zor
