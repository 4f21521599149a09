// SPDX-License-Identifier: Apache-2.0
// One container leaves the store: it moves to death row, its mapping and its record go. Nothing is asked of what it was
// registered for; that is the matter of who calls (Deletion, EntitlementChange, ZORGroupManager).
//
// A stop after the move leaves a mapping that points to nothing, which the next launch removes; the cache ends
// with the process. Moves are on the disk before the caller hears of them. Any thread.
#pragma once

#include "base/ContainerClass.h"
#include "base/FileURL.h"
#include "base/ZORError.h"
#include "ipc/Identifiers.h"
#include "operations/Basics.h"
#include "operations/DeathRow.h"
#include "operations/LastingMoves.h"
#include "operations/ReplaceRecovery.h"
#include "store/ZORGlobalConfiguration.h"

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace zor {

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
    /// The same for who holds the lock: `changed` gets the directories to be synced when it is released, before anybody
    /// is told (conclude).
    Result<void> stage(const ContainerToGo& container, std::vector<FileURL>& changed,
                       const AllIdentifiersWriteLock& lock);

    // The steps of it, for who stages several.
    /// ReplaceRecovery::undisturbed, for who takes the lock.
    template <typename Step>
    auto undisturbed(Step&& step) {
        return needs_.recovery.undisturbed(std::forward<Step>(step));
    }
    [[nodiscard]] Result<void> refuseIfUnderWay(std::uint32_t userId, ContainerClass containerClass,
                                                const std::string& identifier) const {
        return needs_.recovery.refuseIfUnderWay(userId, containerClass, identifier);
    }
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

} // namespace zor
