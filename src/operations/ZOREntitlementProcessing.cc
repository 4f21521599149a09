// SPDX-License-Identifier: Apache-2.0
// What a change of one identifier's entitlements makes of the map and of the containers that hang on it.
//
// A change is staged first: the parts of the map that will differ, in the order in which they are stored. Then the
// system container and the groups that go with the old entitlements are released, while the map still holds those, so
// that the last reference to a group still counts as one. The file is written once, at the end. A stop or a failed save
// in between leaves containers on death row that the old map still speaks of: asked for again, they are made anew.
#include "base/UserIdentity.h"
#include "ipc/Identifier.h"
#include "ipc/Keys.h"
#include "operations/StoreServices.h"
#include "operations/ZORClientConnection.h"
#include "operations/ZOREntitlementMapping.h"
#include "operations/ZORGroupManager.h"

#include <algorithm>
#include <exception>

namespace zor {

using platform::MutexLock;

namespace {

constexpr const char* processFunction = "_onQueue_processEntitlements";

const plist::Value* parentIn(const plist::Dictionary* options) {
    return options ? options->find(ipc::keys::parentBundleIdOption) : nullptr;
}

bool canBeProcessed(const std::string& identifier, const plist::Dictionary* options) {
    const plist::Value* parent = parentIn(options);
    const std::string* parentIdentifier = parent ? parent->asString() : nullptr;
    return !entitlementMapKeys::isOne(identifier) && ipc::isIdentifier(identifier) &&
           (!parent || (parentIdentifier && ipc::isIdentifier(*parentIdentifier)));
}

bool isGroupOrNoString(const plist::Value& value) {
    const std::string* text = value.asString();
    return !text || ipc::isIdentifier(*text);
}

/// Why the groups of the entitlements are none that containers can be made for; nullptr when they are. What is of
/// another type is judged where it is read.
const char* whyGroupsAreUnusable(const plist::Dictionary* entitlements) {
    for (const std::string_view key :
         {entitlementKeys::applicationGroups, entitlementKeys::systemGroups, entitlementKeys::systemGroupContainers}) {
        const plist::Value* groups = entitlements ? entitlements->find(key) : nullptr;
        const plist::Array* array = groups ? groups->asArray() : nullptr;
        if (array && array->size() > groupsMax)
            return "more groups than one identifier may have";
        if ((groups && !isGroupOrNoString(*groups)) || (array && !std::ranges::all_of(*array, isGroupOrNoString)))
            return "a group that is longer than an identifier may be";
    }
    return nullptr;
}

/// What is stored under the map's own keys is the daemon's; anything else there counts as nothing.
plist::Dictionary copyOf(const plist::Dictionary* dictionary) {
    return dictionary ? *dictionary : plist::Dictionary();
}

} // namespace

void ZOREntitlementMapping::StagedChange::add(std::string_view key, plist::Dictionary value) {
    keys.emplace_back(key);
    values.push_back(std::move(value));
}

void ZOREntitlementMapping::_onQueue_stageChildBundles(StagedChange& staged, const std::string& identifier,
                                                       const plist::Dictionary* options, SayStaging say) const {
    const plist::Dictionary* stored = entitlementMappingDict_.dictionary(entitlementMapKeys::childPluginBundleIds);
    const std::string* parent = options ? options->string(ipc::keys::parentBundleIdOption) : nullptr;
    if (!parent) {
        if (!stored || !stored->find(identifier))
            return;
        plist::Dictionary childMap = *stored;
        childMap.erase(identifier);
        staged.add(entitlementMapKeys::childPluginBundleIds, std::move(childMap));
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
    staged.add(entitlementMapKeys::childPluginBundleIds, std::move(childMap));
}

void ZOREntitlementMapping::_onQueue_stageFlag(StagedChange& staged, std::string_view key,
                                               const std::string& identifier, const plist::Dictionary* options) const {
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
    staged.add(key, std::move(flags));
}

ZOREntitlementMapping::StagedChange ZOREntitlementMapping::_onQueue_stage(const plist::Dictionary* entitlements,
                                                                          const std::string& identifier,
                                                                          const plist::Dictionary* options,
                                                                          SayStaging say) const {
    StagedChange staged;
    _onQueue_stageChildBundles(staged, identifier, options, say);
    _onQueue_stageFlag(staged, entitlementMapKeys::registeredByCaller, identifier, options);
    _onQueue_stageFlag(staged, entitlementMapKeys::placeholder, identifier, options);
    // An empty dictionary is how nothing is stored.
    const bool wanted = entitlements && !entitlements->empty();
    const plist::Dictionary* stored = entitlementsOf(identifier);
    staged.entitlementsChange =
        wanted ? !stored || *stored != *entitlements : entitlementMappingDict_.find(identifier) != nullptr;
    if (staged.entitlementsChange)
        staged.add(identifier, copyOf(entitlements));
    return staged;
}

void ZOREntitlementMapping::_onQueue_releaseSystemContainer(const plist::Dictionary* entitlements,
                                                            const std::string& identifier) {
    const bool keeps = entitlements && entitlements->isTrue(entitlementKeys::systemContainer);
    if (keeps || !_onQueue_identifierHasSystemContainer(identifier))
        return;
    const std::uint32_t user = configuration_.users().system;
    const auto record = services_.cache.containerForUser(user, ContainerClass::dataSystem, &identifier, false);
    if (!record) {
        log_.write(logLevelError, processFunction, "Failed to retrieve system container %s: %s", ZOR_SHOWN(identifier),
                   record.error().text().c_str());
        return;
    }
    log_.write(logLevelError, processFunction,
               "Deleting system container for ID: %s because it is no longer in the entitlements",
               ZOR_SHOWN(identifier));
    const auto staged = services_.sharedClientConnection->stageForDeleteContainersWithUsers(
        ZORClientConnection::DeletionBatch::of(user, (*record)->uuid(), identifier, (*record)->containerClass()),
        UseLocking::no);
    if (!staged)
        log_.write(logLevelError, processFunction, "Failed to destroy system container with identifier %s: %llu",
                   ZOR_SHOWN(identifier), static_cast<unsigned long long>(staged.error().replyCode()));
}

void ZOREntitlementMapping::_onQueue_releaseGroups(const plist::Dictionary* entitlements,
                                                   const std::string& identifier) {
    const auto release = [&](Identifiers oldGroups, const Identifiers& newGroups, GroupType type,
                             const plist::Dictionary& map) {
        if (oldGroups || newGroups)
            services_.groups.handleChangeFromOldGroupContainerIds(std::move(oldGroups), newGroups, type, identifier,
                                                                  map);
    };
    release(_onQueue_appGroupIdentifiersForIdentifier(identifier),
            _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, entitlementKeys::applicationGroups),
            GroupType::application, entitlementMappingDict_);
    Identifiers newSystemGroups =
        _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, entitlementKeys::systemGroups);
    if (!newSystemGroups || newSystemGroups->empty())
        newSystemGroups = _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements,
                                                                        entitlementKeys::systemGroupContainers);
    release(_onQueue_systemGroupIdentifiersForIdentifier(identifier), newSystemGroups, GroupType::system,
            entitlementMappingDict_);
}

Result<void> ZOREntitlementMapping::_onQueue_process(const plist::Dictionary* entitlements,
                                                     const std::string& identifier, const plist::Dictionary* options) {
    const StagedChange staged = _onQueue_stage(entitlements, identifier, options, SayStaging::yes);
    if (staged.entitlementsChange) {
        _onQueue_releaseSystemContainer(entitlements, identifier);
        _onQueue_releaseGroups(entitlements, identifier);
    }
    if (staged.empty() && !unsaved_)
        return {};
    return _onQueue_setEntitlementDictionaryValues(staged.values, staged.keys);
}

ErrorCode ZOREntitlementMapping::_onQueue_processEntitlements(const plist::Dictionary* entitlements,
                                                              const std::string& identifier,
                                                              const plist::Dictionary* options) {
    try {
        if (!canBeProcessed(identifier, options))
            return makeError(log_, {processFunction, __LINE__}, ErrorCode::invalidObject, nullptr, LogFlag::yes,
                             "Can't act on an invalid object: ID: %s, parent ID: %s", ZOR_SHOWN(identifier),
                             plist::describe(parentIn(options)).c_str())
                .replyCode();
        if (const char* why = whyGroupsAreUnusable(entitlements))
            return makeError(log_, {processFunction, __LINE__}, ErrorCode::invalidObject, nullptr, LogFlag::yes,
                             "Can't act on an invalid object: ID: %s: %s", ZOR_SHOWN(identifier), why)
                .replyCode();
        const auto processed = _onQueue_process(entitlements, identifier, options);
        return processed ? ErrorCode::success : processed.error().replyCode();
    } catch (const std::exception& exception) {
        return services_.boundary.caught({processFunction, __LINE__}, exception).replyCode();
    }
}

ErrorCode ZOREntitlementMapping::processEntitlements(const plist::Dictionary* entitlements,
                                                     const std::string* identifier, const plist::Dictionary* options) {
    const auto processed = services_.boundary.run({"processEntitlements", __LINE__}, [&]() -> Result<ErrorCode> {
        if (!identifier)
            return ErrorCode::identifierMissing;
        if (canBeProcessed(*identifier, options)) {
            const MutexLock held(entitlementQueue_);
            if (!unsaved_ && _onQueue_stage(entitlements, *identifier, options, SayStaging::no).empty())
                return ErrorCode::success;
        }
        const AllIdentifiersLock lock(services_.locks, LockMode::writing);
        const MutexLock held(entitlementQueue_);
        return _onQueue_processEntitlements(entitlements, *identifier, options);
    });
    return processed ? *processed : processed.error().replyCode();
}

bool ZOREntitlementMapping::callerRegistrationIsDue(const std::string& identifier,
                                                    const plist::Dictionary& entitlements,
                                                    const plist::Dictionary& options) {
    const MutexLock held(entitlementQueue_);
    if (!_onQueue_identifierHasCallerRegisteredEntitlements(identifier))
        return entitlementMappingDict_.find(identifier) == nullptr;
    return unsaved_ || !_onQueue_stage(&entitlements, identifier, &options, SayStaging::no).empty();
}

void ZOREntitlementMapping::removeEntitlementDictionariesForIdentifierAndItsChildren(const std::string& identifier) {
    const MutexLock held(entitlementQueue_);
    std::vector<std::string> all{identifier};
    const plist::Dictionary* childMap = entitlementMappingDict_.dictionary(entitlementMapKeys::childPluginBundleIds);
    if (const plist::Array* children = childMap ? childMap->array(identifier) : nullptr)
        for (const plist::Value& child : *children)
            if (const std::string* name = child.asString())
                all.push_back(*name);
    for (const std::string& one : all) {
        const ErrorCode code = _onQueue_processEntitlements(nullptr, one, nullptr);
        if (code != ErrorCode::success)
            log_.write(logLevelError, "_onQueue_removeEntitlementDictionariesForIdentifierAndItsChildren",
                       "Failed to clear entitlements for %s : %llu", ZOR_SHOWN(one),
                       static_cast<unsigned long long>(code));
    }
}

} // namespace zor
