// SPDX-License-Identifier: Apache-2.0
// Taking containers out of the store: a whole batch, or the one of an identifier.
//
// A container leaves with one move to death row; the slow removal comes with a later pass. What a stop leaves, in the
// order of the steps:
//   - after the entitlements of a bundle are gone: the bundle still there; deleting it again finds nothing more to
//   drop;
//   - after the move: a mapping that points to nothing, which the next launch removes; the cache ends with the process.
// Moves are on the disk before the caller hears of them. Elements of a batch are independent: a stop in the middle has
// staged the first ones.
#include "base/BlockingScope.h"
#include "operations/StoreServices.h"
#include "operations/ZORClientConnection.h"
#include "operations/ZOREntitlementMapping.h"
#include "store/ContainerLayout.h"

#include <algorithm>
#include <cerrno>
#include <optional>
#include <utility>

namespace zor {

namespace {

constexpr const char* stageFunction = "stageForDeleteContainersWithUsers";

/// The user of an element. The lists were not compared with this one: a missing element is the caller's mistake.
std::uint32_t userAt(const std::vector<std::uint32_t>& users, std::size_t index) {
    if (index < users.size())
        return users[index];
    throw ZORException("RangeException", "index " + std::to_string(index) + " beyond the " +
                                             std::to_string(users.size()) + " users of the batch");
}

} // namespace

ZORClientConnection::DeletionBatch ZORClientConnection::DeletionBatch::of(std::uint32_t userId, const UUID& uuid,
                                                                          const std::string& identifier,
                                                                          ContainerClass containerClass) {
    return {.users = {userId},
            .uuids = {uuid},
            .identifiers = {identifier},
            .classes = {static_cast<std::uint64_t>(containerClass)}};
}

Result<void> ZORClientConnection::stageForDeleteContainersWithUsers(const DeletionBatch& batch, UseLocking useLocking) {
    return services_.boundary.run({stageFunction, __LINE__}, [&]() -> Result<void> {
        const std::size_t count = batch.uuids.size();
        if (count != batch.classes.size() || count != batch.identifiers.size())
            return makeError(services_.log, {stageFunction, __LINE__}, ErrorCode::invalidObject, nullptr, LogFlag::yes,
                             "Can't act on an invalid input: UUIDString count: %ld, class count: %ld, ID count: %ld",
                             static_cast<long>(count), static_cast<long>(batch.classes.size()),
                             static_cast<long>(batch.identifiers.size()));
        std::vector<FileURL> changed;
        auto staged = [&]() -> Result<void> {
            std::optional<AllIdentifiersLock> lock;
            if (useLocking == UseLocking::yes)
                lock.emplace(services_.locks, LockMode::writing);
            Result<void> first;
            for (std::size_t index = 0; index < count; ++index) {
                auto one = stageForDelete(batch, index, changed);
                // What could not be looked for, or has to stay, keeps no other from going.
                if (!one && !one.error().isOwnShortage() && !one.error().is(ErrorCode::journalUnusable))
                    return one;
                if (!one && first)
                    first = std::move(one);
            }
            return first;
        }();
        // Those staged before a failure are gone for good too.
        const auto failed = syncDirectories(std::move(changed));
        if (!staged || !failed)
            return staged;
        return makeError(services_.log, {stageFunction, __LINE__}, ErrorCode::listForDeletionFailed, &*failed,
                         LogFlag::yes, "Failed to make deletions durable: %s", failed->text().c_str());
    });
}

Result<void> ZORClientConnection::stageForDelete(const DeletionBatch& batch, std::size_t index,
                                                 std::vector<FileURL>& changed) {
    const std::uint32_t userId = userAt(batch.users, index);
    if (!batch.classes[index]) {
        makeError(services_.log, {stageFunction, __LINE__}, ErrorCode::invalidObject, nullptr, LogFlag::yes,
                  "Can't act on an invalid object: class: %s", ZOR_SHOWN(batch.classes[index].error()));
        return {};
    }
    const auto containerClass = static_cast<ContainerClass>(*batch.classes[index]);
    const auto& uuid = batch.uuids[index];
    const auto& identifier = batch.identifiers[index];
    if (!uuid || !identifier || !isValidClass(containerClass)) {
        makeError(services_.log, {stageFunction, __LINE__}, ErrorCode::invalidObject, nullptr, LogFlag::yes,
                  "Can't act on an invalid object: userId: %u, UUID: %s, ID: %s, Class: %ld", userId,
                  uuid ? uuid->string().c_str() : "(null)", ZOR_SHOWN(identifier), static_cast<long>(containerClass));
        return {};
    }
    // A container that waits to come back is not given the place of this one.
    const auto record = TRY(settledContainer(userId, containerClass, &*identifier, *uuid));
    if (!record)
        return {};
    // What a transient one is for may not come to be: what is registered is still the live one's.
    const bool transient = record->transient();
    if (isBundleClass(containerClass) && !transient)
        services_.entitlements.removeEntitlementDictionariesForIdentifierAndItsChildren(*identifier);
    if (!takeAwayForDelete(record->url(), topLevelOwnerOf(record->containerClass(), record->uid()), changed))
        return {};
    if (isPerUserClass(containerClass) && !transient &&
        !_setSandboxContainerMappingForUser(userId, *identifier, containerClass, std::nullopt))
        services_.log.write(logLevelError, stageFunction, "Failed to remove container mapping in delete operation");
    const auto removed =
        services_.cache.removeContainerForUser(userId, record->containerClass(), &record->identifier(), transient);
    if (!removed)
        return makeError(services_.log, {stageFunction, __LINE__}, ErrorCode::cacheRemoveFailed, &removed.error(),
                         LogFlag::yes, "Failed to remove from cache id: %s, class: %ld, transient: %d",
                         ZOR_SHOWN(*identifier), static_cast<long>(containerClass), transient);
    return {};
}

bool ZORClientConnection::takeAwayForDelete(const FileURL& container, std::optional<std::uint32_t> owner,
                                            std::vector<FileURL>& changed) {
    const FileURL deathRow = services_.configuration.deathrowDirectory();
    const FileURL destination = deathRow.appendingDirectory(container.lastPathComponent());
    const auto moved = [&] {
        const platform::MutexLock moving(services_.deathRow.moving);
        return condemn(container, destination, owner, moving);
    }();
    if (moved) {
        // On its own file system the move is on the disk with the directory that it left.
        changed.push_back(*moved == DeathRow::ofRoot ? deathRow : container.deletingLastPathComponent());
        return true;
    }
    ZOR_LOG(services_.log, logLevelDebug, "Couldn't stage for deletion from %s to %s: %s", container.c_str(),
            destination.c_str(), moved.error().text().c_str());
    // An earlier container of a well-known name may still wait on death row under that name. This one goes beside it: a
    // stop while it is removed in place would leave half of it under the name it has.
    const bool nameIsTaken = moved.error().isPosix(ENOTEMPTY) || moved.error().isPosix(EEXIST);
    if (nameIsTaken && _moveItemAtURLToDeathRow(container, StartDeletionThread::no, owner)) {
        changed.push_back(deathRow);
        return true;
    }
    // What stopped the move would stop the removal too, half-way; and another's directory is not ours to remove. Then
    // it stays whole.
    const bool stays = moved.error().isOwnShortage() || moved.error().isPosix(notTheContainer);
    const auto removed = stays ? Result<void>(moved.error()) : services_.fileManager.removeItemAtURL(container);
    if (!removed) {
        makeError(services_.log, {stageFunction, __LINE__}, ErrorCode::listForDeletionFailed, &removed.error(),
                  LogFlag::yes, "Failed to delete container at %s: %s", container.c_str(),
                  removed.error().text().c_str());
        return false;
    }
    changed.push_back(container.deletingLastPathComponent());
    return true;
}

std::optional<ZORError> ZORClientConnection::syncDirectories(std::vector<FileURL> changed) {
    const auto path = [](const FileURL& url) { return url.path(); };
    std::ranges::sort(changed, {}, path);
    changed.erase(std::ranges::unique(changed, {}, path).begin(), changed.end());
    const platform::BlockingScope blocking;
    for (const FileURL& url : changed) {
        const auto directory = services_.fileManager.resolver().openDirectory(url);
        const int status = directory ? services_.durability.afterMove(directory->get()) : -directory.error();
        if (status < 0)
            return posixError(ZOR_HERE, -status, "sync of %s failed: %s", url.c_str(), errorText(-status));
    }
    return std::nullopt;
}

Result<void> ZORClientConnection::deleteContainerForUser(std::uint32_t userId, const std::string* identifier,
                                                         ContainerClass containerClass, bool transient) {
    return services_.boundary.run(ZOR_HERE, [&]() -> Result<void> {
        const auto found = createOrLookupContainerForUser(userId, identifier, containerClass,
                                                          {.createIfNecessary = false, .transient = transient});
        if (!found) {
            services_.log.write(logLevelError, "deleteContainerForUser",
                                "Failed to lookup existing container to delete-identifier: %s, class: %ld, "
                                "transient: %d",
                                ZOR_SHOWN(identifier), static_cast<long>(containerClass), transient);
            return found.error();
        }
        return stageForDeleteContainersWithUsers(
            DeletionBatch::of(userId, found->uuid, found->record->identifier(), containerClass), UseLocking::yes);
    });
}

} // namespace zor
