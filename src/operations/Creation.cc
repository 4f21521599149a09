// SPDX-License-Identifier: Apache-2.0
#include "operations/Creation.h"

#include "base/UserIdentity.h"
#include "ipc/Identifier.h"
#include "operations/UndisturbedLookup.h"
#include "store/ContainerLayout.h"

#include <utility>

namespace zor {

namespace {

constexpr const char* function = "createOrLookupContainerForUser";

/// What a reply needs of a record; the caller holds the lock that guards it.
FoundContainer snapshot(const std::shared_ptr<ZORMetadata>& record) {
    return {.record = record, .uuid = record->uuid(), .path = record->url().path(), .existed = record->existed()};
}

} // namespace

Result<FoundContainer> Creation::createOrLookupContainerForUser(const Caller& caller, std::uint32_t userId,
                                                                const std::string* identifier,
                                                                ContainerClass containerClass,
                                                                const CreateOrLookupOptions& options) {
    return needs_.boundary.run({function, __LINE__}, [&]() -> Result<FoundContainer> {
        TRY(checkRequest(caller, userId, identifier, containerClass));
        if (!options.transient)
            if (auto live = lookUpUndisturbed(needs_.locks, needs_.cache, userId, containerClass, *identifier)) {
                live->record->setExisted(true);
                return FoundContainer{
                    .record = live->record, .uuid = live->uuid, .path = std::move(live->path), .existed = true};
            }
        FoundContainer found;
        {
            const AllIdentifiersWriteLock lock(needs_.locks);
            found = TRY(createOrLookup({caller, userId, *identifier, containerClass, options}, lock));
        }
        TRY(makeDurable(found));
        return found;
    });
}

Result<FoundContainer> Creation::createOrLookupContainerForUser(const Caller& caller, std::uint32_t userId,
                                                                const std::string* identifier,
                                                                ContainerClass containerClass,
                                                                const CreateOrLookupOptions& options,
                                                                const AllIdentifiersWriteLock& lock) {
    return needs_.boundary.run({function, __LINE__}, [&]() -> Result<FoundContainer> {
        TRY(checkRequest(caller, userId, identifier, containerClass));
        return createOrLookup({caller, userId, *identifier, containerClass, options}, lock);
    });
}

Result<void> Creation::checkRequest(const Caller& caller, std::uint32_t userId, const std::string* identifier,
                                    ContainerClass containerClass) {
    constexpr Here here{function, __LINE__};
    const Log& log = needs_.log;
    const long classNumber = static_cast<long>(containerClass);
    if (!identifier || !ipc::isIdentifier(*identifier) || !isValidClass(containerClass))
        return makeError(log, here, ErrorCode::invalidObject, nullptr, LogFlag::yes,
                         "Can't act on an invalid object: userId: %u, ID: %s, class: %ld", userId,
                         ZOR_SHOWN(identifier), classNumber);
    if (!needs_.configuration.users().mayOwn(containerClass, userId))
        return makeError(log, here, ErrorCode::invalidObject, nullptr, LogFlag::yes,
                         "Invalid userId %u for class %ld, ID: %s", userId, classNumber, ZOR_SHOWN(*identifier));
    if (containerClass == ContainerClass::dataSystem && !caller.allowOtherIdLookup &&
        !needs_.entitlements.identifierHasSystemContainer(*identifier))
        return makeError(log, here, ErrorCode::notEntitled, nullptr, LogFlag::yes,
                         "%s not entitled for a system container, but %s is trying", ZOR_SHOWN(*identifier),
                         ZOR_SHOWN(caller.bundleIdentifier));
    return {};
}

Result<FoundContainer> Creation::createOrLookup(const Wanted& wanted, const AllIdentifiersWriteLock& lock) {
    const auto& [caller, userId, identifier, containerClass, options] = wanted;
    UserHome* const home = isPerUserClass(containerClass) ? needs_.configuration.homeOf(userId) : nullptr;
    std::uint64_t homeGeneration = home ? home->lookIfDue().generation : 0;
    auto record = needs_.cache.containerForUser(userId, containerClass, &identifier, options.transient);
    if (!record && options.createIfNecessary && home && record.error().is(ErrorCode::notFound)) {
        const std::uint64_t before = homeGeneration;
        homeGeneration = home->look().generation;
        // The home that came meanwhile may have the container.
        if (homeGeneration != before)
            record = needs_.cache.containerForUser(userId, containerClass, &identifier, options.transient);
    }
    if (record ? options.transient : record.error().is(ErrorCode::notFound)) {
        const bool settled = TRY(needs_.recovery.settleReplaces(
            {.userId = userId, .containerClass = containerClass, .identifier = identifier}, lock));
        if (settled)
            record = needs_.cache.containerForUser(userId, containerClass, &identifier, options.transient);
    }
    if (record && !options.transient) {
        (*record)->setExisted(true);
        return snapshot(*record);
    }
    if (record)
        TRY(discardTransient(**record, identifier));
    else if (!record.error().is(ErrorCode::notFound))
        return std::move(record).error();
    if (!options.createIfNecessary)
        return makeError(needs_.log, {function, __LINE__}, ErrorCode::notFound, nullptr, LogFlag::no,
                         "Container with identifier: \"%s\" Not Found", ZOR_SHOWN(identifier));
    // One in the place of another makes the user's share no larger.
    if (!record && !options.replacesAnother)
        TRY(checkShare(wanted));
    return create(wanted, homeGeneration);
}

Result<void> Creation::checkShare(const Wanted& wanted) {
    if (wanted.caller.ownsRoot())
        return {};
    const std::size_t containers = needs_.cache.heldByUser(wanted.userId).containers;
    if (containers < needs_.limits.containersMaxPerUser)
        return {};
    return makeError(
        needs_.log, {function, __LINE__}, ErrorCode::valueNotAllowed, nullptr, LogFlag::yes,
        "User %u has %llu containers, and no more may be made: %s. Delete some, or start zorvaned with a larger "
        "--containers-per-user",
        wanted.userId, static_cast<unsigned long long>(containers), ZOR_SHOWN(wanted.identifier));
}

Result<void> Creation::discardTransient(const ZORMetadata& record, const std::string& identifier) {
    const FileURL url = record.url();
    const auto moved = needs_.deathRow._moveItemAtURLToDeathRow(url, StartDeletionThread::yes,
                                                                topLevelOwnerOf(record.containerClass(), record.uid()));
    // With another's directory in its place, the container is gone.
    if (!moved && !(moved.error().underlying() && moved.error().underlying()->isPosix(DeathRow::notTheContainer)))
        return makeError(needs_.log, {function, __LINE__}, ErrorCode::transientRemovalFailed, &moved.error(),
                         LogFlag::yes, "Failed to remove transient container at %s", url.c_str());
    // With its directory gone the record would answer "no metadata" for this identifier until the daemon ends, should
    // the container not be made again.
    return needs_.cache.removeContainerForUser(record.uid(), record.containerClass(), &identifier, true);
}

Result<FoundContainer> Creation::create(const Wanted& wanted, std::uint64_t homeGeneration) {
    const bool transient = wanted.options.transient;
    const auto [record, live] = TRY(needs_.maker.make({.userId = wanted.userId,
                                                       .identifier = wanted.identifier,
                                                       .containerClass = wanted.containerClass,
                                                       .transient = transient,
                                                       .homeGeneration = homeGeneration}));
    record->setExisted(false);
    record->setTransient(transient);
    const auto added = needs_.cache.addContainerMetadata(record, wanted.userId, ContainerPlace(live), transient);
    if (!added)
        return makeError(needs_.log, {function, __LINE__}, ErrorCode::cacheAddFailed, &added.error(), LogFlag::yes,
                         "Failed to add to cache for %u : %s, url: %s, transient: %d", wanted.userId,
                         ZOR_SHOWN(wanted.identifier), live.c_str(), transient);
    return snapshot(record);
}

Result<void> Creation::makeDurable(const FoundContainer& container) {
    if (container.record->durable())
        return {};
    const FileURL live = FileURL::directory(container.path);
    if (const auto failed = needs_.moves.syncDirectories({live.deletingLastPathComponent()}))
        return needs_.moves.notLasting(function, ErrorCode::moveToLiveFailed, live, *failed);
    container.record->setDurable(true);
    return {};
}

} // namespace zor
