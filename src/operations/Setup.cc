// SPDX-License-Identifier: Apache-2.0
// Bringing the store into a consistent state before any client is served: once a boot, and at every launch.
//
// Runs on the thread that starts the daemon, alone; only the entitlement and group passes take identifier locks, for
// what they clear and delete. Neither setup fails: what goes wrong is logged and the next step runs. Every step may be
// repeated, so a stop anywhere is mended by the next launch: the boot's work is marked as done only when all of it ran.
// A daemon that is told to end stops between two items. Directories are read in batches: no number of entries is too
// large for the memory.
#include "base/UserIdentity.h"
#include "fs/Stretches.h"
#include "operations/StoreServices.h"
#include "operations/ZORClientConnection.h"
#include "operations/ZORContainerMigrator.h"
#include "operations/ZOREntitlementMapping.h"
#include "operations/ZORGroupManager.h"
#include "store/Names.h"
#include "store/ReplaceJournal.h"
#include "store/ZORWhitelist.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <utility>
#include <vector>

namespace zor {

namespace {

constexpr std::array orphanReportHead = {
    "***INTERNAL BUILD REQUEST: If you see this, file a Tracklet in \"Zorvane | all\" with the following data:",
    "\tSomeone is writing invalid data to a container, which has now been orphaned. Here are the invalid files:",
};
constexpr const char* launchFunction = "containerManagerSetup";
constexpr const char* rebootFunction = "rebootContainerManagerSetup";
/// So many entries of a class directory are judged at once: enough for several threads, little enough for any memory.
constexpr std::size_t orphanBatchMax = 1024;
constexpr const char* orphanReportEnd = "***END INTERNAL BUILD REQUEST";

template <typename Function>
void forEachClass(bool (*belongs)(ContainerClass), Function&& function) {
    for (std::uint64_t number = 1; ipc::isContainerClass(number); ++number)
        if (belongs(static_cast<ContainerClass>(number)))
            function(static_cast<ContainerClass>(number));
}

bool isSharedClass(ContainerClass containerClass) {
    return isBundleClass(containerClass) || isSystemClass(containerClass);
}

bool isUserClass(ContainerClass containerClass) {
    return isPerUserClass(containerClass);
}

} // namespace

void ZORClientConnection::rebootContainerManagerSetup() {
    SetupReport& report = services_.setup;
    services_.configuration.fenceHomes();
    report.run("bundle migration", [this] { return migrateBundles(); });
    report.run("well-known migration", [this] { return migrateWellknown(); });
    report.run("shared transient containers", [this] {
        std::uint64_t moved =
            discardAtBoot(services_.configuration.transientDirectory(), "shared transient", std::nullopt);
        moved += discardAtBoot(services_.configuration.transientBundleDirectory(), "shared transient bundle",
                               services_.configuration.users().installer);
        return moved;
    });
    report.run("group identifiers of data containers",
               [this] { return services_.entitlements.migrateAppGroupIdsFromDataContainersToFile(); });
    report.run("system containers", [this] { return services_.entitlements.reconcileSystemContainers(); });
    report.run("system groups", [this] { return services_.groups.reconcileGroupContainersOfType(GroupType::system); });
    report.run("application groups",
               [this] { return services_.groups.reconcileGroupContainersOfType(GroupType::application); });
    report.run("orphans of users", [this] { return cleanUpUsers(); });
    report.run("orphans of the system", [this] {
        std::uint64_t removed = 0;
        forEachClass(isSharedClass, [&](ContainerClass containerClass) {
            removed +=
                _cleanupOrphanedDataForUser(isBundleClass(containerClass) ? services_.configuration.users().installer
                                                                          : services_.configuration.users().system,
                                            containerClass);
        });
        return removed;
    });
}

std::uint64_t ZORClientConnection::migrateBundles() {
    const auto outcome = services_.migrator.performMigrationWithError();
    if (!outcome.succeeded)
        services_.log.write(logLevelError, rebootFunction,
                            "Failed to migrate bundle containers to system location : %s",
                            outcome.error ? outcome.error->text().c_str() : "(null)");
    // Where its moves hide what they copy: beside either location, and beside class directories.
    discardCopyLeftovers(services_.configuration.formerBundleDirectory().deletingLastPathComponent());
    discardCopyLeftovers(services_.configuration.sharedContainersDirectory());
    discardCopyLeftovers(services_.configuration.bundleDirectory());
    return outcome.migrated;
}

std::uint64_t ZORClientConnection::migrateWellknown() {
    const auto outcome = services_.migrator.performWhitelistMigrationWithError();
    if (!outcome.succeeded)
        services_.log.write(logLevelError, rebootFunction, "Failed to migrate whitelisted bundle containers : %s",
                            outcome.error ? outcome.error->text().c_str() : "(null)");
    return outcome.migrated;
}

std::uint64_t ZORClientConnection::discardAtBoot(const std::optional<FileURL>& url, const char* what,
                                                 std::optional<std::uint32_t> owner) {
    if (!url)
        return 0;
    const auto moved = _moveItemAtURLToDeathRow(*url, StartDeletionThread::no, owner);
    if (!moved)
        services_.log.write(logLevelError, rebootFunction, "Failed to delete %s URL %s : %s", what, url->c_str(),
                            moved.error().text().c_str());
    discardCopyLeftovers(url->deletingLastPathComponent());
    return moved ? 1 : 0;
}

void ZORClientConnection::discardCopyLeftovers(const FileURL& directory) {
    for (const FileURL& leftover : services_.fileManager.copyLeftoversInDirectoryAtURL(directory))
        (void)_moveItemAtURLToDeathRow(leftover, StartDeletionThread::no);
}

std::uint64_t ZORClientConnection::cleanUpUsers() {
    std::uint64_t removed = 0;
    for (std::uint32_t userId = services_.configuration.users().first; userId <= services_.configuration.users().last;
         ++userId) {
        ZORPerUserConfiguration* user = services_.configuration.getPerUserConfigurationForUserId(userId);
        if (!user || !user->existsUserBaseDirectory())
            continue;
        if (!services_.setup.goOn())
            break;
        removed += discardAtBoot(user->transientDirectory(), "per-user transient", userId);
        forEachClass(isUserClass, [&](ContainerClass containerClass) {
            removed += _cleanupOrphanedDataForUser(userId, containerClass);
        });
    }
    return removed;
}

ZORClientConnection::Orphan ZORClientConnection::orphanKind(int classDirectory, const FileURL& entry,
                                                            ContainerClass containerClass) {
    const std::string_view name = entry.lastPathComponent();
    switch (services_.whitelist.judgeName(name, containerClass)) {
    case ZORWhitelist::NameOf::noContainer:
        return Orphan::byName;
    case ZORWhitelist::NameOf::unknown:
        services_.log.write(logLevelError, "_cleanupOrphanedDataForUser",
                            "Leaving %s: the table of well-known containers, which may name it, could not be read",
                            entry.c_str());
        return Orphan::no;
    case ZORWhitelist::NameOf::container:
        break;
    }
    const std::string metadata = std::string(name) + "/" + names::metadataFile;
    return services_.fileManager.itemDoesNotExistBelow(classDirectory, metadata.c_str(), entry) ? Orphan::noMetadata
                                                                                                : Orphan::no;
}

void ZORClientConnection::reportOrphan(const FileURL& entry) {
    constexpr const char* function = "_cleanupOrphanedDataForUser";
    for (const char* line : orphanReportHead)
        services_.log.write(logLevelError, function, "%s", line);
    services_.fileManager.printDirectoryStructureAtURL(entry);
    services_.log.write(logLevelError, function, "%s", orphanReportEnd);
}

std::uint64_t ZORClientConnection::_cleanupOrphanedDataForUser(std::uint32_t userId, ContainerClass containerClass) {
    const auto directory = services_.configuration.openClassDirectory(userId, containerClass, false);
    // The content of another's directory there is no orphan; the getter has said so.
    if (!directory || !directory->opened)
        return 0;
    std::uint64_t removed = 0;
    std::vector<FileURL> batch;
    const auto listed = services_.fileManager.forEachItemInDirectoryAtURL(
        directory->url, ZORFileManager::Leftovers::hidden, [&](int, const FileURL& entry) {
            batch.push_back(entry);
            if (batch.size() == orphanBatchMax)
                removed += removeOrphans(directory->opened->get(), std::exchange(batch, {}), containerClass);
            return services_.setup.goOn();
        });
    if (!listed && !listed.error().isPosix(ENOENT))
        services_.log.write(logLevelError, __func__, "Failed to get items at %s : %s", directory->url.c_str(),
                            listed.error().text().c_str());
    if (!listed || services_.setup.stopped())
        return removed;
    removed += removeOrphans(directory->opened->get(), batch, containerClass);
    discardCopyLeftovers(directory->url);
    return removed;
}

std::uint64_t ZORClientConnection::removeOrphans(int classDirectory, const std::vector<FileURL>& entries,
                                                 ContainerClass containerClass) {
    constexpr const char* function = "_cleanupOrphanedDataForUser";
    std::vector<Orphan> kinds(entries.size());
    fs::forEachStretch(kinds.size(), [&](std::size_t begin, std::size_t end) {
        for (std::size_t i = begin; i < end; ++i)
            kinds[i] = orphanKind(classDirectory, entries[i], containerClass);
    });
    std::uint64_t removed = 0;
    for (std::size_t i = 0; i < kinds.size() && services_.setup.goOn(); ++i) {
        const FileURL& entry = entries[i];
        if (kinds[i] == Orphan::no)
            continue;
        if (kinds[i] == Orphan::noMetadata)
            services_.log.write(logLevelError, function, "Deleting orphaned data missing a metadata file at: %s",
                                entry.c_str());
        if (services_.internalBuild.isInternalBuild())
            reportOrphan(entry);
        // A failure has been logged where it happened; the next boot tries again.
        removed += _moveItemAtURLToDeathRow(entry, StartDeletionThread::no) ? 1 : 0;
    }
    return removed;
}

std::uint64_t ZORClientConnection::sweepStaging() {
    const FileURL staging = services_.configuration.stagingDirectory();
    const auto kept = stagedByJournals();
    if (!kept)
        return 0;
    std::uint64_t swept = 0;
    const auto listed = services_.fileManager.forEachItemInDirectoryAtURL(
        staging, ZORFileManager::Leftovers::shown, [&](int, const FileURL& entry) {
            if (!kept->contains(entry.lastPathComponent()))
                swept += _moveItemAtURLToDeathRow(entry, StartDeletionThread::no) ? 1 : 0;
            return services_.setup.goOn();
        });
    if (!listed && !listed.error().isPosix(ENOENT))
        services_.log.write(logLevelError, launchFunction, "Failed to get items at staging URL%s : %s", staging.c_str(),
                            listed.error().text().c_str());
    return swept;
}

std::optional<std::set<std::string, std::less<>>> ZORClientConnection::stagedByJournals() {
    std::set<std::string, std::less<>> names;
    const auto items = services_.fileManager.urlsForItemsInDirectoryAtURL(services_.configuration.replaceDirectory());
    if (!items && !items.error().isPosix(ENOENT))
        return std::nullopt;
    // There are some only when the recovery stopped, perhaps because they could not be read: their names tell.
    for (const FileURL& item : items.value_or(std::vector<FileURL>()))
        names.emplace(ReplaceJournal::stagingNameFor(item));
    return names;
}

std::size_t ZORClientConnection::journalCount() {
    const auto items = services_.fileManager.urlsForItemsInDirectoryAtURL(services_.configuration.replaceDirectory());
    return items ? items->size() : 0;
}

bool ZORClientConnection::showsContainers(std::uint32_t userId) {
    UserHome* const home = services_.configuration.homeOf(userId);
    if (!home)
        return true;
    const auto seen = home->look();
    if (seen.state == UserHome::State::noAccount)
        return true;
    return seen.directory && services_.fileManager.itemExistsAtURL(StorePlaces::userBaseDirectory(*seen.directory));
}

void ZORClientConnection::makeDirectoriesDurable() {
    const FileURL library = services_.configuration.libraryDirectory();
    const auto directory = services_.fileManager.resolver().openDirectory(library);
    const int status = directory ? services_.durability.afterMove(directory->get()) : -directory.error();
    if (status < 0)
        services_.log.write(logLevelError, launchFunction, "sync of %s failed: %s", library.c_str(),
                            errorText(-status));
}

void ZORClientConnection::containerManagerSetup() {
    SetupReport& report = services_.setup;
    services_.configuration.fenceHomes();
    report.run("replace recovery", [this] {
        const std::size_t journals = journalCount();
        if (!_recoverFromReplaceOperationsWithError())
            services_.log.write(logLevelError, launchFunction, "Failed recovering from replace operations");
        return static_cast<std::uint64_t>(journals - std::min(journals, journalCount()));
    });
    report.run("staging sweep", [this] { return sweepStaging(); });
    if (report.stopped())
        return;
    deleteContainersOnDeathRowWithCompletion(nullptr);
    // A stop between the move of a container and its mapping leaves a mapping that points to nothing.
    report.run("dangling mappings", [this] {
        const unsigned removed = services_.sandbox.removeDanglingMappings(
            [this](std::uint32_t userId) { return showsContainers(userId); },
            [this](const std::string& path) { return services_.fileManager.itemIsGone(FileURL::directory(path)); });
        if (removed != 0)
            services_.log.write(logLevelNotice, launchFunction, "Removed %u sandbox mappings whose container is gone",
                                removed);
        return std::uint64_t{removed};
    });
    // Files that are acknowledged one by one later lie in directories that must not go with the power.
    makeDirectoriesDurable();
    // What the boot's passes read is older than what they cleaned up afterwards.
    services_.cache.dropAll();
}

} // namespace zor
