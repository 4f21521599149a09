// SPDX-License-Identifier: Apache-2.0
#include "operations/EntitlementChange.h"

#include "base/ContainerClass.h"
#include "ipc/Identifiers.h"
#include "ipc/Protocol.h"

#include <algorithm>
#include <exception>
#include <iterator>
#include <utility>

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

/// Why the groups of the entitlements are none that containers can be made for; nullptr when they are. A value of
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
        prepare(*identifier);
        std::optional<Change> change;
        TRY(needs_.replaces.undisturbed([&] {
            const AllIdentifiersWriteLock lock(needs_.locks, Touches::nothing());
            return process(entitlements, *identifier, options, change, lock);
        }));
        return change ? settle(*change) : ErrorCode::success;
    });
    return processed ? *processed : processed.error().replyCode();
}

void EntitlementChange::prepare(const std::string& identifier) {
    if (needs_.entitlements.identifierHasSystemContainer(identifier))
        needs_.cache.prepare(needs_.configuration.users().system, ContainerClass::dataSystem, false);
    needs_.groups.prepare(identifier);
}

void EntitlementChange::prepareRemoval(const std::string& identifier) {
    for (const std::string& one : withChildren(identifier))
        prepare(one);
}

std::vector<std::string> EntitlementChange::withChildren(const std::string& identifier) const {
    std::vector<std::string> all{identifier};
    std::ranges::move(needs_.entitlements.childrenOf(identifier), std::back_inserter(all));
    return all;
}

ErrorCode EntitlementChange::settle(Change change) {
    const auto settled = needs_.entitlements.save(change, [&] {
        std::vector<FileURL> changed;
        {
            const platform::MutexLock held(unsyncedMutex_);
            changed.swap(unsynced_);
        }
        (void)needs_.removal.conclude({}, std::move(changed)); // it says so itself
    });
    return settled ? ErrorCode::success : settled.error().replyCode();
}

Result<void> EntitlementChange::removeEntitlementDictionariesForIdentifierAndItsChildren(
    const std::string& identifier, std::optional<Change>& change, const AllIdentifiersWriteLock& lock) {
    const std::vector<std::string> all = withChildren(identifier);
    // All are asked before the first goes: with an identifier the map forgets whose children the others are.
    for (const std::string& one : all)
        TRY(refuseIfUnderWay(one, lock));
    for (const std::string& one : all) {
        std::optional<Change> its;
        const auto processed = process(nullptr, one, nullptr, its, lock);
        change = std::max(change, its);
        sayIfNotCleared(one, processed ? ErrorCode::success : processed.error().replyCode());
    }
    return {};
}

Result<void> EntitlementChange::refuseIfUnderWay(const std::string& identifier, const AllIdentifiersWriteLock& lock) {
    if (needs_.entitlements.identifierHasSystemContainer(identifier))
        TRY(needs_.replaces.refuseIfUnderWay(needs_.configuration.users().system, ContainerClass::dataSystem,
                                             identifier));
    return needs_.groups.refuseIfUnderWay(identifier, lock);
}

void EntitlementChange::settleRemoval(const std::string& identifier, Change change) {
    sayIfNotCleared(identifier, settle(change));
}

void EntitlementChange::sayIfNotCleared(const std::string& identifier, ErrorCode code) const {
    if (code != ErrorCode::success)
        needs_.log.write(logLevelError, "_onQueue_removeEntitlementDictionariesForIdentifierAndItsChildren",
                         "Failed to clear entitlements for %s : %llu", ZOR_SHOWN(identifier),
                         static_cast<unsigned long long>(code));
}

Result<void> EntitlementChange::process(const plist::Dictionary* entitlements, const std::string& identifier,
                                        const plist::Dictionary* options, std::optional<Change>& change,
                                        const AllIdentifiersWriteLock& lock) {
    const Reporter report(needs_.log, processFunction);
    try {
        if (!canBeProcessed(identifier, options))
            return report.error(ErrorCode::invalidObject, "Can't act on an invalid object: ID: %s, parent ID: %s",
                                ZOR_SHOWN(identifier), plist::describe(parentIn(options)).c_str());
        if (const char* why = whyGroupsAreUnusable(entitlements))
            return report.error(ErrorCode::invalidObject, "Can't act on an invalid object: ID: %s: %s",
                                ZOR_SHOWN(identifier), why);
        change = TRY(planReleaseApply(entitlements, identifier, options, lock));
        return {};
    } catch (const std::exception& exception) {
        return needs_.boundary.caught({processFunction, __LINE__}, exception);
    }
}

Result<std::optional<EntitlementChange::Change>>
EntitlementChange::planReleaseApply(const plist::Dictionary* entitlements, const std::string& identifier,
                                    const plist::Dictionary* options, const AllIdentifiersWriteLock& lock) {
    const ZOREntitlementMapping::Plan plan = needs_.entitlements.plan(entitlements, identifier, options, lock);
    std::vector<FileURL> changed;
    const auto released = [&]() -> Result<void> {
        if (plan.releasesSystemContainer)
            TRY(releaseSystemContainer(identifier, changed, lock));
        for (const auto& [type, before, after] : plan.groups)
            if (before)
                TRY(needs_.groups.handleChangeFromOldGroupContainerIds(before, after, type, identifier, changed, lock));
        return {};
    }();
    {
        const platform::MutexLock held(unsyncedMutex_);
        std::ranges::move(changed, std::back_inserter(unsynced_));
    }
    TRY(released);
    return needs_.entitlements.apply(plan, lock);
}

Result<void> EntitlementChange::releaseSystemContainer(const std::string& identifier, std::vector<FileURL>& changed,
                                                       const AllIdentifiersWriteLock& lock) {
    const Reporter report(needs_.log, processFunction);
    const std::uint32_t user = needs_.configuration.users().system;
    // Between its moves a replace has no live container.
    TRY(needs_.replaces.refuseIfUnderWay(user, ContainerClass::dataSystem, identifier));
    const auto record = needs_.cache.containerForUser(user, ContainerClass::dataSystem, &identifier, false);
    if (!record) {
        report.write(logLevelError, "Failed to retrieve system container %s: %s", ZOR_SHOWN(identifier),
                     record.error().text().c_str());
        return {};
    }
    report.write(logLevelError, "Deleting system container for ID: %s because it is no longer in the entitlements",
                 ZOR_SHOWN(identifier));
    const auto staged = needs_.removal.stage({.userId = user,
                                              .uuid = (*record)->uuid(),
                                              .identifier = identifier,
                                              .containerClass = (*record)->containerClass()},
                                             changed, lock);
    if (!staged)
        report.write(logLevelError, "Failed to destroy system container with identifier %s: %llu",
                     ZOR_SHOWN(identifier), static_cast<unsigned long long>(staged.error().replyCode()));
    return {};
}

} // namespace zor
