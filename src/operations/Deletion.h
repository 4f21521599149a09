// SPDX-License-Identifier: Apache-2.0
// Taking containers out of the store: one, for whatever reason, and those that a client names.
#pragma once

#include "base/ContainerClass.h"
#include "base/ZORError.h"
#include "fs/PathResolver.h"
#include "ipc/Identifiers.h"
#include "operations/Basics.h"
#include "operations/Creation.h"
#include "operations/DeathRow.h"
#include "operations/LastingMoves.h"
#include "operations/ReplaceRecovery.h"
#include "store/Configuration.h"

#include <cstdint>
#include <expected>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace zor {

// One container leaves the store: it moves to death row, its mapping and its record go. Nothing is asked of what it was
// registered for; that is the callers' matter (Deletion, EntitlementChange, ZORGroupManager).
//
// A stop after the move leaves a mapping that points to nothing, which the next launch removes; the cache ends
// with the process. Moves are on the disk before the caller hears of them. Any thread.

/// Which container is to go.
struct ContainerToGo {
    std::uint32_t userId;
    UUID uuid;
    const std::string& identifier;
    ContainerClass containerClass;
};

class ContainerRemoval {
public:
    struct Needs : RecordNeeds {
        ZORFileManager& fileManager;
        ZORGlobalConfiguration& configuration;
        const LastingMoves& moves;
        SandboxMappings& mappings;
        DeathRow& deathRow;
        ReplaceRecovery& recovery;
    };
    explicit ContainerRemoval(const Needs& needs) : needs_(needs) {}

    /// Stages one container for deletion; one that is not there is skipped. Errors 28 (not durable), 35 (another may
    /// come back in its place), 44 (it could not be looked for), 46, 40.
    Result<void> stage(const ContainerToGo& container);
    /// The same for a caller that holds the lock: `changed` gets the directories to be synced after its release, before
    /// anybody is told (conclude).
    Result<void> stage(const ContainerToGo& container, std::vector<FileURL>& changed,
                       const AllIdentifiersWriteLock& lock);

    // The steps of it, for callers that stage several.
    /// The record; nullptr when there is none.
    Result<std::shared_ptr<ZORMetadata>> find(const ContainerToGo& container, const AllIdentifiersWriteLock& lock);
    /// `changed` gets the directories to be synced.
    Result<void> take(const ContainerToGo& container, const ZORMetadata& record, std::vector<FileURL>& changed,
                      const AllIdentifiersWriteLock& lock);
    /// Everything that has been taken is on the disk, whatever `staged` says of the rest. Without a lock.
    Result<void> conclude(Result<void> staged, std::vector<FileURL> changed);

private:
    /// False, logged, when the container stays where it is. `owner` as DeathRow::condemn has it.
    bool takeAway(const FileURL& container, std::optional<std::uint32_t> owner, std::vector<FileURL>& changed);

    const Needs needs_;
};

// Taking containers out of the store at a client's word: a whole batch, or the one of an identifier.
//
// A container leaves with one move to death row (ContainerRemoval); the slow removal comes with a later pass. A live
// bundle takes along what is registered for it (EntitlementChange), first: that is on the disk before the bundle moves,
// so its deletion lets the lock go in between, and looks for the bundle again. A stop after that leaves the bundle
// still there; deleting it again finds nothing more to drop. Elements of a batch are independent: a stop in the middle
// has staged the first ones. Any thread.

class EntitlementChange;

/// Parallel lists; element i of each describes one container. An element that a client gave with another type is
/// absent.
struct DeletionBatch {
    std::vector<std::uint32_t> users;
    std::vector<std::optional<UUID>> uuids;
    std::vector<std::optional<std::string>> identifiers;
    /// A class number, or how an element that is no number reads.
    std::vector<std::expected<std::uint64_t, std::string>> classes;

    static DeletionBatch of(std::uint32_t userId, const UUID& uuid, const std::string& identifier,
                            ContainerClass containerClass);
};

class Deletion {
public:
    struct Needs : RecordNeeds {
        Creation& creation;
        ContainerRemoval& removal;
        EntitlementChange& entitlementChange;
    };
    explicit Deletion(const Needs& needs) : needs_(needs) {}

    /// Takes the containers out of the store; their files go with the next deletion pass. A container that is not there
    /// is skipped, a malformed one is logged and skipped. Takes the all-identifiers lock for writing, and syncs without
    /// it. Only a live bundle's deletion releases what is registered for it. Errors 11 (lists that do not agree), and
    /// those of ContainerRemoval.
    Result<void> stageForDeleteContainersWithUsers(const DeletionBatch& batch);
    /// Stages the one container of an identifier. Errors as the lookup's and the staging's.
    Result<void> deleteContainerForUser(const Caller& caller, std::uint32_t userId, const std::string* identifier,
                                        ContainerClass containerClass, bool transient);

private:
    struct Progress;
    /// Reads what an element needs before the lock is taken.
    void prepare(const DeletionBatch& batch, std::size_t index);
    /// The elements from the one on that is next, to the end, or to one whose entitlements have to be settled first.
    Result<void> stageNext(const DeletionBatch& batch, Progress& progress, const AllIdentifiersWriteLock& lock);
    Result<void> stageForDelete(const DeletionBatch& batch, Progress& progress, const AllIdentifiersWriteLock& lock);

    const Needs needs_;
};

} // namespace zor
