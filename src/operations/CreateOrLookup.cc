// SPDX-License-Identifier: Apache-2.0
// Finding a container, and making it where it is missing.
//
// What a stop leaves, in the order of the steps:
//   - while it is built: a directory in staging, which the next launch moves to death row;
//   - after an old transient container moved to death row: that container gone, as was asked;
//   - after the move into the class directory: the container, whole; the cache of the next process finds it.
// What a power cut leaves is the same: the metadata file's data is on the disk before the move can be
// (fs/Durability.h), and the move is on the disk before anybody who asks for the identifier is told of the container.
//
// The sync after the move runs when the all-identifiers lock is released, so those of concurrent creators share the
// disk's commit. Until it is done the record says so, and whoever finds it meanwhile waits for a sync of its own before
// it answers.
#include "base/BlockingScope.h"
#include "base/UserIdentity.h"
#include "ipc/Identifier.h"
#include "operations/ContainerBuilder.h"
#include "operations/StoreServices.h"
#include "operations/UndisturbedLookup.h"
#include "operations/ZORClientConnection.h"
#include "operations/ZOREntitlementMapping.h"
#include "store/ContainerLayout.h"
#include "store/ZORWhitelist.h"

#include <cerrno>

namespace zor {

namespace {

/// What a reply needs of a record; the caller holds the lock that guards it.
FoundContainer snapshot(const std::shared_ptr<ZORMetadata>& record) {
    return {.record = record, .uuid = record->uuid(), .path = record->url().path(), .existed = record->existed()};
}

} // namespace

Result<FoundContainer> ZORClientConnection::createOrLookupContainerForUser(std::uint32_t userId,
                                                                           const std::string* identifier,
                                                                           ContainerClass containerClass,
                                                                           const CreateOrLookupOptions& options) {
    return services_.boundary.run(ZOR_HERE, [&]() -> Result<FoundContainer> {
        TRY(checkRequest(userId, identifier, containerClass));
        if (options.useLocking == UseLocking::yes && !options.transient)
            if (auto live = lookUpUndisturbed(services_.locks, services_.cache, userId, containerClass, *identifier)) {
                live->record->setExisted(true);
                return FoundContainer{
                    .record = live->record, .uuid = live->uuid, .path = std::move(live->path), .existed = true};
            }
        FoundContainer found;
        {
            std::optional<AllIdentifiersLock> lock;
            if (options.useLocking == UseLocking::yes)
                lock.emplace(services_.locks, LockMode::writing);
            found = TRY(createOrLookup(userId, *identifier, containerClass, options));
        }
        if (options.useLocking == UseLocking::yes)
            TRY(makeDurable(found));
        return found;
    });
}

Result<void> ZORClientConnection::checkRequest(std::uint32_t userId, const std::string* identifier,
                                               ContainerClass containerClass) {
    constexpr Here here{"createOrLookupContainerForUser", __LINE__};
    const Log& log = services_.log;
    const long classNumber = static_cast<long>(containerClass);
    if (!identifier || !ipc::isIdentifier(*identifier) || !isValidClass(containerClass))
        return makeError(log, here, ErrorCode::invalidObject, nullptr, LogFlag::yes,
                         "Can't act on an invalid object: userId: %u, ID: %s, class: %ld", userId,
                         ZOR_SHOWN(identifier), classNumber);
    if (!services_.configuration.users().mayOwn(containerClass, userId))
        return makeError(log, here, ErrorCode::invalidObject, nullptr, LogFlag::yes,
                         "Invalid userId %u for class %ld, ID: %s", userId, classNumber, ZOR_SHOWN(*identifier));
    if (containerClass == ContainerClass::dataSystem && !allowOtherIdLookup() &&
        !services_.entitlements.identifierHasSystemContainer(*identifier))
        return makeError(log, here, ErrorCode::notEntitled, nullptr, LogFlag::yes,
                         "%s not entitled for a system container, but %s is trying", ZOR_SHOWN(*identifier),
                         ZOR_SHOWN(clientBundleIdentifier()));
    return {};
}

Result<FoundContainer> ZORClientConnection::createOrLookup(std::uint32_t userId, const std::string& identifier,
                                                           ContainerClass containerClass,
                                                           const CreateOrLookupOptions& options) {
    UserHome* const home = isPerUserClass(containerClass) ? services_.configuration.homeOf(userId) : nullptr;
    std::uint64_t homeGeneration = home ? home->lookIfDue().generation : 0;
    auto record = services_.cache.containerForUser(userId, containerClass, &identifier, options.transient);
    if (!record && options.createIfNecessary && home && record.error().is(ErrorCode::notFound)) {
        const std::uint64_t before = homeGeneration;
        homeGeneration = home->look().generation;
        // The home that came meanwhile may have the container.
        if (homeGeneration != before)
            record = services_.cache.containerForUser(userId, containerClass, &identifier, options.transient);
    }
    if (record ? options.transient : record.error().is(ErrorCode::notFound)) {
        const bool settled =
            TRY(settleReplaces({.userId = userId, .containerClass = containerClass, .identifier = identifier}));
        if (settled)
            record = services_.cache.containerForUser(userId, containerClass, &identifier, options.transient);
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
        return makeError(services_.log, {"createOrLookupContainerForUser", __LINE__}, ErrorCode::notFound, nullptr,
                         LogFlag::no, "Container with identifier: \"%s\" Not Found", ZOR_SHOWN(identifier));
    // One in the place of another makes the user's share no larger.
    if (!record && !options.replacesAnother)
        TRY(checkShare(userId, identifier));
    return create(userId, identifier, containerClass, options.transient, homeGeneration);
}

Result<void> ZORClientConnection::checkShare(std::uint32_t userId, const std::string& identifier) {
    if (ownsRoot())
        return {};
    const std::size_t containers = services_.cache.heldByUser(userId).containers;
    if (containers < services_.limits.containersMaxPerUser)
        return {};
    return makeError(
        services_.log, {"createOrLookupContainerForUser", __LINE__}, ErrorCode::valueNotAllowed, nullptr, LogFlag::yes,
        "User %u has %llu containers, and no more may be made: %s. Delete some, or start zorvaned with a larger "
        "--containers-per-user",
        userId, static_cast<unsigned long long>(containers), ZOR_SHOWN(identifier));
}

Result<void> ZORClientConnection::discardTransient(const ZORMetadata& record, const std::string& identifier) {
    const FileURL url = record.url();
    const auto moved =
        _moveItemAtURLToDeathRow(url, StartDeletionThread::yes, topLevelOwnerOf(record.containerClass(), record.uid()));
    // With another's directory in its place, the container is gone.
    if (!moved && !(moved.error().underlying() && moved.error().underlying()->isPosix(notTheContainer)))
        return makeError(services_.log, {"createOrLookupContainerForUser", __LINE__}, ErrorCode::transientRemovalFailed,
                         &moved.error(), LogFlag::yes, "Failed to remove transient container at %s", url.c_str());
    // With its directory gone the record would answer "no metadata" for this identifier until the daemon ends, should
    // the container not be made again.
    return services_.cache.removeContainerForUser(record.uid(), record.containerClass(), &identifier, true);
}

Result<FoundContainer> ZORClientConnection::create(std::uint32_t userId, const std::string& identifier,
                                                   ContainerClass containerClass, bool transient,
                                                   std::uint64_t homeGeneration) {
    constexpr Here here{"createOrLookupContainerForUser", __LINE__};
    const std::string directoryName = UUID::random().string();
    const FileURL staging = services_.configuration.stagingDirectory().appendingDirectory(directoryName);
    const auto record = std::make_shared<ZORMetadata>(userId, UUID::random(), containerClass, identifier, nullptr,
                                                      ContainerPlace(staging));
    record->setDurable(false);
    FileURL live;
    try {
        ContainerBuilder builder(services_.log, services_.fileManager, staging, layoutOf(containerClass, userId));
        auto built = [&]() -> Result<void> {
            TRY(builder._createTopLevelContainerDirectory());
            TRY(builder._createSubDirectories());
            TRY(builder.writeMetadata(*record));
            TRY(builder.giveAway());
            return builder.orderBeforeMove(services_.durability);
        }();
        if (!built)
            return cleanUpStaging(staging, std::move(built).error());
        // The fixed name is the live one's; a transient one has a name with which it can take its place.
        const std::string* wellKnown =
            transient ? nullptr : services_.whitelist.wellknownContainerForId(identifier, containerClass);
        const auto moved = [&]() -> Result<void> {
            const auto classDirectory = services_.configuration.openClassDirectory(userId, containerClass, transient);
            // A container that was looked for in one home is not made in another.
            const UserHome* const home =
                isPerUserClass(containerClass) ? services_.configuration.homeOf(userId) : nullptr;
            if (!classDirectory || (home && home->generation() != homeGeneration))
                return posixError(here, ENOENT, "the home of user %u is not there, or has just changed", userId);
            live = classDirectory->url.appendingDirectory(wellKnown ? *wellKnown : directoryName);
            const auto from = services_.fileManager.resolver().openParent(staging);
            if (!from)
                return posixError(here, from.error(), "rename of %s to %s failed: %s", staging.c_str(), live.c_str(),
                                  errorText(from.error()));
            if (!classDirectory->opened)
                return classDirectory->opened.error();
            TRY(services_.fileManager.moveItem(from->directory.get(), staging, classDirectory->opened->get(), live));
            return {};
        }();
        if (!moved)
            return cleanUpStaging(staging, makeError(services_.log, here, ErrorCode::moveToLiveFailed, &moved.error(),
                                                     LogFlag::yes, "Failed to move staging dir: %s to live dir: %s",
                                                     staging.c_str(), live.c_str()));
    } catch (...) {
        (void)_moveItemAtURLToDeathRow(staging, StartDeletionThread::yes);
        throw;
    }
    record->setExisted(false);
    record->setTransient(transient);
    const auto added = services_.cache.addContainerMetadata(record, userId, ContainerPlace(live), transient);
    if (!added)
        return makeError(services_.log, here, ErrorCode::cacheAddFailed, &added.error(), LogFlag::yes,
                         "Failed to add to cache for %u : %s, url: %s, transient: %d", userId, ZOR_SHOWN(identifier),
                         live.c_str(), transient);
    return snapshot(record);
}

ZORError ZORClientConnection::cleanUpStaging(const FileURL& staging, ZORError error) {
    const auto moved = _moveItemAtURLToDeathRow(staging, StartDeletionThread::yes);
    if (moved)
        return error;
    return makeError(services_.log, {"createOrLookupContainerForUser", __LINE__}, ErrorCode::stagingRemovalFailed,
                     &moved.error(), LogFlag::yes, "Failed to remove staging dir: %s", staging.c_str());
}

Result<void> ZORClientConnection::makeDurable(const FoundContainer& container) {
    if (container.record->durable())
        return {};
    const platform::BlockingScope blocking;
    const FileURL live = FileURL::directory(container.path);
    const auto directory = services_.fileManager.resolver().openDirectory(live.deletingLastPathComponent());
    const int status = directory ? services_.durability.afterMove(directory->get()) : -directory.error();
    if (status == 0) {
        container.record->setDurable(true);
        return {};
    }
    return notLasting("createOrLookupContainerForUser", ErrorCode::moveToLiveFailed, live,
                      posixError(ZOR_HERE, -status, "sync of %s failed: %s", live.deletingLastPathComponent().c_str(),
                                 errorText(-status)));
}

ZORError ZORClientConnection::notLasting(const char* function, ErrorCode code, const FileURL& container,
                                         const ZORError& cause) {
    return makeError(services_.log, {function, __LINE__}, code, &cause, LogFlag::yes,
                     "%s is in its place, but a power cut may undo that (%s); ask for it again", container.c_str(),
                     cause.text().c_str());
}

} // namespace zor
