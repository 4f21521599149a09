// SPDX-License-Identifier: Apache-2.0
#include "operations/Deletion.h"

#include "operations/EntitlementChange.h"
#include "store/StorePlaces.h"

#include <cerrno>
#include <utility>

namespace zor {

namespace {

constexpr const char* deletionFunction = "stageForDeleteContainersWithUsers";

} // namespace

Result<void> ContainerRemoval::stage(const ContainerToGo& container) {
    return needs_.boundary.run({deletionFunction, __LINE__}, [&]() -> Result<void> {
        std::vector<FileURL> changed;
        needs_.cache.prepare(container.userId, container.containerClass);
        auto staged = needs_.replaces.undisturbed([&] {
            const AllIdentifiersWriteLock lock(needs_.locks, Touches::nothing());
            return stage(container, changed, lock);
        });
        return conclude(std::move(staged), std::move(changed));
    });
}

Result<void> ContainerRemoval::stage(const ContainerToGo& container, std::vector<FileURL>& changed,
                                     const AllIdentifiersWriteLock& lock) {
    return needs_.boundary.run({deletionFunction, __LINE__}, [&]() -> Result<void> {
        const auto record = TRY(find(container, lock));
        return record ? take(container, *record, changed, lock) : Result<void>();
    });
}

Result<std::shared_ptr<ZORMetadata>> ContainerRemoval::find(const ContainerToGo& container,
                                                            const AllIdentifiersWriteLock& lock) {
    // A container that waits to come back is not given the place of this one.
    return needs_.recovery.settledContainer(container.userId, container.containerClass, &container.identifier,
                                            container.uuid, lock);
}

Result<void> ContainerRemoval::take(const ContainerToGo& container, const ZORMetadata& record,
                                    std::vector<FileURL>& changed, const AllIdentifiersWriteLock& lock) {
    const Reporter report(needs_.log, deletionFunction);
    const auto& [userId, uuid, identifier, containerClass] = container;
    const bool transient = record.transient();
    lock.touch(Touches::only({record.identifier()}));
    if (!takeAway(record.url(), topLevelOwnerOf(record.containerClass(), record.uid()), changed))
        return {};
    if (isPerUserClass(containerClass) && !transient &&
        !needs_.mappings._setSandboxContainerMappingForUser(userId, identifier, containerClass, std::nullopt))
        report.write(logLevelError, "Failed to remove container mapping in delete operation");
    const auto removed =
        needs_.cache.removeContainerForUser(userId, record.containerClass(), &record.identifier(), transient);
    if (!removed)
        return report.error(ErrorCode::cacheRemoveFailed, &removed.error(),
                            "Failed to remove from cache id: %s, class: %ld, transient: %d", ZOR_SHOWN(identifier),
                            static_cast<long>(containerClass), transient);
    return {};
}

Result<void> ContainerRemoval::conclude(Result<void> staged, std::vector<FileURL> changed) {
    // Those staged before a failure are gone for good too.
    const auto failed = needs_.moves.syncDirectories(std::move(changed));
    if (!staged || !failed)
        return staged;
    return Reporter(needs_.log, deletionFunction)
        .error(ErrorCode::listForDeletionFailed, &*failed, "Failed to make deletions durable: %s",
               failed->text().c_str());
}

bool ContainerRemoval::takeAway(const FileURL& container, std::optional<std::uint32_t> owner,
                                std::vector<FileURL>& changed) {
    const FileURL deathRow = needs_.configuration.deathrowDirectory();
    const FileURL destination = deathRow.appendingDirectory(container.lastPathComponent());
    const auto moved = needs_.deathRow.condemn(container, destination, owner);
    if (moved) {
        // On its own file system the move is on the disk with the directory that it left.
        changed.push_back(*moved == DeathRow::Row::ofRoot ? deathRow : container.deletingLastPathComponent());
        return true;
    }
    ZOR_LOG(needs_.log, logLevelDebug, "Couldn't stage for deletion from %s to %s: %s", container.c_str(),
            destination.c_str(), moved.error().text().c_str());
    // An earlier container of a well-known name may still wait on death row under that name. This one goes beside it.
    const bool nameIsTaken = moved.error().isPosix(ENOTEMPTY) || moved.error().isPosix(EEXIST);
    if (nameIsTaken && needs_.deathRow._moveItemAtURLToDeathRow(container, StartDeletionThread::no, owner)) {
        changed.push_back(deathRow);
        return true;
    }
    Reporter(needs_.log, deletionFunction)
        .error(ErrorCode::listForDeletionFailed, &moved.error(), "Failed to delete container at %s: %s",
               container.c_str(), moved.error().text().c_str());
    return false;
}

namespace {

/// The user of an element. The lists were not compared with this one: a missing element is the caller's mistake.
std::uint32_t userAt(const std::vector<std::uint32_t>& users, std::size_t index) {
    if (index < users.size())
        return users[index];
    throw ZORException("RangeException", "index " + std::to_string(index) + " beyond the " +
                                             std::to_string(users.size()) + " users of the batch");
}

} // namespace

DeletionBatch DeletionBatch::of(std::uint32_t userId, const UUID& uuid, const std::string& identifier,
                                ContainerClass containerClass) {
    return {.users = {userId},
            .uuids = {uuid},
            .identifiers = {identifier},
            .classes = {static_cast<std::uint64_t>(containerClass)}};
}

/// How far a batch has come.
struct Deletion::Progress {
    /// The element that is next.
    std::size_t next = 0;
    /// The element whose registration has been released; it does not wait for another one that comes meanwhile.
    std::optional<std::size_t> released;
    /// The change that releases it, for which it waits.
    std::optional<EntitlementChange::Change> unsettled;
    std::vector<FileURL> changed; // to be synced
    Result<void> first;           // the first error that stops no other
};

Result<void> Deletion::stageForDeleteContainersWithUsers(const DeletionBatch& batch) {
    return needs_.boundary.run({deletionFunction, __LINE__}, [&]() -> Result<void> {
        const std::size_t count = batch.uuids.size();
        if (count != batch.classes.size() || count != batch.identifiers.size())
            return Reporter(needs_.log, deletionFunction)
                .error(ErrorCode::invalidObject,
                       "Can't act on an invalid input: UUIDString count: %ld, class count: %ld, ID count: %ld",
                       static_cast<long>(count), static_cast<long>(batch.classes.size()),
                       static_cast<long>(batch.identifiers.size()));
        Progress progress;
        for (std::size_t index = 0; index < count && index < batch.users.size(); ++index)
            prepare(batch, index);
        while (progress.next < count) {
            auto staged = needs_.replaces.undisturbed([&] {
                const AllIdentifiersWriteLock lock(needs_.locks, Touches::nothing());
                return stageNext(batch, progress, lock);
            });
            if (!staged)
                return needs_.removal.conclude(std::move(staged), std::move(progress.changed));
            if (const auto change = std::exchange(progress.unsettled, std::nullopt))
                needs_.entitlementChange.settleRemoval(*batch.identifiers[progress.next], *change);
        }
        return needs_.removal.conclude(std::move(progress.first), std::move(progress.changed));
    });
}

void Deletion::prepare(const DeletionBatch& batch, std::size_t index) {
    if (!batch.classes[index] || !batch.identifiers[index])
        return;
    const auto containerClass = static_cast<ContainerClass>(*batch.classes[index]);
    needs_.cache.prepare(batch.users[index], containerClass);
    if (isBundleClass(containerClass))
        needs_.entitlementChange.prepareRemoval(*batch.identifiers[index]);
}

Result<void> Deletion::stageNext(const DeletionBatch& batch, Progress& progress, const AllIdentifiersWriteLock& lock) {
    for (; progress.next < batch.uuids.size(); ++progress.next) {
        auto one = stageForDelete(batch, progress, lock);
        if (progress.unsettled)
            return {};
        // A container that could not be looked for, or has to stay, keeps no other from going.
        if (!one && !one.error().isOwnShortage() && !one.error().is(ErrorCode::journalUnusable))
            return one;
        if (!one && progress.first)
            progress.first = std::move(one);
    }
    return {};
}

Result<void> Deletion::stageForDelete(const DeletionBatch& batch, Progress& progress,
                                      const AllIdentifiersWriteLock& lock) {
    const Reporter report(needs_.log, deletionFunction);
    const std::size_t index = progress.next;
    const std::uint32_t userId = userAt(batch.users, index);
    if (!batch.classes[index]) {
        report.error(ErrorCode::invalidObject, "Can't act on an invalid object: class: %s",
                     ZOR_SHOWN(batch.classes[index].error()));
        return {};
    }
    const auto containerClass = static_cast<ContainerClass>(*batch.classes[index]);
    const auto& uuid = batch.uuids[index];
    const auto& identifier = batch.identifiers[index];
    if (!uuid || !identifier || !isValidClass(containerClass)) {
        report.error(
            ErrorCode::invalidObject, "Can't act on an invalid object: userId: %u, UUID: %s, ID: %s, Class: %ld",
            userId, uuid ? uuid->string().c_str() : "(null)", ZOR_SHOWN(identifier), static_cast<long>(containerClass));
        return {};
    }
    const ContainerToGo container{
        .userId = userId, .uuid = *uuid, .identifier = *identifier, .containerClass = containerClass};
    const auto record = TRY(needs_.removal.find(container, lock));
    if (!record)
        return {};
    // The purpose of a transient one may not come to be: what is registered is still the live one's.
    if (isBundleClass(containerClass) && !record->transient() && progress.released != index) {
        TRY(needs_.entitlementChange.removeEntitlementDictionariesForIdentifierAndItsChildren(
            *identifier, progress.unsettled, lock));
        progress.released = index;
        if (progress.unsettled)
            return {};
    }
    return needs_.removal.take(container, *record, progress.changed, lock);
}

Result<void> Deletion::deleteContainerForUser(const Caller& caller, std::uint32_t userId, const std::string* identifier,
                                              ContainerClass containerClass, bool transient) {
    return needs_.boundary.run(ZOR_HERE, [&]() -> Result<void> {
        const auto found = needs_.creation.createOrLookupContainerForUser(
            caller, userId, identifier, containerClass, {.createIfNecessary = false, .transient = transient});
        if (!found) {
            needs_.log.write(logLevelError, "deleteContainerForUser",
                             "Failed to lookup existing container to delete-identifier: %s, class: %ld, "
                             "transient: %d",
                             ZOR_SHOWN(identifier), static_cast<long>(containerClass), transient);
            return found.error();
        }
        return stageForDeleteContainersWithUsers(
            DeletionBatch::of(userId, found->uuid, found->record->identifier(), containerClass));
    });
}

} // namespace zor
