// SPDX-License-Identifier: Apache-2.0
#include "operations/EntitlementChange.h"

#include "base/UserIdentity.h"
#include "ipc/Identifier.h"
#include "ipc/Keys.h"

#include <algorithm>
#include <exception>

namespace zor {

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

} // namespace

ErrorCode EntitlementChange::processEntitlements(const plist::Dictionary* entitlements, const std::string* identifier,
                                                 const plist::Dictionary* options) {
    const auto processed = needs_.boundary.run({"processEntitlements", __LINE__}, [&]() -> Result<ErrorCode> {
        if (!identifier)
            return ErrorCode::identifierMissing;
        if (canBeProcessed(*identifier, options) &&
            needs_.entitlements.changesNothing(entitlements, *identifier, options))
            return ErrorCode::success;
        const AllIdentifiersWriteLock lock(needs_.locks);
        return process(entitlements, *identifier, options, lock);
    });
    return processed ? *processed : processed.error().replyCode();
}

void EntitlementChange::removeEntitlementDictionariesForIdentifierAndItsChildren(const std::string& identifier,
                                                                                 const AllIdentifiersWriteLock& lock) {
    std::vector<std::string> all{identifier};
    std::ranges::move(needs_.entitlements.childrenOf(identifier), std::back_inserter(all));
    for (const std::string& one : all) {
        const ErrorCode code = process(nullptr, one, nullptr, lock);
        if (code != ErrorCode::success)
            needs_.log.write(logLevelError, "_onQueue_removeEntitlementDictionariesForIdentifierAndItsChildren",
                             "Failed to clear entitlements for %s : %llu", ZOR_SHOWN(one),
                             static_cast<unsigned long long>(code));
    }
}

ErrorCode EntitlementChange::process(const plist::Dictionary* entitlements, const std::string& identifier,
                                     const plist::Dictionary* options, const AllIdentifiersWriteLock& lock) {
    try {
        if (!canBeProcessed(identifier, options))
            return makeError(needs_.log, {processFunction, __LINE__}, ErrorCode::invalidObject, nullptr, LogFlag::yes,
                             "Can't act on an invalid object: ID: %s, parent ID: %s", ZOR_SHOWN(identifier),
                             plist::describe(parentIn(options)).c_str())
                .replyCode();
        if (const char* why = whyGroupsAreUnusable(entitlements))
            return makeError(needs_.log, {processFunction, __LINE__}, ErrorCode::invalidObject, nullptr, LogFlag::yes,
                             "Can't act on an invalid object: ID: %s: %s", ZOR_SHOWN(identifier), why)
                .replyCode();
        const auto processed = planReleaseSettle(entitlements, identifier, options, lock);
        return processed ? ErrorCode::success : processed.error().replyCode();
    } catch (const std::exception& exception) {
        return needs_.boundary.caught({processFunction, __LINE__}, exception).replyCode();
    }
}

Result<void> EntitlementChange::planReleaseSettle(const plist::Dictionary* entitlements, const std::string& identifier,
                                                  const plist::Dictionary* options,
                                                  const AllIdentifiersWriteLock& lock) {
    const ZOREntitlementMapping::Plan plan = needs_.entitlements.plan(entitlements, identifier, options, lock);
    if (plan.releasesSystemContainer)
        releaseSystemContainer(identifier, lock);
    for (const auto& [type, before, after] : plan.groups)
        if (before)
            needs_.groups.handleChangeFromOldGroupContainerIds(before, after, type, identifier, lock);
    return needs_.entitlements.settle(plan, lock);
}

void EntitlementChange::releaseSystemContainer(const std::string& identifier, const AllIdentifiersWriteLock& lock) {
    const std::uint32_t user = needs_.configuration.users().system;
    const auto record = needs_.cache.containerForUser(user, ContainerClass::dataSystem, &identifier, false);
    if (!record) {
        needs_.log.write(logLevelError, processFunction, "Failed to retrieve system container %s: %s",
                         ZOR_SHOWN(identifier), record.error().text().c_str());
        return;
    }
    needs_.log.write(logLevelError, processFunction,
                     "Deleting system container for ID: %s because it is no longer in the entitlements",
                     ZOR_SHOWN(identifier));
    const auto staged = needs_.removal.stage({.userId = user,
                                              .uuid = (*record)->uuid(),
                                              .identifier = identifier,
                                              .containerClass = (*record)->containerClass()},
                                             lock);
    if (!staged)
        needs_.log.write(logLevelError, processFunction, "Failed to destroy system container with identifier %s: %llu",
                         ZOR_SHOWN(identifier), static_cast<unsigned long long>(staged.error().replyCode()));
}

} // namespace zor
