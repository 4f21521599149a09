// SPDX-License-Identifier: Apache-2.0
#include "operations/Replace.h"

#include "base/BlockingScope.h"
#include "fs/ItemStatus.h"
#include "os/FileDescriptor.h"
#include "store/ContainerLayout.h"
#include "store/ReplaceJournal.h"
#include "store/ZORWhitelist.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <iterator>
#include <span>
#include <sys/stat.h>
#include <tuple>
#include <utility>

namespace zor {

using platform::FileDescriptor;

/// How far a replace has come; what its clean-up, and the recovery from an exception, go by.
struct Replace::Progress {
    std::shared_ptr<ZORMetadata> oldRecord; // nullptr: none is replaced
    std::shared_ptr<ZORMetadata> newRecord;
    bool oldWasTransient = false;
    FileURL oldUrl;
    FileURL newUrl;
    FileURL destUrl;
    FileURL stagingUrl;                // empty until it is known
    FileURL journalUrl;                // the same
    std::optional<UUID> newUuidBefore; // while the new container's file says the old UUID
    /// The directory of which a move is to be on the disk before the journal can be gone; nullptr: none.
    const FileDescriptor* moved = nullptr;
    bool oldWaits = false; // in staging, and its journal with it, for a later try
    bool swapped = false;  // the old one lies in the new one's place, and needs no journal
    /// The containers themselves.
    FileDescriptor oldOne;
    FileDescriptor newOne;
    /// Opened before the first move, so that want of descriptors stops no replace half-way and leaves no journal of one
    /// that is done: a launch would take it for one to be undone as soon as the new container has gone.
    struct {
        FileDescriptor old;
        FileDescriptor fresh;
        FileDescriptor staging;
        FileDescriptor dest;
        FileDescriptor journals;
    } directories;
};

namespace {

constexpr const char* replaceFunction = "replaceContainer";

const std::string* pointerTo(const std::optional<std::string>& text) {
    return text ? &*text : nullptr;
}

std::string shown(const std::optional<UUID>& uuid) {
    return uuid ? uuid->string() : "(null)";
}

} // namespace

Result<void> Replace::replaceContainer(const ReplaceRequest& request, StartDeletionThread startDeletionThread) {
    // What is thrown while containers move is dealt with where it happens; the rest has nothing to recover.
    return needs_.boundary.run({replaceFunction, __LINE__},
                               [&] { return checkedReplace(request, startDeletionThread); });
}

Result<void> Replace::checkedReplace(const ReplaceRequest& request, StartDeletionThread startDeletionThread) {
    Progress progress;
    TRY(checkReplace(request));
    needs_.cache.prepare(request.userIdNew, request.classNew); // the old one's, too
    auto swapped = [&]() -> Result<void> {
        const AllIdentifiersWriteLock lock(needs_.locks);
        Result<void> result;
        try {
            result = swapContainers(request, progress, lock);
        } catch (const std::exception& exception) {
            result = needs_.boundary.caught({replaceFunction, __LINE__}, exception);
            recoverFromException(progress);
        } catch (...) {
            (void)cleanUpReplace(progress, startDeletionThread);
            throw;
        }
        if (auto failed = cleanUpReplace(progress, startDeletionThread))
            return std::move(*failed);
        return result;
    }();
    if (!swapped)
        return swapped;
    const platform::BlockingScope blocking;
    const auto& directories = progress.directories;
    const int dest = directories.dest.get();
    // A journal that came back with the power would undo what comes to the new one later.
    const bool hasJournal = progress.oldRecord && !progress.swapped;
    const int synced = needs_.moves.durability().afterMoves(dest, hasJournal ? directories.journals.get() : dest);
    if (synced < 0)
        return needs_.moves.notLasting(replaceFunction, ErrorCode::newNotMovedIntoPlace, progress.destUrl,
                                       posixError({replaceFunction, __LINE__}, -synced, "sync of %s failed: %s",
                                                  progress.destUrl.c_str(), errorText(-synced)));
    progress.newRecord->setDurable(true);
    return {};
}

Result<void> Replace::checkReplace(const ReplaceRequest& request) {
    const Log& log = needs_.log;
    const Here here{replaceFunction, __LINE__};
    if (!request.newUuid || !isValidClass(request.classNew))
        return makeError(log, here, ErrorCode::invalidObject, nullptr, LogFlag::yes,
                         "Can't act on an invalid object: new userId: %u, newUUID: %s, Class: %ld", request.userIdNew,
                         shown(request.newUuid).c_str(), static_cast<long>(request.classNew));
    if (!request.oldUuid && request.preserveOldUuid == PreserveOldUUID::yes)
        return makeError(log, here, ErrorCode::invalidObject, nullptr, LogFlag::yes,
                         "Can't have a nil oldContainerUUID when preserving the UUID");
    if (!request.oldUuid)
        return {};
    if (!isValidClass(request.classOld))
        return makeError(log, here, ErrorCode::invalidObject, nullptr, LogFlag::yes,
                         "Can't act on an invalid object: old userId: %u, oldUUID: %s, Class: %ld", request.userIdOld,
                         shown(request.oldUuid).c_str(), static_cast<long>(request.classOld));
    if (request.classOld != request.classNew)
        return makeError(log, here, ErrorCode::classesDiffer, nullptr, LogFlag::yes,
                         "Can't replace containers of different class types: %ld and %ld",
                         static_cast<long>(request.classOld), static_cast<long>(request.classNew));
    if (request.userIdOld != request.userIdNew)
        return makeError(log, here, ErrorCode::usersDiffer, nullptr, LogFlag::yes,
                         "Can't replace containers of different userIds: %u and %u", request.userIdOld,
                         request.userIdNew);
    return {};
}

Result<void> Replace::swapContainers(const ReplaceRequest& request, Progress& progress,
                                     const AllIdentifiersWriteLock& lock) {
    TRY(prepareReplace(request, progress, lock));
    if (progress.oldRecord)
        TRY(moveOldAway(request, progress));
    else if (const auto opened = openDirectories(progress, {}); !opened)
        return notInPlace(progress, opened.error());
    return putNewInPlace(request, progress);
}

ZORError Replace::notInPlace(const Progress& progress, const ZORError& cause) {
    return makeError(needs_.log, {replaceFunction, __LINE__}, ErrorCode::newNotMovedIntoPlace, &cause, LogFlag::yes,
                     "Failed to replace: %s with: %s at: %s", progress.oldUrl.c_str(), progress.newUrl.c_str(),
                     progress.destUrl.c_str());
}

Result<void> Replace::prepareReplace(const ReplaceRequest& request, Progress& progress,
                                     const AllIdentifiersWriteLock& lock) {
    const Log& log = needs_.log;
    const Here here{replaceFunction, __LINE__};
    const auto known = [&](std::uint32_t userId, const std::optional<UUID>& uuid,
                           const std::optional<std::string>& identifier,
                           ContainerClass containerClass) -> Result<std::shared_ptr<ZORMetadata>> {
        auto record = TRY(needs_.recovery.settledContainer(userId, containerClass, pointerTo(identifier), *uuid, lock));
        if (!record)
            return makeError(log, here, ErrorCode::notFound, nullptr, LogFlag::yes,
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
        return makeError(log, here, ErrorCode::replacedByItself, nullptr, LogFlag::yes,
                         "Can't replace the same container at %s", progress.oldUrl.c_str());
    const auto directoryUuid = UUID::parse(progress.newUrl.lastPathComponent());
    if (!directoryUuid)
        return makeError(log, here, ErrorCode::pathNotAsExpected, nullptr, LogFlag::yes,
                         "Invalid URL (last path component not UUID): %s", progress.newUrl.c_str());
    if (request.preserveOldUuid == PreserveOldUUID::yes) {
        progress.destUrl = progress.oldUrl;
    } else {
        const auto classDirectory = needs_.configuration.containerDirectoryURLForUser(
            request.userIdNew, request.classNew, progress.oldWasTransient);
        // A well-known container lives under its name, whichever it is.
        const std::string* wellKnown =
            progress.oldWasTransient
                ? nullptr
                : needs_.whitelist.wellknownContainerForId(progress.newRecord->identifier(), request.classNew);
        if (classDirectory)
            progress.destUrl = classDirectory->appendingDirectory(wellKnown ? *wellKnown : directoryUuid->string());
        if (!classDirectory ||
            (progress.destUrl != progress.oldUrl && !needs_.fileManager.itemDoesNotExistAtURL(progress.destUrl)))
            return makeError(log, here, ErrorCode::alreadyExists, nullptr, LogFlag::yes,
                             "Container already exists at %s", progress.destUrl.c_str());
    }
    return refuseSecondOfIdentifier(progress);
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
    return makeError(needs_.log, {replaceFunction, __LINE__}, ErrorCode::alreadyExists, nullptr, LogFlag::yes,
                     "Container with identifier: %s, class: %ld, transient: %d already exists",
                     ZOR_SHOWN(record.identifier()), static_cast<long>(record.containerClass()),
                     progress.oldWasTransient);
}

Result<void> Replace::moveOldAway(const ReplaceRequest& request, Progress& progress) {
    const Log& log = needs_.log;
    const Here here{replaceFunction, __LINE__};
    const UUID journalUuid = UUID::random();
    const FileURL stagingUrl = needs_.configuration.stagingDirectory().appendingDirectory(journalUuid.string());
    const auto oldNotMoved = [&](const ZORError& cause) {
        return makeError(log, here, ErrorCode::oldNotMovedToStaging, &cause, LogFlag::yes,
                         "Failed to move old %s to staging %s", progress.oldUrl.c_str(), stagingUrl.c_str());
    };
    // Whoever owns them may have put something else, or another's directory, in their places.
    const std::uint32_t owner =
        ZORGlobalConfiguration::ownerOfClassDirectory(request.classNew, progress.newRecord->uid());
    for (const auto& [url, directory] :
         {std::pair(&progress.oldUrl, &progress.oldOne), std::pair(&progress.newUrl, &progress.newOne)}) {
        auto opened = needs_.fileManager.openDirectoryOf(owner, *url);
        if (!opened)
            return oldNotMoved(opened.error());
        *directory = std::move(*opened);
    }
    if (const auto opened = openDirectories(progress, stagingUrl); !opened)
        return oldNotMoved(opened.error());
    if (request.preserveOldUuid == PreserveOldUUID::yes) {
        progress.newUuidBefore = progress.newRecord->uuid();
        progress.newRecord->setUuid(progress.oldRecord->uuid());
        TRY(progress.newRecord->writeMetadataToDiskWithError(log, needs_.fileManager));
    }
    const auto swapped = changePlaces(progress);
    if (!swapped)
        return oldNotMoved(swapped.error());
    if (*swapped)
        return forgetOld(request, progress);
    const FileURL journalUrl = ReplaceJournal::urlFor(needs_.configuration.replaceDirectory(), journalUuid);
    progress.stagingUrl = stagingUrl;
    const ReplaceJournal journal{.oldUrl = progress.oldUrl,
                                 .newUrl = progress.newUrl,
                                 .stagingUrl = progress.stagingUrl,
                                 .destUrl = progress.destUrl};
    const auto& directories = progress.directories;
    if (auto written = journal._writeToDiskReplaceAt(log, needs_.fileManager, journalUrl); !written) {
        log.write(logLevelError, replaceFunction, "Failed to write replace file: %s", written.error().text().c_str());
        // Where only its last sync failed it is there; nothing has moved, so it does no harm where it stays.
        const std::string name(journalUrl.lastPathComponent());
        (void)needs_.fileManager.disk().unlinkFile(directories.journals.get(), name.c_str());
        return written;
    }
    progress.journalUrl = journalUrl;
    progress.moved = &directories.old;
    const auto moved = needs_.fileManager.moveItem(directories.old.get(), progress.oldUrl, directories.staging.get(),
                                                   progress.stagingUrl);
    if (!moved)
        return oldNotMoved(moved.error());
    // A copy does not fail when only the source cannot go: two would be live.
    if (*moved == ZORFileManager::Moved::byCopy && !needs_.fileManager.itemDoesNotExistAtURL(progress.oldUrl))
        return oldNotMoved(posixError(here, EBUSY, "%s is still there", progress.oldUrl.c_str()));
    // In staging nobody else can put another in its place.
    if (*moved == ZORFileManager::Moved::byName)
        if (const auto meant = judgeMoved(directories.staging.get(), progress.stagingUrl, progress.oldOne); !meant)
            return undoFirstMove(progress, meant.error());
    progress.moved = &directories.dest;
    // A cut could leave the second of two moves without the first, with nothing else to keep their order.
    if (const int ordered = needs_.moves.durability().between(directories.staging.get(), directories.dest.get());
        ordered < 0)
        return undoFirstMove(
            progress, posixError(here, -ordered, "sync of %s failed: %s", stagingUrl.c_str(), errorText(-ordered)));
    return forgetOld(request, progress);
}

Result<void> Replace::forgetOld(const ReplaceRequest& request, const Progress& progress) {
    const bool transient = progress.oldWasTransient;
    const auto removed = needs_.cache.removeContainerForUser(request.userIdOld, request.classOld,
                                                             &progress.oldRecord->identifier(), transient);
    if (!removed)
        return makeError(needs_.log, {replaceFunction, __LINE__}, ErrorCode::cacheRemoveFailed, &removed.error(),
                         LogFlag::yes, "Failed to remove from cache id: %s, class: %ld, transient: %d",
                         ZOR_SHOWN(progress.oldRecord->identifier()), static_cast<long>(request.classOld), transient);
    return {};
}

Result<void> Replace::judgeMoved(int directory, const FileURL& url, const FileDescriptor& moved) {
    struct stat named{};
    struct stat meant{};
    const int failure = fs::statusOfName(directory, std::string(url.lastPathComponent()).c_str(), named);
    if (failure == 0 && ::fstat(moved.get(), &meant) == 0 && named.st_dev == meant.st_dev &&
        named.st_ino == meant.st_ino)
        return {};
    return posixError({replaceFunction, __LINE__}, failure != 0 ? failure : ESTALE,
                      "what came to %s is not the container", url.c_str());
}

Result<bool> Replace::changePlaces(Progress& progress) {
    const auto& directories = progress.directories;
    struct stat old{};
    struct stat staging{};
    // A live new one, or a transient old one, would leave two of one kind after a stop.
    if (progress.oldWasTransient || !progress.newRecord->transient() || ::fstat(directories.old.get(), &old) != 0 ||
        ::fstat(directories.staging.get(), &staging) != 0 || old.st_dev == staging.st_dev)
        return false;
    const auto exchange = [&] {
        return needs_.fileManager.disk().rename(
            directories.old.get(), std::string(progress.oldUrl.lastPathComponent()).c_str(), directories.fresh.get(),
            std::string(progress.newUrl.lastPathComponent()).c_str(), RENAME_EXCHANGE);
    };
    const int exchanged = exchange();
    if (exchanged == -EXDEV || exchanged == -EINVAL || exchanged == -ENOSYS || exchanged == -EOPNOTSUPP)
        return false; // a file system that cannot
    if (exchanged < 0)
        return posixError({replaceFunction, __LINE__}, -exchanged, "exchange of %s and %s failed: %s",
                          progress.oldUrl.c_str(), progress.newUrl.c_str(), errorText(-exchanged));
    for (const auto& [directory, url, one] : {std::tuple(&directories.old, &progress.oldUrl, &progress.newOne),
                                              std::tuple(&directories.fresh, &progress.newUrl, &progress.oldOne)})
        if (auto meant = judgeMoved(directory->get(), *url, *one); !meant) {
            (void)exchange(); // their owner did it
            return std::move(meant).error();
        }
    progress.swapped = true;
    progress.newUuidBefore.reset();
    return true;
}

ZORError Replace::undoFirstMove(Progress& progress, const ZORError& cause) {
    const Log& log = needs_.log;
    const Here here{replaceFunction, __LINE__};
    const auto& directories = progress.directories;
    const auto undone = needs_.fileManager.moveItem(directories.staging.get(), progress.stagingUrl,
                                                    directories.old.get(), progress.oldUrl);
    if (undone) {
        progress.moved = &directories.old;
        return makeError(log, here, ErrorCode::oldNotMovedToStaging, &cause, LogFlag::yes,
                         "Failed to move old %s to staging %s", progress.oldUrl.c_str(), progress.stagingUrl.c_str());
    }
    progress.oldWaits = true;
    (void)needs_.cache.removeContainerForUser(progress.oldRecord->uid(), progress.oldRecord->containerClass(),
                                              &progress.oldRecord->identifier(), progress.oldWasTransient);
    return makeError(log, here, ErrorCode::journalUnusable, &undone.error(), LogFlag::yes,
                     "Failed to recover replace move: %s to %s", progress.stagingUrl.c_str(), progress.oldUrl.c_str());
}

Result<void> Replace::openDirectories(Progress& progress, const FileURL& stagingUrl) {
    auto& directories = progress.directories;
    struct Wanted {
        FileDescriptor* descriptor;
        FileURL url;
        std::uint32_t owner;
    };
    // Old and new one are of one class and user.
    const std::uint32_t owner =
        ZORGlobalConfiguration::ownerOfClassDirectory(progress.newRecord->containerClass(), progress.newRecord->uid());
    const Wanted wanted[] = {
        {&directories.fresh, progress.newUrl, owner},
        {&directories.dest, progress.destUrl, owner},
        {&directories.old, progress.oldUrl, owner},
        {&directories.staging, stagingUrl, ownerUnchanged},
        {&directories.journals, needs_.configuration.replaceDirectory().appendingFile("journal"), ownerUnchanged}};
    constexpr std::size_t ofTheNewOne = 2;
    for (const Wanted& one : std::span(wanted).first(progress.oldRecord ? std::size(wanted) : ofTheNewOne))
        *one.descriptor = TRY(needs_.fileManager.openDirectoryOf(one.owner, one.url.deletingLastPathComponent()));
    return {};
}

Result<void> Replace::putNewInPlace(const ReplaceRequest& request, Progress& progress) {
    const Log& log = needs_.log;
    const Here here{replaceFunction, __LINE__};
    ZORMetadata& record = *progress.newRecord;
    if (const auto moved = moveNew(progress); !moved)
        return notInPlace(progress, moved.error());
    progress.newUuidBefore.reset(); // the old UUID is its own from now on
    record.setDurable(false);
    const bool newWasTransient = record.transient();
    const auto removed =
        needs_.cache.removeContainerForUser(request.userIdNew, request.classNew, &record.identifier(), newWasTransient);
    if (!removed)
        return makeError(log, here, ErrorCode::cacheRemoveFailed, &removed.error(), LogFlag::yes,
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
            log.write(logLevelError, replaceFunction, "Failed to set container mapping in replace operation");
    }
    record.setTransient(progress.oldWasTransient);
    const auto added = needs_.cache.addContainerMetadata(progress.newRecord, request.userIdNew,
                                                         ContainerPlace(progress.destUrl), progress.oldWasTransient);
    if (!added)
        return makeError(log, here, ErrorCode::cacheAddFailed, &added.error(), LogFlag::yes,
                         "Failed to add to cache: %s, url: %s, transient: %d", ZOR_SHOWN(record.identifier()),
                         progress.destUrl.c_str(), progress.oldWasTransient);
    return {};
}

Result<void> Replace::moveNew(Progress& progress) {
    const auto& directories = progress.directories;
    if (!progress.swapped) {
        TRY(needs_.fileManager.moveItem(directories.fresh.get(), progress.newUrl, directories.dest.get(),
                                        progress.destUrl));
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

void Replace::recoverFromException(const Progress& progress) {
    ZORFileManager& fileManager = needs_.fileManager;
    if (progress.swapped) {
        // Nothing waits in staging. The cache may know some of what has happened, and the disk knows all.
        needs_.cache.dropAll();
        return;
    }
    if (progress.oldUrl.empty() || progress.destUrl.empty() || !fileManager.itemDoesNotExistAtURL(progress.oldUrl) ||
        !fileManager.itemDoesNotExistAtURL(progress.destUrl))
        return;
    if (needs_.log.writes(logLevelDebug))
        needs_.log.write(logLevelDebug, replaceFunction, "Recovering from exception by moving: %s to %s",
                         progress.stagingUrl.c_str(), progress.oldUrl.c_str());
    const auto moved = fileManager.moveItem(progress.directories.staging.get(), progress.stagingUrl,
                                            progress.directories.old.get(), progress.oldUrl);
    if (moved) {
        // Its record may have left the cache already. Should that fail, the next reading of its class finds it.
        (void)needs_.cache.addContainerMetadata(progress.oldRecord, progress.oldRecord->uid(),
                                                ContainerPlace(progress.oldUrl), progress.oldWasTransient);
        return;
    }
    makeError(needs_.log, {replaceFunction, __LINE__}, ErrorCode::journalUnusable, &moved.error(), LogFlag::yes,
              "Failed to recover replace move: %s to %s", progress.stagingUrl.c_str(), progress.oldUrl.c_str());
    // The journal stays, and the next launch tries again: going on would let the clean-up take the old container.
    std::abort();
}

std::optional<ZORError> Replace::cleanUpReplace(Progress& progress, StartDeletionThread startDeletionThread) {
    if (progress.newUuidBefore) {
        // It did not take the old one's place: it is again who it was. Should that fail, the file's next writing does
        // it.
        progress.newRecord->setUuid(*progress.newUuidBefore);
        (void)progress.newRecord->writeMetadataToDiskWithError(needs_.log, needs_.fileManager);
    }
    if (progress.swapped) {
        const auto moved = needs_.deathRow._moveItemAtURLToDeathRow(
            progress.newUrl, startDeletionThread,
            topLevelOwnerOf(progress.newRecord->containerClass(), progress.newRecord->uid()));
        if (moved)
            return std::nullopt;
        return makeError(needs_.log, {replaceFunction, __LINE__}, ErrorCode::replaceCleanUpFailed, &moved.error(),
                         LogFlag::yes, "Failed to remove staging dir: %s", progress.newUrl.c_str());
    }
    if (!progress.oldRecord || progress.journalUrl.empty())
        return std::nullopt;
    const auto& directories = progress.directories;
    const auto waits = [&] {
        needs_.recovery.leave(
            {.journalUrl = progress.journalUrl, .oldUrl = progress.oldUrl, .destUrl = progress.destUrl});
    };
    const auto journalStays = [&](const ZORError& cause) {
        waits();
        return makeError(needs_.log, {replaceFunction, __LINE__}, ErrorCode::replaceCleanUpFailed, &cause, LogFlag::yes,
                         "Failed to remove replace file: %s", progress.journalUrl.c_str());
    };
    if (progress.oldWaits) {
        waits();
        return std::nullopt;
    }
    // The moves are on the disk before the journal can be gone. Where that cannot be, it stays for the next request or
    // launch, which finds what has moved.
    const int ordered =
        progress.moved ? needs_.moves.durability().between(progress.moved->get(), directories.journals.get()) : 0;
    if (ordered < 0)
        return journalStays(posixError({replaceFunction, __LINE__}, -ordered, "sync of %s failed: %s",
                                       progress.destUrl.deletingLastPathComponent().c_str(), errorText(-ordered)));
    std::optional<ZORError> failed;
    if (const auto moved = needs_.deathRow._moveItemAtURLToDeathRow(progress.stagingUrl, StartDeletionThread::no);
        !moved)
        failed = makeError(needs_.log, {replaceFunction, __LINE__}, ErrorCode::replaceCleanUpFailed, &moved.error(),
                           LogFlag::yes, "Failed to remove staging dir: %s", progress.stagingUrl.c_str());
    const std::string journalName(progress.journalUrl.lastPathComponent());
    if (const auto moved = needs_.deathRow._moveItemAtURLToDeathRow(progress.journalUrl, startDeletionThread);
        !moved && needs_.fileManager.disk().unlinkFile(directories.journals.get(), journalName.c_str()) < 0)
        failed = journalStays(moved.error());
    return failed;
}

} // namespace zor
