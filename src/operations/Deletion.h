// SPDX-License-Identifier: Apache-2.0
// Taking containers out of the store at a client's word: a whole batch, or the one of an identifier.
//
// A container leaves with one move to death row (ContainerRemoval); the slow removal comes with a later pass. A live
// bundle takes along what is registered for it (EntitlementChange), first: that is on the disk before the bundle moves,
// so its deletion lets the lock go in between, and looks for the bundle again. A stop after that leaves the bundle
// still there; deleting it again finds nothing more to drop. Elements of a batch are independent: a stop in the middle
// has staged the first ones. Any thread.
#pragma once

#include "base/ContainerClass.h"
#include "base/ZORError.h"
#include "ipc/Identifiers.h"
#include "operations/Basics.h"
#include "operations/ContainerRemoval.h"
#include "operations/Creation.h"
#include "operations/EntitlementChange.h"

#include <cstdint>
#include <expected>
#include <optional>
#include <string>
#include <vector>

namespace zor {

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
