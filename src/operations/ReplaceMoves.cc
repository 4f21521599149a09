// SPDX-License-Identifier: Apache-2.0
// The moves of a replace, how they are undone, and what they leave to be tidied up. Nothing here waits for the disk but
// cleanUpReplace where the moves have to be on the disk before the journal can be gone; it runs without the lock then.
#include "fs/MountFences.h"
#include "operations/ReplaceProgress.h"
#include "store/StorePlaces.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <sys/stat.h>
#include <tuple>
#include <utility>

namespace zor {

using platform::FileDescriptor;

namespace {

bool isRemoved(int directory) {
    struct stat status{};
    return ::fstat(directory, &status) == 0 && status.st_nlink == 0;
}

} // namespace

Result<void> Replace::openDirectories(Progress& progress) {
    // Their owner may have put something else, or another's directory, in their places. Old and new one are of
    // one class and user.
    const std::uint32_t owner =
        ZORGlobalConfiguration::ownerOfClassDirectory(progress.newRecord->containerClass(), progress.newRecord->uid());
    auto& [old, fresh, dest] = progress.directories;
    const auto open = [&](FileDescriptor& descriptor, const FileURL& url) -> Result<void> {
        descriptor = TRY(needs_.fileManager.openDirectoryOf(owner, url));
        return {};
    };
    TRY(open(fresh, progress.newUrl.deletingLastPathComponent()));
    TRY(open(dest, progress.destUrl.deletingLastPathComponent()));
    TRY(open(progress.newOne, progress.newUrl));
    if (!progress.oldRecord)
        return {};
    TRY(open(old, progress.oldUrl.deletingLastPathComponent()));
    return open(progress.oldOne, progress.oldUrl);
}

Result<void> Replace::moveOldAway(const ReplaceRequest& request, Progress& progress) {
    const Prepared& prepared = progress.prepared;
    if (!isSameNew(progress)) {
        progress.stale = true;
        return {};
    }
    if (request.preserveOldUuid == PreserveOldUUID::yes) {
        progress.newUuidBefore = progress.newRecord->uuid();
        progress.newRecord->setUuid(progress.oldRecord->uuid());
    }
    if (prepared.exchanges) {
        const auto swapped = changePlaces(progress);
        if (!swapped)
            return oldNotMoved(progress, swapped.error());
        if (*swapped)
            return forgetOld(request, progress);
        restoreUuid(progress);
        progress.stale = true; // a file system that cannot: it takes a journal
        return {};
    }
    const auto& directories = progress.directories;
    const int waiting = prepared.waiting.get();
    const fs::Durability& durability = needs_.moves.durability();
    progress.newMovesLater = !durability.keepsOrder(waiting, directories.dest.get());
    if (progress.newMovesLater || !durability.keepsOrder(directories.dest.get(), prepared.journals.get())) {
        needs_.replaces.begin({.journalUrl = prepared.journalUrl,
                               .oldUrl = progress.oldUrl,
                               .destUrl = progress.destUrl,
                               .waitingUrl = prepared.journal.asideUrl},
                              {.userId = request.userIdNew,
                               .containerClass = request.classNew,
                               .identifiers = {progress.oldRecord->identifier(), progress.newRecord->identifier()}});
        progress.isUnderWay = true;
    }
    progress.waitingUrl = prepared.journal.waitingUrl();
    progress.moved = &directories.old;
    const auto moved =
        needs_.fileManager.renameItem(directories.old.get(), progress.oldUrl, waiting, progress.waitingUrl);
    if (!moved && isRemoved(waiting)) {
        // A pass over the death row took the empty place away meanwhile. It is made anew.
        endUnderWay(progress, WaitingReplaces::Ended::settled);
        progress.waitingUrl = FileURL();
        progress.moved = nullptr;
        restoreUuid(progress);
        progress.stale = true;
        return {};
    }
    if (!moved)
        return oldNotMoved(progress, moved.error());
    // There nobody else can put another in its place.
    if (const auto meant = judgeMoved(waiting, progress.waitingUrl, progress.oldOne); !meant)
        return undoFirstMove(progress, meant.error());
    progress.moved = &directories.dest;
    return forgetOld(request, progress);
}

Result<void> Replace::forgetOld(const ReplaceRequest& request, const Progress& progress) {
    const bool transient = progress.oldWasTransient;
    const auto removed = needs_.cache.removeContainerForUser(request.userIdOld, request.classOld,
                                                             &progress.oldRecord->identifier(), transient);
    if (!removed)
        return Reporter(needs_.log, replaceFunction)
            .error(ErrorCode::cacheRemoveFailed, &removed.error(),
                   "Failed to remove from cache id: %s, class: %ld, transient: %d",
                   ZOR_SHOWN(progress.oldRecord->identifier()), static_cast<long>(request.classOld), transient);
    return {};
}

Result<void> Replace::judgeMoved(int directory, const FileURL& url, const FileDescriptor& moved) {
    struct stat named{};
    struct stat meant{};
    const Errno failure = fs::statusOfName(directory, std::string(url.lastPathComponent()).c_str(), named);
    if (!failure && ::fstat(moved.get(), &meant) == 0 && named.st_dev == meant.st_dev && named.st_ino == meant.st_ino)
        return {};
    return posixError({replaceFunction, __LINE__}, failure ? failure : Errno(ESTALE),
                      "what came to %s is not the container", url.c_str());
}

Result<bool> Replace::changePlaces(Progress& progress) {
    const auto& directories = progress.directories;
    const auto exchange = [&] {
        return needs_.fileManager.disk().rename(
            directories.old.get(), std::string(progress.oldUrl.lastPathComponent()).c_str(), directories.fresh.get(),
            std::string(progress.newUrl.lastPathComponent()).c_str(), RENAME_EXCHANGE);
    };
    const Errno exchanged = exchange();
    if (exchanged == EXDEV || exchanged == EINVAL || exchanged == ENOSYS || exchanged == EOPNOTSUPP)
        return false;
    if (exchanged)
        return posixError({replaceFunction, __LINE__}, exchanged, "exchange of %s and %s failed: %s",
                          progress.oldUrl.c_str(), progress.newUrl.c_str(), exchanged.text());
    for (const auto& [directory, url, one] : {std::tuple(&directories.old, &progress.oldUrl, &progress.newOne),
                                              std::tuple(&directories.fresh, &progress.newUrl, &progress.oldOne)})
        if (auto meant = judgeMoved(directory->get(), *url, *one); !meant) {
            (void)exchange(); // their owner did it
            return std::move(meant).error();
        }
    progress.swapped = true;
    hasItsUuid(progress);
    return true;
}

void Replace::hasItsUuid(Progress& progress) {
    progress.newUuidBefore.reset(); // the old UUID is its own from now on
    progress.prepared.newSaysOldUuid = false;
}

void Replace::restoreUuid(Progress& progress) {
    if (progress.newUuidBefore)
        progress.newRecord->setUuid(*progress.newUuidBefore);
    progress.newUuidBefore.reset();
}

ZORError Replace::undoFirstMove(Progress& progress, const ZORError& cause) {
    const Reporter report(needs_.log, replaceFunction);
    const auto& directories = progress.directories;
    const auto undone = needs_.fileManager.moveItem(progress.prepared.waiting.get(), progress.waitingUrl,
                                                    directories.old.get(), progress.oldUrl);
    if (undone) {
        progress.moved = &directories.old;
        // Its record may have left the cache already. Should that fail, the next reading of its class finds it.
        (void)needs_.cache.addContainerMetadata(progress.oldRecord, progress.oldRecord->uid(),
                                                ContainerPlace(progress.oldUrl), progress.oldWasTransient);
        return report.error(ErrorCode::oldNotMovedToStaging, &cause, "Failed to move old %s to staging %s",
                            progress.oldUrl.c_str(), progress.waitingUrl.c_str());
    }
    progress.oldWaits = true;
    (void)needs_.cache.removeContainerForUser(progress.oldRecord->uid(), progress.oldRecord->containerClass(),
                                              &progress.oldRecord->identifier(), progress.oldWasTransient);
    return report.error(ErrorCode::journalUnusable, &undone.error(), "Failed to recover replace move: %s to %s",
                        progress.waitingUrl.c_str(), progress.oldUrl.c_str());
}

Result<void> Replace::putNewInPlace(const ReplaceRequest& request, Progress& progress) {
    const Reporter report(needs_.log, replaceFunction);
    ZORMetadata& record = *progress.newRecord;
    if (const auto moved = moveNew(progress); !moved)
        return notInPlace(progress, moved.error());
    hasItsUuid(progress);
    record.setDurable(false);
    const bool newWasTransient = record.transient();
    const auto removed =
        needs_.cache.removeContainerForUser(request.userIdNew, request.classNew, &record.identifier(), newWasTransient);
    if (!removed)
        return report.error(ErrorCode::cacheRemoveFailed, &removed.error(),
                            "Failed to remove from cache id: %s, class: %ld, transient: %d",
                            ZOR_SHOWN(record.identifier()), static_cast<long>(request.classNew), newWasTransient);
    if (isPerUserClass(request.classNew)) {
        // Mappings are of live ones alone.
        const bool becomesLive = !progress.oldWasTransient;
        const bool otherIdentifier =
            progress.oldRecord && progress.oldRecord->identifier() != record.identifier() && becomesLive;
        if (otherIdentifier)
            (void)needs_.mappings._setSandboxContainerMappingForUser(
                request.userIdOld, progress.oldRecord->identifier(), request.classOld, std::nullopt);
        if ((becomesLive || !newWasTransient) && !needs_.mappings._setSandboxContainerMappingForUser(
                                                     request.userIdNew, record.identifier(), request.classNew,
                                                     becomesLive ? std::optional(progress.destUrl) : std::nullopt))
            report.write(logLevelError, "Failed to set container mapping in replace operation");
    }
    record.setTransient(progress.oldWasTransient);
    const auto added = needs_.cache.addContainerMetadata(progress.newRecord, request.userIdNew,
                                                         ContainerPlace(progress.destUrl), progress.oldWasTransient);
    if (!added)
        return report.error(ErrorCode::cacheAddFailed, &added.error(),
                            "Failed to add to cache: %s, url: %s, transient: %d", ZOR_SHOWN(record.identifier()),
                            progress.destUrl.c_str(), progress.oldWasTransient);
    return {};
}

Result<void> Replace::moveNew(Progress& progress) {
    const auto& directories = progress.directories;
    if (!progress.swapped) {
        Prepared& prepared = progress.prepared;
        if (prepared.copyUrl.empty())
            return needs_.fileManager.renameItem(directories.fresh.get(), progress.newUrl, directories.dest.get(),
                                                 progress.destUrl);
        if (!isSameNew(progress))
            return posixError({replaceFunction, __LINE__}, Errno(ESTALE), "%s is not what was copied",
                              progress.newUrl.c_str());
        TRY(needs_.fileManager.renameItem(prepared.copies.get(), prepared.copyUrl, directories.dest.get(),
                                          progress.destUrl));
        prepared.copyUrl = FileURL();
        (void)needs_.deathRow._moveItemAtURLToDeathRow(progress.newUrl, StartDeletionThread::no,
                                                       topLevelOwnerOf(progress.newRecord->containerClass(),
                                                                       progress.newRecord->uid())); // it says so itself
        return {};
    }
    if (progress.destUrl == progress.oldUrl)
        return {};
    const auto renamed =
        needs_.fileManager.renameItem(directories.old.get(), progress.oldUrl, directories.dest.get(), progress.destUrl);
    // It is a container whole and live under either name.
    if (!renamed) {
        needs_.log.write(logLevelError, replaceFunction, "%s keeps the directory name of the one that it replaced: %s",
                         progress.oldUrl.c_str(), renamed.error().text().c_str());
        progress.destUrl = progress.oldUrl;
    }
    return {};
}

void Replace::recoverFromException(Progress& progress) {
    const Reporter report(needs_.log, replaceFunction);
    ZORFileManager& fileManager = needs_.fileManager;
    if (progress.swapped) {
        // Nothing waits in staging. The cache may know some of what has happened, and the disk knows all.
        needs_.cache.dropAll();
        return;
    }
    if (!progress.hasMovedByJournal() || !fileManager.itemDoesNotExistAtURL(progress.oldUrl) ||
        !fileManager.itemDoesNotExistAtURL(progress.destUrl))
        return;
    if (needs_.log.writes(logLevelDebug))
        report.write(logLevelDebug, "Recovering from exception by moving: %s to %s", progress.waitingUrl.c_str(),
                     progress.oldUrl.c_str());
    const auto moved = fileManager.moveItem(progress.prepared.waiting.get(), progress.waitingUrl,
                                            progress.directories.old.get(), progress.oldUrl);
    if (moved) {
        // Its record may have left the cache already. Should that fail, the next reading of its class finds it.
        (void)needs_.cache.addContainerMetadata(progress.oldRecord, progress.oldRecord->uid(),
                                                ContainerPlace(progress.oldUrl), progress.oldWasTransient);
        return;
    }
    report.error(ErrorCode::journalUnusable, &moved.error(), "Failed to recover replace move: %s to %s",
                 progress.waitingUrl.c_str(), progress.oldUrl.c_str());
    // The journal stays, and the next launch tries again: going on would let the clean-up take the old container.
    std::abort();
}

std::optional<ZORError> Replace::cleanUpReplace(Progress& progress, StartDeletionThread startDeletionThread) {
    const Reporter report(needs_.log, replaceFunction);
    restoreUuid(progress);
    if (progress.swapped) {
        const auto moved = needs_.deathRow._moveItemAtURLToDeathRow(
            progress.newUrl, startDeletionThread,
            topLevelOwnerOf(progress.newRecord->containerClass(), progress.newRecord->uid()));
        if (moved)
            return std::nullopt;
        return report.error(ErrorCode::replaceCleanUpFailed, &moved.error(), "Failed to remove staging dir: %s",
                            progress.newUrl.c_str());
    }
    if (!progress.hasMovedByJournal())
        return std::nullopt;
    const platform::FileDescriptor& journals = progress.prepared.journals;
    const FileURL& journalUrl = progress.prepared.journalUrl;
    const auto waits = [&] {
        needs_.recovery.leave({.journalUrl = journalUrl,
                               .oldUrl = progress.oldUrl,
                               .destUrl = progress.destUrl,
                               .waitingUrl = progress.prepared.journal.asideUrl});
    };
    const auto journalStays = [&](const ZORError& cause) {
        waits();
        return report.error(ErrorCode::replaceCleanUpFailed, &cause, "Failed to remove replace file: %s",
                            journalUrl.c_str());
    };
    if (progress.oldWaits) {
        waits();
        return std::nullopt;
    }
    // The moves are on the disk before the journal can be gone. If that cannot be, the journal stays for the next
    // request or launch, which finds what has moved.
    const Errno ordered =
        progress.moved ? needs_.moves.durability().between(progress.moved->get(), journals.get()) : Errno();
    if (ordered)
        return journalStays(posixError({replaceFunction, __LINE__}, ordered, "sync of %s failed: %s",
                                       progress.destUrl.deletingLastPathComponent().c_str(), ordered.text()));
    std::optional<ZORError> failed;
    if (const auto moved = needs_.deathRow._moveItemAtURLToDeathRow(progress.waitingUrl, StartDeletionThread::no);
        !moved)
        failed = report.error(ErrorCode::replaceCleanUpFailed, &moved.error(), "Failed to remove staging dir: %s",
                              progress.waitingUrl.c_str());
    const std::string journalName(journalUrl.lastPathComponent());
    if (const auto moved = needs_.deathRow._moveItemAtURLToDeathRow(journalUrl, startDeletionThread);
        !moved && needs_.fileManager.disk().unlinkFile(journals.get(), journalName.c_str()))
        failed = journalStays(moved.error());
    return failed;
}

} // namespace zor
