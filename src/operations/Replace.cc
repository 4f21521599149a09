// SPDX-License-Identifier: Apache-2.0
// The replace from its request to its reply: refusals, the rounds of preparing and moving, and the two holds of the
// lock.
#include "operations/Replace.h"

#include "base/Mutex.h"
#include "fs/FileSystemDeathRow.h"
#include "operations/ReplaceProgress.h"
#include "store/StorePlaces.h"

#include <cerrno>
#include <sys/stat.h>
#include <utility>

namespace zor {

namespace {

/// So often the containers may have changed while something was prepared for them; it is no accident then.
constexpr int roundsMax = 16;

const std::string* pointerTo(const std::optional<std::string>& text) {
    return text ? &*text : nullptr;
}

std::string shown(const std::optional<UUID>& uuid) {
    return uuid ? uuid->string() : "(null)";
}

} // namespace

Result<void> Replace::replaceContainer(const ReplaceRequest& request, StartDeletionThread startDeletionThread) {
    // An exception while containers move is dealt with where it happens; the rest has nothing to recover.
    return needs_.boundary.run({replaceFunction, __LINE__}, [&]() -> Result<void> {
        TRY(checkReplace(request));
        bool mayExchange = true;
        for (int round = 0;; ++round) {
            Progress progress;
            auto result = needs_.replaces.undisturbed([&] {
                progress = Progress();
                return replaceOnce(request, progress, mayExchange, startDeletionThread);
            });
            if (!progress.stale || round == roundsMax)
                return progress.stale ? changedTooOften(progress) : result;
            mayExchange = mayExchange && !progress.prepared.exchanges;
        }
    });
}

Result<void> Replace::replaceOnce(const ReplaceRequest& request, Progress& progress, bool mayExchange,
                                  StartDeletionThread startDeletionThread) {
    needs_.cache.prepare(request.userIdNew, request.classNew); // the old one's, too
    Result<void> result;
    try {
        result = prepare(request, progress.prepared, mayExchange);
        if (result)
            result = move(request, progress, startDeletionThread);
    } catch (...) {
        endUnderWay(progress, WaitingReplaces::Ended::waits);
        withdraw(progress);
        throw;
    }
    withdraw(progress);
    if (!result || progress.stale)
        return result;
    const platform::BlockingScope blocking;
    const int dest = progress.directories.dest.get();
    // A journal that came back with the power would undo what comes to the new one later.
    const Errno synced = needs_.moves.durability().afterMoves(
        dest, progress.hasMovedByJournal() ? progress.prepared.journals.get() : dest);
    if (synced)
        return needs_.moves.notLasting(replaceFunction, ErrorCode::newNotMovedIntoPlace, progress.destUrl,
                                       posixError({replaceFunction, __LINE__}, synced, "sync of %s failed: %s",
                                                  progress.destUrl.c_str(), synced.text()));
    progress.newRecord->setDurable(true);
    return {};
}

Result<void> Replace::move(const ReplaceRequest& request, Progress& progress, StartDeletionThread startDeletionThread) {
    Result<void> result;
    // The preparation took its time: a home may have died meanwhile, and is not waited for under the lock.
    const auto askHome = [&] { (void)needs_.configuration.homeAnswers(request.userIdNew, fs::MountFence::Asked::now); };
    askHome();
    {
        const AllIdentifiersWriteLock lock(needs_.locks, Touches::nothing());
        result = recoveringFromExceptions(progress, [&] { return begin(request, progress, lock); });
        if (progress.stale)
            return {};
        // Others need not see a replace half done that needs no sync in between.
        if (!progress.isUnderWay) {
            if (auto failed = cleanUpReplace(progress, startDeletionThread))
                result = std::move(*failed);
            return result;
        }
    }
    if (result && progress.newMovesLater) {
        const platform::BlockingScope blocking;
        // A cut could leave the second of two moves without the first, with nothing else to keep their order.
        const Errno ordered =
            needs_.moves.durability().between(progress.prepared.waiting.get(), progress.directories.dest.get());
        askHome();
        const AllIdentifiersWriteLock lock(needs_.locks, progress.touches());
        result = recoveringFromExceptions(progress, [&]() -> Result<void> {
            if (ordered)
                return undoFirstMove(progress, posixError({replaceFunction, __LINE__}, ordered, "sync of %s failed: %s",
                                                          progress.waitingUrl.c_str(), ordered.text()));
            return putNewInPlace(request, progress);
        });
    }
    if (auto failed = cleanUpReplace(progress, startDeletionThread))
        result = std::move(*failed);
    endUnderWay(progress, WaitingReplaces::Ended::settled);
    return result;
}

template <typename Step>
Result<void> Replace::recoveringFromExceptions(Progress& progress, Step&& step) {
    try {
        return step();
    } catch (const std::exception& exception) {
        const ZORError caught = needs_.boundary.caught({replaceFunction, __LINE__}, exception);
        recoverFromException(progress);
        return caught;
    } catch (...) {
        (void)cleanUpReplace(progress, StartDeletionThread::no);
        throw;
    }
}

void Replace::endUnderWay(Progress& progress, WaitingReplaces::Ended how) noexcept {
    if (std::exchange(progress.isUnderWay, false))
        needs_.replaces.end(progress.prepared.journalUrl, how);
}

Result<void> Replace::begin(const ReplaceRequest& request, Progress& progress, const AllIdentifiersWriteLock& lock) {
    TRY(prepareReplace(request, progress, lock));
    if (const auto opened = openDirectories(progress); !opened)
        return progress.oldRecord ? oldNotMoved(progress, opened.error()) : notInPlace(progress, opened.error());
    if (!fits(progress.prepared, progress)) {
        progress.stale = true;
        return {};
    }
    lock.touch(progress.touches());
    if (progress.oldRecord)
        TRY(moveOldAway(request, progress));
    return progress.stale || progress.newMovesLater ? Result<void>() : putNewInPlace(request, progress);
}

ZORError Replace::changedTooOften(const Progress& progress) {
    const ZORError cause = posixError({replaceFunction, __LINE__}, Errno(EBUSY),
                                      "the containers changed whenever they had been prepared; try again");
    return progress.oldRecord ? oldNotMoved(progress, cause) : notInPlace(progress, cause);
}

ZORError Replace::oldNotMoved(const Progress& progress, const ZORError& cause) {
    return Reporter(needs_.log, replaceFunction)
        .error(ErrorCode::oldNotMovedToStaging, &cause, "Failed to move old %s to staging %s", progress.oldUrl.c_str(),
               progress.prepared.journal.waitingUrl().c_str());
}

Result<void> Replace::checkReplace(const ReplaceRequest& request) {
    const Reporter report(needs_.log, replaceFunction);
    if (!request.newUuid || !isValidClass(request.classNew))
        return report.error(ErrorCode::invalidObject,
                            "Can't act on an invalid object: new userId: %u, newUUID: %s, Class: %ld",
                            request.userIdNew, shown(request.newUuid).c_str(), static_cast<long>(request.classNew));
    if (!request.oldUuid && request.preserveOldUuid == PreserveOldUUID::yes)
        return report.error(ErrorCode::invalidObject, "Can't have a nil oldContainerUUID when preserving the UUID");
    if (!request.oldUuid)
        return {};
    if (!isValidClass(request.classOld))
        return report.error(ErrorCode::invalidObject,
                            "Can't act on an invalid object: old userId: %u, oldUUID: %s, Class: %ld",
                            request.userIdOld, shown(request.oldUuid).c_str(), static_cast<long>(request.classOld));
    if (request.classOld != request.classNew)
        return report.error(ErrorCode::classesDiffer, "Can't replace containers of different class types: %ld and %ld",
                            static_cast<long>(request.classOld), static_cast<long>(request.classNew));
    if (request.userIdOld != request.userIdNew)
        return report.error(ErrorCode::usersDiffer, "Can't replace containers of different userIds: %u and %u",
                            request.userIdOld, request.userIdNew);
    return {};
}

ZORError Replace::notInPlace(const Progress& progress, const ZORError& cause) {
    return Reporter(needs_.log, replaceFunction)
        .error(ErrorCode::newNotMovedIntoPlace, &cause, "Failed to replace: %s with: %s at: %s",
               progress.oldUrl.c_str(), progress.newUrl.c_str(), progress.destUrl.c_str());
}

Result<void> Replace::prepareReplace(const ReplaceRequest& request, Progress& progress,
                                     const AllIdentifiersWriteLock& lock) {
    const Reporter report(needs_.log, replaceFunction);
    const auto known = [&](std::uint32_t userId, const std::optional<UUID>& uuid,
                           const std::optional<std::string>& identifier,
                           ContainerClass containerClass) -> Result<std::shared_ptr<ZORMetadata>> {
        auto record = TRY(needs_.recovery.settledContainer(userId, containerClass, pointerTo(identifier), *uuid, lock));
        if (!record)
            return report.error(ErrorCode::notFound,
                                "No Container with userId: %u UUID: %s, identifier: %s, Class: %ld", userId,
                                uuid->string().c_str(), ZOR_SHOWN(identifier), static_cast<long>(containerClass));
        return record;
    };
    if (request.oldUuid) {
        progress.oldRecord = TRY(known(request.userIdOld, request.oldUuid, request.identifierOld, request.classOld));
        progress.oldUrl = progress.oldRecord->url();
        progress.oldWasTransient = progress.oldRecord->transient();
    }
    progress.newRecord = TRY(known(request.userIdNew, request.newUuid, request.identifierNew, request.classNew));
    progress.newUrl = progress.newRecord->url();
    if (progress.newUrl == progress.oldUrl)
        return report.error(ErrorCode::replacedByItself, "Can't replace the same container at %s",
                            progress.oldUrl.c_str());
    const auto directoryUuid = UUID::parse(progress.newUrl.lastPathComponent());
    if (!directoryUuid)
        return report.error(ErrorCode::pathNotAsExpected, "Invalid URL (last path component not UUID): %s",
                            progress.newUrl.c_str());
    if (request.preserveOldUuid == PreserveOldUUID::yes) {
        progress.destUrl = progress.oldUrl;
    } else {
        const auto destination = destinationOf(*progress.newRecord, *directoryUuid, progress.oldWasTransient);
        progress.destUrl = destination.value_or(FileURL());
        if (!destination ||
            (progress.destUrl != progress.oldUrl && !needs_.fileManager.itemDoesNotExistAtURL(progress.destUrl)))
            return report.error(ErrorCode::alreadyExists, "Container already exists at %s", progress.destUrl.c_str());
    }
    return refuseSecondOfIdentifier(progress);
}

std::optional<FileURL> Replace::destinationOf(const ZORMetadata& record, const UUID& directoryUuid, bool transient) {
    const auto classDirectory =
        needs_.configuration.containerDirectoryURLForUser(record.uid(), record.containerClass(), transient);
    // A well-known container lives under its name, whichever it is.
    const std::string* wellKnown =
        transient ? nullptr : needs_.whitelist.wellknownContainerForId(record.identifier(), record.containerClass());
    if (!classDirectory)
        return std::nullopt;
    return classDirectory->appendingDirectory(wellKnown ? *wellKnown : directoryUuid.string());
}

Result<void> Replace::refuseSecondOfIdentifier(const Progress& progress) {
    const ZORMetadata& record = *progress.newRecord;
    if (progress.oldRecord && progress.oldRecord->identifier() == record.identifier())
        return {};
    const auto live = needs_.cache.containerForUser(record.uid(), record.containerClass(), &record.identifier(),
                                                    progress.oldWasTransient);
    if (!live && !live.error().is(ErrorCode::notFound) && (!progress.oldRecord || live.error().isOwnShortage()))
        return live.error();
    // With an old one, the one that is found may be the new one itself; one that has lost its files is none.
    if (!live || (progress.oldRecord && *live == progress.newRecord))
        return {};
    return Reporter(needs_.log, replaceFunction)
        .error(ErrorCode::alreadyExists, "Container with identifier: %s, class: %ld, transient: %d already exists",
               ZOR_SHOWN(record.identifier()), static_cast<long>(record.containerClass()), progress.oldWasTransient);
}

// Everything of a replace that waits for the disk before its moves: the old UUID in the new one's file, the copy of a
// new one that lies on another file system than its destination, and the journal. It runs without the all-identifiers
// lock, for containers as they are at that moment; under the lock it counts when they are still the same (fits), else
// it is withdrawn.
//
// A stop leaves: a new one whose file says the old UUID, which a transient one is discarded with; a copy, in staging or
// aside, which the next launch sweeps; a journal of a replace in which nothing has moved.

using platform::FileDescriptor;

namespace {

std::optional<dev_t> deviceOf(int directory) {
    struct stat status{};
    return ::fstat(directory, &status) == 0 ? std::optional(status.st_dev) : std::nullopt;
}

bool isSameItem(int one, int other) {
    struct stat first{};
    struct stat second{};
    return ::fstat(one, &first) == 0 && ::fstat(other, &second) == 0 && first.st_dev == second.st_dev &&
           first.st_ino == second.st_ino;
}

} // namespace

bool Replace::fits(const Prepared& prepared, const Progress& progress) const {
    return prepared.newRecord && prepared.oldRecord == progress.oldRecord && prepared.newRecord == progress.newRecord &&
           prepared.oldUrl == progress.oldUrl && prepared.newUrl == progress.newUrl &&
           prepared.destUrl == progress.destUrl && prepared.newInfo == progress.newRecord->info();
}

bool Replace::lookAhead(const ReplaceRequest& request, Prepared& prepared) {
    const auto known = [&](std::uint32_t userId, const std::optional<UUID>& uuid,
                           const std::optional<std::string>& identifier, ContainerClass containerClass) {
        return needs_.cache.containerForUser(userId, containerClass, pointerTo(identifier), uuid->string())
            .value_or(nullptr);
    };
    auto fresh = known(request.userIdNew, request.newUuid, request.identifierNew, request.classNew);
    if (request.oldUuid)
        prepared.oldRecord = known(request.userIdOld, request.oldUuid, request.identifierOld, request.classOld);
    if (!fresh || (request.oldUuid && !prepared.oldRecord) || fresh == prepared.oldRecord)
        return false;
    prepared.newUrl = fresh->url();
    prepared.newInfo = fresh->info();
    if (prepared.oldRecord)
        prepared.oldUrl = prepared.oldRecord->url();
    const auto directoryUuid = UUID::parse(prepared.newUrl.lastPathComponent());
    const bool transient = prepared.oldRecord && prepared.oldRecord->transient();
    const auto destination = request.preserveOldUuid == PreserveOldUUID::yes ? prepared.oldUrl
                             : directoryUuid ? destinationOf(*fresh, *directoryUuid, transient).value_or(FileURL())
                                             : FileURL();
    prepared.destUrl = destination;
    const bool taken = destination.empty() ||
                       (destination != prepared.oldUrl && !needs_.fileManager.itemDoesNotExistAtURL(destination));
    // The judgement under the lock refuses it, or finds that all has changed.
    if (taken)
        return false;
    prepared.newRecord = std::move(fresh);
    return true;
}

Result<void> Replace::prepare(const ReplaceRequest& request, Prepared& prepared, bool mayExchange) {
    if (!lookAhead(request, prepared))
        return {};
    const platform::BlockingScope blocking(platform::Load::heavy); // a container may have to be copied
    const fs::PathResolver& resolver = needs_.fileManager.resolver();
    const auto old = prepared.oldRecord ? resolver.openParent(prepared.oldUrl) : Errno(ENOENT);
    const auto fresh = resolver.openParent(prepared.newUrl);
    const auto dest = resolver.openParent(prepared.destUrl);
    const auto staging = resolver.openDirectoryPath(needs_.configuration.stagingDirectory());
    // The step that opens them again under the lock says what is wrong with these.
    if (!fresh || !dest || !staging || (prepared.oldRecord && !old)) {
        prepared.newRecord = nullptr;
        return {};
    }
    const auto freshDevice = deviceOf(fresh->directory.get());
    const auto destDevice = deviceOf(dest->directory.get());
    const bool stagingIsBeside = destDevice == deviceOf(staging->get());
    const bool isElsewhere = freshDevice != destDevice;
    if (request.preserveOldUuid == PreserveOldUUID::yes)
        TRY(writeOldUuid(prepared));
    if (isElsewhere)
        TRY(copyNew(prepared, stagingIsBeside));
    if (!prepared.oldRecord)
        return {};
    // A live new one, or a transient old one, would leave two of one kind after a stop.
    prepared.exchanges = mayExchange && !isElsewhere && !prepared.oldRecord->transient() &&
                         prepared.newRecord->transient() && !stagingIsBeside;
    return prepared.exchanges ? Result<void>() : writeJournal(prepared, stagingIsBeside);
}

Result<void> Replace::writeOldUuid(Prepared& prepared) {
    ZORMetadata& record = *prepared.newRecord;
    const UUID own = record.uuid();
    const IdentifierWriteLock lock(needs_.locks, own.string(), Touches::nothing());
    // Its own writers hold that lock, too.
    if (record.uuid() != own || record.url() != prepared.newUrl)
        return {};
    prepared.newInfo = record.info();
    const ZORMetadata asOld(record.uid(), prepared.oldRecord->uuid(), record.containerClass(), record.identifier(),
                            prepared.newInfo, ContainerPlace(prepared.newUrl));
    prepared.newSaysOldUuid = true; // also when only the sync behind it failed
    return asOld.writeMetadataToDiskWithError(needs_.log, needs_.fileManager);
}

Result<FileURL> Replace::openWaitingPlace(FileDescriptor& directory, const FileURL& beside, bool stagingIsBeside) {
    if (stagingIsBeside) {
        FileURL staging = needs_.configuration.stagingDirectory();
        directory = TRY(needs_.fileManager.openDirectoryOf(ownerUnchanged, staging));
        return staging;
    }
    const auto top = fs::topOfMount(needs_.fileManager.resolver(), beside.deletingLastPathComponent());
    auto aside =
        top ? fs::openOrMakeAside(needs_.fileManager.disk(), top->directory.get()) : fs::OpenResult(top.error());
    if (!aside)
        return posixError({replaceFunction, __LINE__}, aside.error(),
                          "there is no place on the file system of %s for a container that is replaced: %s",
                          beside.c_str(), aside.error().text());
    directory = std::move(*aside);
    // A cut could keep a move into it and lose the directory, if it was just made, where nothing keeps the order.
    if (const Errno synced = needs_.moves.durability().beforeRemoval(directory.get()))
        return posixError({replaceFunction, __LINE__}, synced, "sync of %s failed: %s",
                          fs::asideBelow(top->url).c_str(), synced.text());
    return fs::asideBelow(top->url);
}

Result<void> Replace::copyNew(Prepared& prepared, bool stagingIsBeside) {
    const auto copied = [&]() -> Result<void> {
        const std::uint32_t owner =
            topLevelOwnerOf(prepared.newRecord->containerClass(), prepared.newRecord->uid()).value_or(ownerUnchanged);
        prepared.copied = TRY(needs_.fileManager.openDirectoryOf(owner, prepared.newUrl));
        const FileURL place = TRY(openWaitingPlace(prepared.copies, prepared.destUrl, stagingIsBeside));
        prepared.copyUrl = place.appendingDirectory(UUID::random().string());
        TRY(needs_.fileManager.copyItemAtURL(prepared.newUrl, prepared.copyUrl));
        TRY(needs_.fileManager.openDirectoryOf(owner, prepared.copyUrl));
        return {};
    }();
    if (copied)
        return {};
    return Reporter(needs_.log, replaceFunction)
        .error(ErrorCode::newNotMovedIntoPlace, &copied.error(), "Failed to replace: %s with: %s at: %s",
               prepared.oldUrl.c_str(), prepared.newUrl.c_str(), prepared.destUrl.c_str());
}

Result<void> Replace::writeJournal(Prepared& prepared, bool stagingIsBeside) {
    const Reporter report(needs_.log, replaceFunction);
    const UUID uuid = UUID::random();
    prepared.journal = {.oldUrl = prepared.oldUrl,
                        .newUrl = prepared.newUrl,
                        .stagingUrl = needs_.configuration.stagingDirectory().appendingDirectory(uuid.string()),
                        .destUrl = prepared.destUrl};
    const auto opened = [&]() -> Result<void> {
        prepared.journals =
            TRY(needs_.fileManager.openDirectoryOf(ownerUnchanged, needs_.configuration.replaceDirectory()));
        const FileURL place = TRY(openWaitingPlace(prepared.waiting, prepared.oldUrl, stagingIsBeside));
        if (!stagingIsBeside)
            prepared.journal.asideUrl = place.appendingDirectory(uuid.string());
        return {};
    }();
    if (!opened)
        return report.error(ErrorCode::oldNotMovedToStaging, &opened.error(), "Failed to move old %s to staging %s",
                            prepared.oldUrl.c_str(), prepared.journal.waitingUrl().c_str());
    prepared.journalUrl = ReplaceJournal::urlFor(needs_.configuration.replaceDirectory(), uuid);
    prepared.hasJournal = true; // also where only its last sync failed
    const auto written = prepared.journal._writeToDiskReplaceAt(needs_.log, needs_.fileManager, prepared.journalUrl);
    if (!written)
        report.write(logLevelError, "Failed to write replace file: %s", written.error().text().c_str());
    return written;
}

bool Replace::isSameNew(const Progress& progress) const {
    return !progress.prepared.copied.valid() || isSameItem(progress.prepared.copied.get(), progress.newOne.get());
}

void Replace::withdraw(Progress& progress) {
    Prepared& prepared = progress.prepared;
    if (std::exchange(prepared.hasJournal, false) && !progress.hasMovedByJournal()) {
        // Nothing has moved, so it does no harm where it stays.
        const std::string name(prepared.journalUrl.lastPathComponent());
        (void)needs_.fileManager.disk().unlinkFile(prepared.journals.get(), name.c_str());
    }
    if (!prepared.copyUrl.empty())
        (void)needs_.deathRow._moveItemAtURLToDeathRow(std::exchange(prepared.copyUrl, FileURL()),
                                                       StartDeletionThread::yes);
    if (!std::exchange(prepared.newSaysOldUuid, false) || !prepared.newRecord)
        return;
    // It did not take the old one's place: it is again who it was. Should that fail, the file's next writing does it.
    const ZORMetadata& record = *prepared.newRecord;
    const IdentifierWriteLock lock(needs_.locks, record.uuid().string(), Touches::nothing());
    (void)record.writeMetadataToDiskWithError(needs_.log, needs_.fileManager);
}

} // namespace zor
