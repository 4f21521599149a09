// SPDX-License-Identifier: Apache-2.0
// Putting a new container in the place of an old one.
//
// The one change of the store that takes more than one move, so it has a journal; ReplaceRecovery reads it. In order:
//   1. the new one's file gets the old UUID, where that is preserved   stopped: a transient one is discarded
//   2. a new one on another file system than its destination is copied stopped: the copy is swept
//   3. the journal is written                                          stopped: half a file goes; nothing has happened
//   4. the old one moves to staging                                    stopped: it moves back; nothing has happened
//   5. the new one, or its copy, moves to its destination              stopped: done; staging is swept
//   6. what waits in staging goes to death row, then the journal       stopped: done; the journal goes
//
// Nothing waits for the disk under the all-identifiers lock. Steps 1 to 3 run before it, and
// what they prepared counts when the containers are the same under it; else they come again. If the file system keeps
// no order by itself, the syncs between 4, 5 and 6 run without it, and the replace is known as under way: whoever has
// to do with one of its containers waits for its end, and nobody else.
//
// Nothing is copied to get out of the way, either: an old one on another file system than staging waits in a closed
// directory of its own file system (fs/FileSystemDeathRow.h). If there is a transient new one beside it, both change
// places in one step instead, which needs no journal:
//   1. as above                                                        stopped: a transient one is discarded
//   2. the two change places                                           stopped: done, under the old directory's name
//   3. the new one gets its own name, unless the UUID is preserved     stopped: done
//   4. the old one, a transient one by its place, goes to death row    stopped: a transient one is discarded
//
// A power cut leaves the same states: the journal is synced before the first move, the moves keep their order, and they
// are on the disk before the journal goes and the client hears. Step 2 leaves more of a new live one whose destination
// is elsewhere: between its copy's move and its own to death row, a stop leaves both.
//
// A sync that fails behind the first move undoes it; one that fails behind the second leaves the journal, and what
// waits in staging, to ReplaceRecovery: from there the old one never goes to death row before the moves are on the
// disk.
//
// A replace whose second move fails has lost the old container, which went to death row. So everything that can be
// looked at beforehand is: the directories can be opened, the destination is free.
//
// Any thread.
#pragma once

#include "base/ContainerClass.h"
#include "base/ZORError.h"
#include "ipc/Identifiers.h"
#include "operations/Basics.h"
#include "operations/DeathRow.h"
#include "operations/LastingMoves.h"
#include "operations/ReplaceRecovery.h"
#include "os/FileDescriptor.h"
#include "store/Configuration.h"
#include "store/ZORWhitelist.h"

#include <cstdint>
#include <optional>
#include <string>

namespace zor {

enum class PreserveOldUUID { no, yes };

struct ReplaceRequest {
    std::optional<UUID> oldUuid; // absent: the new container becomes the live one of its identifier
    std::optional<UUID> newUuid;
    std::uint32_t userIdOld = 0;
    std::uint32_t userIdNew = 0;
    std::optional<std::string> identifierOld;
    std::optional<std::string> identifierNew;
    ContainerClass classOld = ContainerClass::undefined;
    ContainerClass classNew = ContainerClass::undefined;
    PreserveOldUUID preserveOldUuid = PreserveOldUUID::no;
};

class Replace {
public:
    struct Needs : RecordNeeds {
        ZORFileManager& fileManager;
        ZORGlobalConfiguration& configuration;
        const ZORWhitelist& whitelist;
        const LastingMoves& moves;
        SandboxMappings& mappings;
        DeathRow& deathRow;
        ReplaceRecovery& recovery;
    };
    explicit Replace(const Needs& needs) : needs_(needs) {}

    /// Puts the new container in the place of the old one, under the all-identifiers lock held for writing. Errors 10,
    /// 11, 14, 15, 21 to 23, 27, 33 to 36, 40, 45, 46, 56. From error 15 on the old container is gone: it waits on
    /// death row. With error 35 it waits in staging for the next request that asks for it, or the next launch.
    Result<void> replaceContainer(const ReplaceRequest& request, StartDeletionThread startDeletionThread);

private:
    struct Prepared;
    struct Progress;

    // Replace.cc
    Result<void> checkReplace(const ReplaceRequest& request);
    /// One round: prepared, moved, on the disk. WaitingReplaces::metOneUnderWay; or `progress.stale`: nothing has
    /// happened.
    Result<void> replaceOnce(const ReplaceRequest& request, Progress& progress, bool mayExchange,
                             StartDeletionThread startDeletionThread);
    Result<void> move(const ReplaceRequest& request, Progress& progress, StartDeletionThread startDeletionThread);
    template <typename Step>
    Result<void> recoveringFromExceptions(Progress& progress, Step&& step);
    void endUnderWay(Progress& progress, WaitingReplaces::Ended how) noexcept;
    /// The judgement, and all that needs no sync in between.
    Result<void> begin(const ReplaceRequest& request, Progress& progress, const AllIdentifiersWriteLock& lock);
    Result<void> prepareReplace(const ReplaceRequest& request, Progress& progress, const AllIdentifiersWriteLock& lock);
    std::optional<FileURL> destinationOf(const ZORMetadata& record, const UUID& directoryUuid, bool transient);
    Result<void> refuseSecondOfIdentifier(const Progress& progress);
    ZORError changedTooOften(const Progress& progress);
    ZORError oldNotMoved(const Progress& progress, const ZORError& cause);
    ZORError notInPlace(const Progress& progress, const ZORError& cause);

    // Preparation, without the lock.
    /// Without the lock. Errors 14, 15, 33, 34.
    Result<void> prepare(const ReplaceRequest& request, Prepared& prepared, bool mayExchange);
    /// Whether there is something to prepare for.
    bool lookAhead(const ReplaceRequest& request, Prepared& prepared);
    Result<void> writeOldUuid(Prepared& prepared);
    Result<void> copyNew(Prepared& prepared, bool stagingIsBeside);
    Result<void> writeJournal(Prepared& prepared, bool stagingIsBeside);
    /// Staging, or the closed directory on the file system of `beside`.
    Result<FileURL> openWaitingPlace(platform::FileDescriptor& directory, const FileURL& beside, bool stagingIsBeside);
    [[nodiscard]] bool fits(const Prepared& prepared, const Progress& progress) const;
    /// Whether the new one is still the directory that was copied, if any was.
    [[nodiscard]] bool isSameNew(const Progress& progress) const;
    /// Takes back what was prepared and has not been used. Without the lock.
    void withdraw(Progress& progress);

    // ReplaceMoves.cc
    Result<void> openDirectories(Progress& progress);
    Result<void> moveOldAway(const ReplaceRequest& request, Progress& progress);
    /// Whether the old and the new one have changed places; false where the file system cannot.
    Result<bool> changePlaces(Progress& progress);
    /// The new one's move to its destination.
    Result<void> moveNew(Progress& progress);
    /// Error ESTALE when that did not come where it was to come to.
    Result<void> judgeMoved(int directory, const FileURL& url, const platform::FileDescriptor& moved);
    /// The step of moveOldAway that all ways have last.
    Result<void> forgetOld(const ReplaceRequest& request, const Progress& progress);
    Result<void> putNewInPlace(const ReplaceRequest& request, Progress& progress);
    /// The record's own UUID is what its file says, or is again what it was.
    static void hasItsUuid(Progress& progress);
    static void restoreUuid(Progress& progress);
    /// Error 14, or 35 when the old one waits in staging.
    ZORError undoFirstMove(Progress& progress, const ZORError& cause);
    void recoverFromException(Progress& progress);
    std::optional<ZORError> cleanUpReplace(Progress& progress, StartDeletionThread startDeletionThread);

    const Needs needs_;
};

} // namespace zor
