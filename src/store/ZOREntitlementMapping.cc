// SPDX-License-Identifier: Apache-2.0
#include "store/ZOREntitlementMapping.h"

#include "base/ContainerClass.h"
#include "base/Mutex.h"
#include "fs/Durability.h"
#include "ipc/Protocol.h"
#include "platform/Errno.h"
#include "plist/Value.h"
#include "store/StorePlaces.h"

#include <algorithm>
#include <cerrno>
#include <ranges>
#include <utility>

namespace zor {

using platform::MutexLock;

namespace {

constexpr const char* processFunction = "_onQueue_processEntitlements";
constexpr const char* setFunction = "_setEntitlementDictionaryValues";
/// A value's bytes in the file are at most so many times those in memory: text that is not ASCII takes two bytes for a
/// character, and each object a few for its place.
constexpr std::size_t fileBytesForHeld = 2;

/// The content under the map's own keys is the daemon's; anything else there counts as nothing.
plist::Dictionary copyOf(const plist::Dictionary* dictionary) {
    return dictionary ? *dictionary : plist::Dictionary();
}

} // namespace

ZOREntitlementMapping::ZOREntitlementMapping(const Log& log, ZORFileManager& fileManager,
                                             ZORGlobalConfiguration& configuration, MigrationMarkers& markers)
    : log_(log), fileManager_(fileManager), configuration_(configuration), markers_(markers),
      entitlementMappingFileUrl_(configuration.libraryDirectory().appendingFile(names::entitlementFile)),
      unreadableFileUrl_(
          entitlementMappingFileUrl_.deletingLastPathComponent().appendingFile(names::unreadableEntitlementFile)),
      entitlementMappingDict_(_readEntitlementMappingFromDisk()),
      heldBytes_(plist::heldBytes(entitlementMappingDict_)) {}

plist::Dictionary ZOREntitlementMapping::_readEntitlementMappingFromDisk() {
    auto map = readEntitlementFile(entitlementMappingFileUrl_, fileManager_);
    if (map)
        return std::move(*map);
    log_.write(logLevelError, __func__, "Failed to read entitlement mapping file at %s.  It may not exist yet",
               entitlementMappingFileUrl_.c_str());
    if (!map.error().isPosix(ENOENT)) {
        log_.write(logLevelError, __func__, "%s", map.error().text().c_str());
        if (const auto moved = moveUnreadableFileAside(); !moved)
            log_.write(logLevelError, __func__, "%s", moved.error().text().c_str());
    }
    return {};
}

Result<void> ZOREntitlementMapping::moveUnreadableFileAside() {
    fileIsUnread_ = true;
    // An earlier loss that nobody has looked at is not written over.
    if (fileManager_.itemExistsAtURL(unreadableFileUrl_)) {
        log_.write(logLevelError, __func__,
                   "%s lies there already; the unreadable file is left where it is, until the map is saved",
                   unreadableFileUrl_.c_str());
        return {};
    }
    if (!fileManager_.itemDoesNotExistAtURL(unreadableFileUrl_))
        return posixError(ZOR_HERE, Errno(EIO), "stat of %s failed: %s", unreadableFileUrl_.c_str(), Errno(EIO).text());
    TRY(fileManager_.moveItemAtURL(entitlementMappingFileUrl_, unreadableFileUrl_));
    fileIsUnread_ = false;
    log_.write(logLevelError, __func__,
               "Moved it to %s. Until that file is removed, nothing is deleted for want of an entitlement",
               unreadableFileUrl_.c_str());
    return {};
}

bool ZOREntitlementMapping::unreadFileIsInPlace() {
    return fileIsUnread_ && !fileManager_.itemDoesNotExistAtURL(entitlementMappingFileUrl_);
}

std::optional<FileURL> ZOREntitlementMapping::lostFile() {
    if (!fileManager_.itemDoesNotExistAtURL(unreadableFileUrl_))
        return unreadableFileUrl_;
    if (unreadFileIsInPlace())
        return entitlementMappingFileUrl_;
    return std::nullopt;
}

ZORError ZOREntitlementMapping::notWritten(const ZORError& cause) const {
    return Reporter(log_, "_writeEntitlementMappingToDisk")
        .error(ErrorCode::entitlementFileNotWritten, &cause, "Failed to write entitlement mapping file at %s",
               entitlementMappingFileUrl_.c_str());
}

Result<void> ZOREntitlementMapping::_writeEntitlementMappingToDisk(const plist::Dictionary& map) {
    configuration_.libraryDirectory(); // makes it again should it have gone
    auto written = unreadFileIsInPlace() ? moveUnreadableFileAside() : Result<void>();
    if (written)
        written = writeToURL(map, entitlementMappingFileUrl_, writeAtomically | writeWithoutProtection,
                             entitlementFileBytesMax, fileManager_);
    if (!written)
        return notWritten(written.error());
    fileIsUnread_ = false;
    return {};
}

Result<void> ZOREntitlementMapping::_setEntitlementDictionaryValues(const std::vector<plist::Dictionary>& values,
                                                                    const std::vector<std::string>& identifiers) {
    std::optional<Change> change;
    {
        const MutexLock held(entitlementQueue_);
        change = TRY(_onQueue_apply(values, identifiers, identifiers));
    }
    return change ? save(*change) : Result<void>();
}

std::optional<plist::Value> ZOREntitlementMapping::_onQueue_store(const std::string& key,
                                                                  std::optional<plist::Value> value) {
    const plist::Value* const current = entitlementMappingDict_.find(key);
    std::optional<plist::Value> before = current ? std::optional(*current) : std::nullopt;
    const auto held = [&](const std::optional<plist::Value>& one) {
        return one ? sizeof(std::string) + key.size() + plist::heldBytes(*one) : 0;
    };
    ZOR_ASSERT(heldBytes_ >= held(before));
    const std::size_t bytes = heldBytes_ - held(before) + held(value);
    if (value)
        entitlementMappingDict_.set(key, std::move(*value));
    else
        entitlementMappingDict_.erase(key);
    heldBytes_ = bytes;
    return before;
}

void ZOREntitlementMapping::_onQueue_countChange(const std::vector<std::string>& keys,
                                                 const std::vector<std::string>& whose) {
    // That list tells others whose children they are.
    if (std::ranges::find(keys, entitlementMapKeys::childPluginBundleIds) != keys.end())
        generation_.fetch_add(1, std::memory_order_acq_rel);
    for (const std::string& identifier : whose)
        generationOfGroup_[identifierGroupOf(identifier)].fetch_add(1, std::memory_order_acq_rel);
}

Result<std::optional<ZOREntitlementMapping::Change>>
ZOREntitlementMapping::_onQueue_apply(const std::vector<plist::Dictionary>& values,
                                      const std::vector<std::string>& keys, const std::vector<std::string>& whose) {
    const Reporter report(log_, setFunction);
    if (values.size() != keys.size())
        return report.error(ErrorCode::entitlementCountsDiffer,
                            "Can't act on an invalid input: values count: %ld, IDs count: %ld",
                            static_cast<long>(values.size()), static_cast<long>(keys.size()));
    _onQueue_countChange(keys, whose);
    std::vector<std::pair<std::string, std::optional<plist::Value>>> previous;
    const Change owed = owed_;
    const Change change = applied_ + 1;
    for (std::size_t i = 0; i < values.size(); ++i) {
        const bool hasValue = !values[i].empty();
        const plist::Value* current = entitlementMappingDict_.find(keys[i]);
        const plist::Dictionary* currentDictionary = current ? current->asDictionary() : nullptr;
        const bool unchanged = hasValue ? currentDictionary && *currentDictionary == values[i] : !current;
        if (unchanged)
            continue;
        owed_ = applied_ = change; // and so it stays if anything below throws
        previous.emplace_back(keys[i], std::nullopt);
        previous.back().second =
            _onQueue_store(keys[i], hasValue ? std::optional<plist::Value>(values[i]) : std::nullopt);
        if (log_.writes(logLevelDebug)) {
            const plist::Value shown(values[i]);
            report.write(logLevelDebug, "Staging Entitlement Mapping for ID: %s : %s", ZOR_SHOWN(keys[i]),
                         plist::describe(hasValue ? &shown : nullptr).c_str());
        }
    }
    if (previous.empty()) {
        Change earlier = owed_;
        for (const std::string& one : whose)
            if (const auto unsaved = unsaved_.find(one); unsaved != unsaved_.end())
                earlier = std::max(earlier, unsaved->second);
        return earlier > saved_ ? std::optional(earlier) : std::nullopt;
    }
    Result<plist::Data> fits = plist::Data();
    if (heldBytes_ > entitlementFileBytesMax / fileBytesForHeld)
        fits = serialisedFor(entitlementMappingFileUrl_, entitlementMappingDict_, entitlementFileBytesMax);
    if (!fits) { // no save could succeed any more: this change alone is refused
        for (auto& [key, value] : previous | std::views::reverse)
            _onQueue_store(key, std::move(value));
        owed_ = owed;
        return notWritten(fits.error());
    }
    for (const std::string& one : whose)
        unsaved_[one] = change;
    owed_ = owed;
    return change;
}

Result<void> ZOREntitlementMapping::save(Change change, const std::function<void()>& before) {
    const platform::BlockingScope blocking(platform::Load::heavy);
    const MutexLock saving(saving_);
    plist::Dictionary map;
    Change last = 0;
    {
        const MutexLock held(entitlementQueue_);
        if (saved_ >= change)
            return {};
        ZOR_ASSERT(change <= applied_);
        map = entitlementMappingDict_;
        last = applied_;
    }
    if (before)
        before();
    auto written = _writeEntitlementMappingToDisk(map);
    const MutexLock held(entitlementQueue_);
    if (!written) {
        // Threads that were told that nothing is due ask again.
        generation_.fetch_add(1, std::memory_order_acq_rel);
        owed_ = std::max(owed_, last);
        log_.write(logLevelError, setFunction, "Error writing entitlement mappings to disk after set : %s",
                   written.error().text().c_str());
        return written;
    }
    saved_ = last;
    std::erase_if(unsaved_, [&](const auto& one) { return one.second <= last; });
    ZOR_LOG(log_, logLevelDebug, "Wrote entitlement mappings to disk after set");
    return {};
}

ZOREntitlementMapping::Identifiers ZOREntitlementMapping::_copyApplicationGroupEntitlementForIdentifier(
    std::string_view identifier, const plist::Dictionary* entitlements, std::string_view groupKey) const {
    const plist::Value* value = entitlements ? entitlements->find(groupKey) : nullptr;
    if (!value)
        return std::nullopt;
    if (const std::string* one = value->asString())
        return std::vector<std::string>{*one};
    const std::string key(groupKey);
    const std::string whose(identifier);
    const plist::Array* array = value->asArray();
    if (!array) {
        log_.write(logLevelError, __func__, "Entitlement %s for %s does not contain supported types; ignoring.",
                   key.c_str(), ZOR_SHOWN(whose));
        return std::nullopt;
    }
    std::vector<std::string> identifiers;
    for (const plist::Value& element : *array) {
        const std::string* group = element.asString();
        if (!group) {
            log_.write(logLevelError, __func__, "Entitlement %s for %s contains non-string values; ignoring.",
                       key.c_str(), ZOR_SHOWN(whose));
            return std::nullopt;
        }
        identifiers.push_back(*group);
    }
    std::ranges::sort(identifiers);
    identifiers.erase(std::ranges::unique(identifiers).begin(), identifiers.end());
    return identifiers;
}

const plist::Dictionary* ZOREntitlementMapping::entitlementsOf(std::string_view identifier) const {
    return entitlementMappingDict_.dictionary(identifier);
}

bool ZOREntitlementMapping::_onQueue_identifierHasCallerRegisteredEntitlements(std::string_view identifier) const {
    const plist::Dictionary* flags = entitlementMappingDict_.dictionary(entitlementMapKeys::registeredByCaller);
    return flags && flags->isTrue(identifier);
}

bool ZOREntitlementMapping::_onQueue_identifierHasSystemContainer(std::string_view identifier) const {
    return ownsSystemContainer(entitlementMappingDict_, identifier);
}

ZOREntitlementMapping::Identifiers
ZOREntitlementMapping::_onQueue_appGroupIdentifiersForIdentifier(std::string_view identifier) const {
    return _copyApplicationGroupEntitlementForIdentifier(identifier, entitlementsOf(identifier),
                                                         entitlementKeys::applicationGroups);
}

ZOREntitlementMapping::Identifiers
ZOREntitlementMapping::_onQueue_systemGroupIdentifiersForIdentifier(std::string_view identifier) const {
    const plist::Dictionary* entitlements = entitlementsOf(identifier);
    Identifiers groups =
        _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, entitlementKeys::systemGroups);
    if (!groups || groups->empty())
        groups = _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements,
                                                               entitlementKeys::systemGroupContainers);
    if (groups)
        std::erase_if(*groups, [&](const std::string& group) {
            if (group.starts_with(systemGroupPrefix))
                return false;
            log_.write(logLevelError, "_onQueue_systemGroupIdentifiersForIdentifier",
                       "System group ID %s does not have proper prefix, ignoring.", ZOR_SHOWN(group));
            return true;
        });
    return groups;
}

void ZOREntitlementMapping::Plan::add(std::string_view key, plist::Dictionary value) {
    keys.emplace_back(key);
    values.push_back(std::move(value));
}

void ZOREntitlementMapping::_onQueue_stageChildBundles(Plan& plan, const std::string& identifier,
                                                       const plist::Dictionary* options, SayStaging say) const {
    const plist::Dictionary* stored = entitlementMappingDict_.dictionary(entitlementMapKeys::childPluginBundleIds);
    const std::string* parent = options ? options->string(ipc::keys::parentBundleIdOption) : nullptr;
    if (!parent) {
        if (!stored || !stored->find(identifier))
            return;
        plist::Dictionary childMap = *stored;
        childMap.erase(identifier);
        plan.add(entitlementMapKeys::childPluginBundleIds, std::move(childMap));
        return;
    }
    const plist::Array* children = stored ? stored->array(*parent) : nullptr;
    if (children && std::ranges::find(*children, plist::Value(identifier)) != children->end())
        return;
    plist::Array childList = children ? *children : plist::Array();
    childList.emplace_back(identifier);
    if (say == SayStaging::yes && log_.writes(logLevelDebug)) {
        const plist::Value shown(childList);
        log_.write(logLevelDebug, processFunction, "Staging Child Bundles: %s for parent ID: %s by appending: %s",
                   plist::describe(&shown).c_str(), ZOR_SHOWN(*parent), ZOR_SHOWN(identifier));
    }
    plist::Dictionary childMap = copyOf(stored);
    childMap.set(*parent, std::move(childList));
    plan.add(entitlementMapKeys::childPluginBundleIds, std::move(childMap));
}

void ZOREntitlementMapping::_onQueue_stageFlag(Plan& plan, std::string_view key, const std::string& identifier,
                                               const plist::Dictionary* options) const {
    const plist::Dictionary* stored = entitlementMappingDict_.dictionary(key);
    const bool wanted = options && options->isTrue(key);
    const bool isThere = stored && stored->find(identifier);
    if (wanted == isThere)
        return;
    plist::Dictionary flags = copyOf(stored);
    if (wanted)
        flags.set(identifier, true);
    else
        flags.erase(identifier);
    plan.add(key, std::move(flags));
}

bool ZOREntitlementMapping::_onQueue_stage(Plan& plan, const plist::Dictionary* entitlements,
                                           const std::string& identifier, const plist::Dictionary* options,
                                           SayStaging say) const {
    _onQueue_stageChildBundles(plan, identifier, options, say);
    _onQueue_stageFlag(plan, entitlementMapKeys::registeredByCaller, identifier, options);
    _onQueue_stageFlag(plan, entitlementMapKeys::placeholder, identifier, options);
    // An empty dictionary is how nothing is stored.
    const bool wanted = entitlements && !entitlements->empty();
    const plist::Dictionary* stored = entitlementsOf(identifier);
    const bool entitlementsChange =
        wanted ? !stored || *stored != *entitlements : entitlementMappingDict_.find(identifier) != nullptr;
    if (entitlementsChange)
        plan.add(identifier, copyOf(entitlements));
    return entitlementsChange;
}

void ZOREntitlementMapping::_onQueue_stageReleases(Plan& plan, const plist::Dictionary* entitlements,
                                                   const std::string& identifier) const {
    const bool keepsSystemContainer = entitlements && entitlements->isTrue(entitlementKeys::systemContainer);
    plan.releasesSystemContainer = !keepsSystemContainer && _onQueue_identifierHasSystemContainer(identifier);
    auto& [applicationGroups, systemGroups] = plan.groups;
    applicationGroups.before = _onQueue_appGroupIdentifiersForIdentifier(identifier);
    applicationGroups.after =
        _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, entitlementKeys::applicationGroups);
    systemGroups.after =
        _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, entitlementKeys::systemGroups);
    if (!systemGroups.after || systemGroups.after->empty())
        systemGroups.after = _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements,
                                                                           entitlementKeys::systemGroupContainers);
    systemGroups.before = _onQueue_systemGroupIdentifiersForIdentifier(identifier);
}

ZOREntitlementMapping::Plan ZOREntitlementMapping::plan(const plist::Dictionary* entitlements,
                                                        const std::string& identifier, const plist::Dictionary* options,
                                                        const AllIdentifiersWriteLock& /*held*/) {
    const MutexLock held(entitlementQueue_);
    Plan plan;
    plan.identifier = identifier;
    if (_onQueue_stage(plan, entitlements, identifier, options, SayStaging::yes))
        _onQueue_stageReleases(plan, entitlements, identifier);
    return plan;
}

Result<std::optional<ZOREntitlementMapping::Change>>
ZOREntitlementMapping::apply(const Plan& plan, const AllIdentifiersWriteLock& /*held*/) {
    const MutexLock held(entitlementQueue_);
    return _onQueue_apply(plan.values, plan.keys, {plan.identifier});
}

bool ZOREntitlementMapping::_onQueue_isSaved(const std::string& identifier) const {
    return owed_ <= saved_ && !unsaved_.contains(identifier);
}

bool ZOREntitlementMapping::_onQueue_changesNothing(const plist::Dictionary* entitlements,
                                                    const std::string& identifier,
                                                    const plist::Dictionary* options) const {
    Plan plan;
    _onQueue_stage(plan, entitlements, identifier, options, SayStaging::no);
    return plan.keys.empty() && _onQueue_isSaved(identifier);
}

bool ZOREntitlementMapping::changesNothing(const plist::Dictionary* entitlements, const std::string& identifier,
                                           const plist::Dictionary* options) {
    const MutexLock held(entitlementQueue_);
    return _onQueue_changesNothing(entitlements, identifier, options);
}

bool ZOREntitlementMapping::callerRegistrationIsDue(const std::string& identifier,
                                                    const plist::Dictionary& entitlements,
                                                    const plist::Dictionary& options) {
    const MutexLock held(entitlementQueue_);
    if (!_onQueue_identifierHasCallerRegisteredEntitlements(identifier))
        return entitlementMappingDict_.find(identifier) == nullptr;
    return !_onQueue_changesNothing(&entitlements, identifier, &options);
}

bool ZOREntitlementMapping::mayHaveGroups(std::string_view identifier, GroupType type) {
    const MutexLock held(entitlementQueue_);
    const plist::Dictionary* const entitlements = entitlementsOf(identifier);
    const auto has = [&](std::string_view key) { return entitlements && entitlements->find(key); };
    return type == GroupType::application
               ? has(entitlementKeys::applicationGroups)
               : has(entitlementKeys::systemGroups) || has(entitlementKeys::systemGroupContainers);
}

GroupReferences ZOREntitlementMapping::groupReferences(GroupType type) {
    const MutexLock held(entitlementQueue_);
    return groupReferencesIn(entitlementMappingDict_, type, &log_);
}

std::vector<std::string> ZOREntitlementMapping::childrenOf(const std::string& identifier) {
    const MutexLock held(entitlementQueue_);
    std::vector<std::string> names;
    const plist::Dictionary* childMap = entitlementMappingDict_.dictionary(entitlementMapKeys::childPluginBundleIds);
    if (const plist::Array* children = childMap ? childMap->array(identifier) : nullptr)
        for (const plist::Value& child : *children)
            if (const std::string* name = child.asString())
                names.push_back(*name);
    return names;
}

Result<void> ZOREntitlementMapping::uniteEntitlements(const std::string& identifier, const plist::Dictionary& older) {
    std::optional<Change> change;
    {
        const MutexLock held(entitlementQueue_);
        const plist::Dictionary* const entry = entitlementsOf(identifier);
        change = TRY(_onQueue_apply({entry ? plist::united(*entry, older) : older}, {identifier}, {identifier}));
    }
    return change ? save(*change) : Result<void>();
}

bool ZOREntitlementMapping::groupIdsAreMigrated() {
    if (groupIdsAreMigrated_ || markers_.existsMigrationFileWithName(names::groupIdMigrationMarker))
        return true;
    // Without that user the lists can never be fetched, and there is never a marker.
    return configuration_.homeOf(configuration_.users().first)->look().state == UserHome::State::noAccount;
}

bool ZOREntitlementMapping::entitlementsExistForIdentifier(std::string_view identifier) {
    const MutexLock held(entitlementQueue_);
    return entitlementMappingDict_.find(identifier) != nullptr;
}

bool ZOREntitlementMapping::identifierHasCallerRegisteredEntitlements(std::string_view identifier) {
    const MutexLock held(entitlementQueue_);
    return _onQueue_identifierHasCallerRegisteredEntitlements(identifier);
}

bool ZOREntitlementMapping::identifierHasSystemContainer(std::string_view identifier) {
    const MutexLock held(entitlementQueue_);
    return _onQueue_identifierHasSystemContainer(identifier);
}

ZOREntitlementMapping::Identifiers
ZOREntitlementMapping::appGroupIdentifiersForIdentifier(std::string_view identifier) {
    const MutexLock held(entitlementQueue_);
    return _onQueue_appGroupIdentifiersForIdentifier(identifier);
}

ZOREntitlementMapping::Identifiers
ZOREntitlementMapping::systemGroupIdentifiersForIdentifier(std::string_view identifier) {
    const MutexLock held(entitlementQueue_);
    return _onQueue_systemGroupIdentifiersForIdentifier(identifier);
}

plist::Dictionary ZOREntitlementMapping::entitlementMappingDict() {
    const MutexLock held(entitlementQueue_);
    return entitlementMappingDict_;
}

std::size_t ZOREntitlementMapping::entryCount() {
    const MutexLock held(entitlementQueue_);
    return entitlementMappingDict_.size();
}

} // namespace zor
