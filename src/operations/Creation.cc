// SPDX-License-Identifier: Apache-2.0
#include "operations/Creation.h"

#include "base/ContainerClass.h"
#include "ipc/Identifiers.h"
#include "store/StorePlaces.h"

#include <utility>

namespace zor {

std::optional<ZORContainerCache::LiveContainer> lookUpUndisturbed(ZORLocks& locks, ZORContainerCache& cache,
                                                                  std::uint32_t userId, ContainerClass containerClass,
                                                                  const std::string& identifier) {
    if (const auto before = locks.quietGeneration(identifier)) {
        auto live = cache.liveContainerForUser(userId, containerClass, identifier);
        if (locks.quietGeneration(identifier) == before)
            return live;
    }
    cache.prepare(userId, containerClass, false);
    // A reader counts as no disturbance: lookups that meet a writer do not slow one another down when it is done.
    const AllIdentifiersLock lock(locks, LockMode::reading);
    return cache.liveContainerForUser(userId, containerClass, identifier);
}

namespace {

constexpr const char* creationFunction = "createOrLookupContainerForUser";

/// The part of a record that a reply needs; the caller holds the lock that guards it.
FoundContainer snapshot(const std::shared_ptr<ZORMetadata>& record) {
    return {.record = record, .uuid = record->uuid(), .path = record->url().path(), .existed = record->existed()};
}

} // namespace

Result<FoundContainer> Creation::createOrLookupContainerForUser(const Caller& caller, std::uint32_t userId,
                                                                const std::string* identifier,
                                                                ContainerClass containerClass,
                                                                const CreateOrLookupOptions& options) {
    return needs_.boundary.run({creationFunction, __LINE__}, [&]() -> Result<FoundContainer> {
        TRY(checkRequest(caller, userId, identifier, containerClass));
        if (!options.transient)
            if (auto live = lookUpUndisturbed(needs_.locks, needs_.cache, userId, containerClass, *identifier)) {
                live->record->setExisted(true);
                return FoundContainer{
                    .record = live->record, .uuid = live->uuid, .path = std::move(live->path), .existed = true};
            }
        const Wanted wanted{caller, userId, *identifier, containerClass, options};
        BuiltAhead built(needs_.maker);
        auto found = TRY(lookedFor(wanted, built.container));
        if (!found) {
            TRY(built.build(userId, *identifier, containerClass));
            found = TRY(lookedFor(wanted, built.container));
        }
        TRY(makeDurable(*found));
        found->movedInto = nullptr;
        return std::move(*found);
    });
}

Result<std::optional<FoundContainer>>
Creation::createOrLookupContainerForUser(const Caller& caller, std::uint32_t userId, const std::string* identifier,
                                         ContainerClass containerClass, const CreateOrLookupOptions& options,
                                         BuiltAhead& ahead, const AllIdentifiersWriteLock& lock) {
    return needs_.boundary.run({creationFunction, __LINE__}, [&]() -> Result<std::optional<FoundContainer>> {
        TRY(checkRequest(caller, userId, identifier, containerClass));
        return createOrLookup({caller, userId, *identifier, containerClass, options}, ahead.container, lock);
    });
}

Result<void> Creation::checkRequest(const Caller& caller, std::uint32_t userId, const std::string* identifier,
                                    ContainerClass containerClass) {
    const Reporter report(needs_.log, creationFunction);
    const long classNumber = static_cast<long>(containerClass);
    if (!identifier || !ipc::isIdentifier(*identifier) || !isValidClass(containerClass))
        return report.error(ErrorCode::invalidObject, "Can't act on an invalid object: userId: %u, ID: %s, class: %ld",
                            userId, ZOR_SHOWN(identifier), classNumber);
    if (!needs_.configuration.users().mayOwn(containerClass, userId))
        return report.error(ErrorCode::invalidObject, "Invalid userId %u for class %ld, ID: %s", userId, classNumber,
                            ZOR_SHOWN(*identifier));
    if (containerClass == ContainerClass::dataSystem && !caller.allowOtherIdLookup &&
        !needs_.entitlements.identifierHasSystemContainer(*identifier))
        return report.error(ErrorCode::notEntitled, "%s not entitled for a system container, but %s is trying",
                            ZOR_SHOWN(*identifier), ZOR_SHOWN(caller.bundleIdentifier));
    return {};
}

Result<std::optional<FoundContainer>> Creation::lookedFor(const Wanted& wanted,
                                                          std::optional<ContainerMaker::Built>& built) {
    return needs_.replaces.undisturbed([&] {
        needs_.cache.prepare(wanted.userId, wanted.containerClass, wanted.options.transient);
        if (wanted.options.createIfNecessary && !wanted.caller.ownsRoot())
            (void)needs_.cache.heldByUser(wanted.userId);
        const AllIdentifiersWriteLock lock(needs_.locks, Touches::nothing());
        return createOrLookup(wanted, built, lock);
    });
}

Result<std::optional<FoundContainer>> Creation::createOrLookup(const Wanted& wanted,
                                                               std::optional<ContainerMaker::Built>& built,
                                                               const AllIdentifiersWriteLock& lock) {
    const auto& [caller, userId, identifier, containerClass, options] = wanted;
    UserHome* const home = isPerUserClass(containerClass) ? needs_.configuration.homeOf(userId) : nullptr;
    std::uint64_t homeGeneration = home ? home->lookIfDue().generation : 0;
    auto record = needs_.cache.containerForUser(userId, containerClass, &identifier, options.transient);
    const bool isNeeded = record ? options.transient : record.error().is(ErrorCode::notFound);
    // A replace that waits comes first, and might take what is being built in staging for what it waits for.
    if (isNeeded && options.createIfNecessary && !built && needs_.recovery.noneWaits()) {
        // A refusal must not cost the disk's time. The rest is asked when there is something to put in place.
        if (!record && !options.replacesAnother)
            TRY(checkShare(wanted));
        return std::nullopt;
    }
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
    lock.touch(Touches::only({identifier}));
    if (record)
        TRY(discardTransient(**record, identifier));
    else if (!record.error().is(ErrorCode::notFound))
        return std::move(record).error();
    if (!options.createIfNecessary)
        return Reporter(needs_.log, creationFunction)
            .unlogged(ErrorCode::notFound, "Container with identifier: \"%s\" Not Found", ZOR_SHOWN(identifier));
    // One in the place of another makes the user's share no larger.
    if (!record && !options.replacesAnother)
        TRY(checkShare(wanted));
    return TRY(create(wanted, built, homeGeneration));
}

Result<void> Creation::checkShare(const Wanted& wanted) {
    if (wanted.caller.ownsRoot())
        return {};
    const std::size_t containers = needs_.cache.heldByUser(wanted.userId).containers;
    if (containers < needs_.limits.containersMaxPerUser)
        return {};
    return Reporter(needs_.log, creationFunction)
        .error(ErrorCode::valueNotAllowed,
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
        return Reporter(needs_.log, creationFunction)
            .error(ErrorCode::transientRemovalFailed, &moved.error(), "Failed to remove transient container at %s",
                   url.c_str());
    // With its directory gone the record would answer "no metadata" for this identifier until the daemon ends, should
    // the container not be made again.
    return needs_.cache.removeContainerForUser(record.uid(), record.containerClass(), &identifier, true);
}

Result<FoundContainer> Creation::create(const Wanted& wanted, std::optional<ContainerMaker::Built>& built,
                                        std::uint64_t homeGeneration) {
    const bool transient = wanted.options.transient;
    ContainerMaker::Built mine = built
                                     ? *std::exchange(built, std::nullopt)
                                     : TRY(needs_.maker.build(wanted.userId, wanted.identifier, wanted.containerClass));
    auto [live, classDirectory] = TRY(needs_.maker.putInPlace(mine, transient, homeGeneration));
    const auto& record = mine.record;
    record->setExisted(false);
    record->setTransient(transient);
    const auto added = needs_.cache.addContainerMetadata(record, wanted.userId, ContainerPlace(live), transient);
    if (!added)
        return Reporter(needs_.log, creationFunction)
            .error(ErrorCode::cacheAddFailed, &added.error(),
                   "Failed to add to cache for %u : %s, url: %s, transient: %d", wanted.userId,
                   ZOR_SHOWN(wanted.identifier), live.c_str(), transient);
    FoundContainer made = snapshot(record);
    made.movedInto = std::make_shared<const platform::FileDescriptor>(std::move(classDirectory));
    return made;
}

Result<void> Creation::makeDurable(const FoundContainer& container) {
    if (container.record->durable())
        return {};
    const FileURL live = FileURL::directory(container.path);
    const auto failed = container.movedInto ? needs_.moves.syncDirectory(*container.movedInto, live)
                                            : needs_.moves.syncDirectories({live.deletingLastPathComponent()});
    if (failed)
        return needs_.moves.notLasting(creationFunction, ErrorCode::moveToLiveFailed, live, *failed);
    container.record->setDurable(true);
    return {};
}

} // namespace zor
