// SPDX-License-Identifier: Apache-2.0
#include "operations/ContainerRemoval.h"

#include "store/StorePlaces.h"

#include <cerrno>
#include <utility>

namespace zor {

namespace {

constexpr const char* function = "stageForDeleteContainersWithUsers";

} // namespace

Result<void> ContainerRemoval::stage(const ContainerToGo& container) {
    return needs_.boundary.run({function, __LINE__}, [&]() -> Result<void> {
        std::vector<FileURL> changed;
        needs_.cache.prepare(container.userId, container.containerClass);
        auto staged = needs_.recovery.undisturbed([&] {
            const AllIdentifiersWriteLock lock(needs_.locks);
            return stage(container, changed, lock);
        });
        return conclude(std::move(staged), std::move(changed));
    });
}

Result<void> ContainerRemoval::stage(const ContainerToGo& container, std::vector<FileURL>& changed,
                                     const AllIdentifiersWriteLock& lock) {
    return needs_.boundary.run({function, __LINE__}, [&]() -> Result<void> {
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
                                    std::vector<FileURL>& changed, const AllIdentifiersWriteLock& /*held*/) {
    const Reporter report(needs_.log, function);
    const auto& [userId, uuid, identifier, containerClass] = container;
    const bool transient = record.transient();
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
    return Reporter(needs_.log, function)
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
    Reporter(needs_.log, function)
        .error(ErrorCode::listForDeletionFailed, &moved.error(), "Failed to delete container at %s: %s",
               container.c_str(), moved.error().text().c_str());
    return false;
}

} // namespace zor
