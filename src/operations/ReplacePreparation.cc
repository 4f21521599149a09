// SPDX-License-Identifier: Apache-2.0
// Everything of a replace that waits for the disk before its moves: the old UUID in the new one's file, the copy of a
// new one that lies on another file system than its destination, and the journal. It runs without the all-identifiers
// lock, for containers as they are at that moment; under the lock it counts when they are still the same (fits), else
// it is withdrawn.
//
// A stop leaves: a new one whose file says the old UUID, which a transient one is discarded with; a copy, in staging or
// aside, which the next launch sweeps; a journal of a replace in which nothing has moved.
#include "base/BlockingScope.h"
#include "fs/FileSystemDeathRow.h"
#include "operations/ReplaceProgress.h"
#include "store/ContainerLayout.h"

#include <cerrno>
#include <sys/stat.h>
#include <utility>

namespace zor {

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

const std::string* pointerTo(const std::optional<std::string>& text) {
    return text ? &*text : nullptr;
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
    const platform::BlockingScope blocking;
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
    const IdentifierWriteLock lock(needs_.locks, own.string());
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
    return makeError(needs_.log, {replaceFunction, __LINE__}, ErrorCode::newNotMovedIntoPlace, &copied.error(),
                     LogFlag::yes, "Failed to replace: %s with: %s at: %s", prepared.oldUrl.c_str(),
                     prepared.newUrl.c_str(), prepared.destUrl.c_str());
}

Result<void> Replace::writeJournal(Prepared& prepared, bool stagingIsBeside) {
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
        return makeError(needs_.log, {replaceFunction, __LINE__}, ErrorCode::oldNotMovedToStaging, &opened.error(),
                         LogFlag::yes, "Failed to move old %s to staging %s", prepared.oldUrl.c_str(),
                         prepared.journal.waitingUrl().c_str());
    prepared.journalUrl = ReplaceJournal::urlFor(needs_.configuration.replaceDirectory(), uuid);
    prepared.hasJournal = true; // also where only its last sync failed
    const auto written = prepared.journal._writeToDiskReplaceAt(needs_.log, needs_.fileManager, prepared.journalUrl);
    if (!written)
        needs_.log.write(logLevelError, replaceFunction, "Failed to write replace file: %s",
                         written.error().text().c_str());
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
    const IdentifierWriteLock lock(needs_.locks, record.uuid().string());
    (void)record.writeMetadataToDiskWithError(needs_.log, needs_.fileManager);
}

} // namespace zor
