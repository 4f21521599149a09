// SPDX-License-Identifier: Apache-2.0
#include "operations/Setup.h"

#include "base/ContainerClass.h"
#include "fs/Names.h"
#include "fs/SharedWork.h"
#include "ipc/Identifiers.h"
#include "ipc/Protocol.h"
#include "store/StorePlaces.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <string>
#include <utility>
#include <vector>

namespace zor {

namespace {

constexpr const char* migrateFunction = "migrateAppGroupIdsFromDataContainersToFile";
constexpr const char* reconcileFunction = "reconcileSystemContainers";

constexpr std::array formerGroupHolders = {ContainerClass::dataApplication, ContainerClass::dataKolvexPlugin,
                                           ContainerClass::dataVPNPlugin};

/// One with an account whose home is not there, or cannot be looked for.
std::optional<std::uint32_t> userWithoutHome(const ZORGlobalConfiguration& configuration) {
    for (std::uint32_t userId = configuration.users().first; userId <= configuration.users().last; ++userId) {
        const auto state = configuration.homeOf(userId)->look().state;
        if (state == UserHome::State::missing || state == UserHome::State::unknown)
            return userId;
    }
    return std::nullopt;
}

const plist::Value* groupIdentifiersIn(const ZORMetadata& container) {
    return container.info() ? container.info()->find(ipc::infoKeys::groupContainerIds) : nullptr;
}

} // namespace

std::uint64_t FirstBootPasses::migrateAppGroupIdsFromDataContainersToFile() {
    if (!needs_.markers.isDue(names::groupIdMigrationMarker))
        return 0;
    needs_.log.write(logLevelNotice, migrateFunction, "Performing group ID migration");
    std::vector<ZORContainerCache::Record> containers;
    for (const ContainerClass containerClass : formerGroupHolders) {
        const auto records =
            needs_.cache.allContainersForUser(needs_.configuration.users().first, containerClass, false);
        if (!records) {
            needs_.log.write(
                logLevelError, migrateFunction, "Failed to fetch list of containers for userId: %u, class %ld : %s",
                needs_.configuration.users().first, static_cast<long>(containerClass), records.error().text().c_str());
            return 0;
        }
        containers.insert(containers.end(), records->begin(), records->end());
    }
    needs_.log.write(logLevelNotice, migrateFunction, "We have %ld potential data containers to migrate",
                     static_cast<long>(containers.size()));
    int errors = 0;
    std::uint64_t migrated = 0;
    for (const auto& container : containers) {
        if (!needs_.report.goOn()) {
            ++errors; // no marker
            break;
        }
        if (!groupIdentifiersIn(*container) || entitlementMapKeys::isOne(container->identifier()))
            continue;
        if (migrateGroupIdentifiers(*container))
            ++migrated;
        else
            ++errors;
    }
    if (errors != 0)
        needs_.log.write(logLevelError, migrateFunction,
                         "Not writing the migration complete file because there we had %d error(s)", errors);
    else if (const auto absent = userWithoutHome(needs_.configuration))
        needs_.log.write(logLevelError, migrateFunction,
                         "Not writing the migration complete file: the home of user %u is not there", *absent);
    else
        needs_.markers.writeMigrationFileToDiskWithName(names::groupIdMigrationMarker);
    needs_.entitlements.setGroupIdsMigrated(errors == 0);
    return migrated;
}

bool FirstBootPasses::migrateGroupIdentifiers(const ZORMetadata& container) {
    const Reporter report(needs_.log, migrateFunction);
    const std::string& identifier = container.identifier();
    const plist::Value groups = *groupIdentifiersIn(container);
    const plist::Dictionary migrated{{std::string(entitlementKeys::applicationGroups), groups}};
    ZOR_LOG(needs_.log, logLevelDebug, "Data container for userId: %u, identifier %s references container IDs: %s",
            needs_.configuration.users().first, ZOR_SHOWN(identifier), plist::describe(&groups).c_str());
    // A client that registered meanwhile did so under this system: what it said stays, and the older list is added.
    const auto stored = needs_.entitlements.uniteEntitlements(identifier, migrated);
    if (!stored) {
        report.write(logLevelError, "Failed to write group id entitlements for %s to file : %s", ZOR_SHOWN(identifier),
                     stored.error().text().c_str());
        return false;
    }
    const std::string path = container.url().path();
    const std::string key(ipc::infoKeys::groupContainerIds);
    const auto cleared = needs_.infoValues.setInfoValue(Caller::daemonItself(), nullptr, &key,
                                                        {.userId = needs_.configuration.users().first,
                                                         .uuid = container.uuid(),
                                                         .identifier = identifier,
                                                         .containerClass = container.containerClass()});
    if (!cleared)
        report.write(logLevelError, "Failed to clear group id metadata for %s at %s : %llu", ZOR_SHOWN(identifier),
                     path.c_str(), static_cast<unsigned long long>(cleared.error().replyCode()));
    return cleared.has_value();
}

std::optional<std::set<std::string, std::less<>>> FirstBootPasses::ownersOfSystemContainers() {
    // An identifier that was lost with the file is not known to be unentitled.
    if (const auto lost = needs_.entitlements.lostFile()) {
        const ZORError error = posixError({reconcileFunction, __LINE__}, Errno(EIO),
                                          "the entitlement file could not be read and lies at %s", lost->c_str());
        needs_.log.write(logLevelError, reconcileFunction, "Failed to fetch system container list: %s",
                         error.text().c_str());
        return std::nullopt;
    }
    std::set<std::string, std::less<>> owners;
    const plist::Dictionary map = needs_.entitlements.entitlementMappingDict();
    for (const auto& [identifier, entitlements] : map) {
        if (!needs_.entitlements.identifierHasSystemContainer(identifier))
            continue;
        ZOR_LOG(needs_.log, logLevelDebug, "System container exists for identifier %s", ZOR_SHOWN(identifier));
        owners.insert(identifier);
    }
    return owners;
}

std::uint64_t FirstBootPasses::reconcileSystemContainers() {
    const auto owners = ownersOfSystemContainers();
    if (!owners)
        return 0;
    const auto containers =
        needs_.cache.allContainersForUser(needs_.configuration.users().system, ContainerClass::dataSystem, false);
    if (!containers) {
        needs_.log.write(logLevelError, reconcileFunction, "Failed to fetch system container list: %s",
                         containers.error().text().c_str());
        return 0;
    }
    std::uint64_t removed = 0;
    for (const auto& container : *containers) {
        if (!needs_.report.goOn())
            break;
        const std::string& identifier = container->identifier();
        if (owners->contains(identifier))
            continue;
        needs_.log.write(logLevelError, reconcileFunction, "Removing system container with identifier %s",
                         ZOR_SHOWN(identifier));
        const auto staged = needs_.removal.stage({.userId = needs_.configuration.users().system,
                                                  .uuid = container->uuid(),
                                                  .identifier = identifier,
                                                  .containerClass = ContainerClass::dataSystem});
        if (staged)
            ++removed;
        else
            needs_.log.write(logLevelError, reconcileFunction,
                             "Failed to destroy system container with identifier %s: %llu", ZOR_SHOWN(identifier),
                             static_cast<unsigned long long>(staged.error().replyCode()));
    }
    return removed;
}

namespace {

constexpr const char* cleanUpFunction = "_cleanupOrphanedDataForUser";
constexpr std::array orphanReportHead = {
    "***INTERNAL BUILD REQUEST: If you see this, file a Tracklet in \"Zorvane | all\" with the following data:",
    "\tSomeone is writing invalid data to a container, which has now been orphaned. Here are the invalid files:",
};
constexpr const char* orphanReportEnd = "***END INTERNAL BUILD REQUEST";
/// So many entries of a class directory are judged at once: enough for several threads, little enough for any memory.
constexpr std::size_t orphanBatchMax = 4096;

} // namespace

OrphanCleanUp::Orphan OrphanCleanUp::orphanKind(int classDirectory, const FileURL& entry,
                                                ContainerClass containerClass) {
    const std::string_view name = entry.lastPathComponent();
    switch (needs_.whitelist.judgeName(name, containerClass)) {
    case ZORWhitelist::NameOf::noContainer:
        return Orphan::byName;
    case ZORWhitelist::NameOf::unknown:
        needs_.log.write(logLevelError, cleanUpFunction,
                         "Leaving %s: the table of well-known containers, which may name it, could not be read",
                         entry.c_str());
        return Orphan::no;
    case ZORWhitelist::NameOf::container:
        break;
    }
    const std::string metadata = std::string(name) + "/" + names::metadataFile;
    return needs_.fileManager.itemDoesNotExistBelow(classDirectory, metadata.c_str(), entry) ? Orphan::noMetadata
                                                                                             : Orphan::no;
}

void OrphanCleanUp::reportOrphan(const FileURL& entry) {
    const Reporter report(needs_.log, cleanUpFunction);
    for (const char* line : orphanReportHead)
        report.write(logLevelError, "%s", line);
    needs_.fileManager.printDirectoryStructureAtURL(entry);
    report.write(logLevelError, "%s", orphanReportEnd);
}

std::uint64_t OrphanCleanUp::_cleanupOrphanedDataForUser(std::uint32_t userId, ContainerClass containerClass) {
    const auto directory = needs_.configuration.openClassDirectory(userId, containerClass, false);
    // The content of another's directory there is no orphan; the getter has said so.
    if (!directory || !directory->opened)
        return 0;
    const auto owner = topLevelOwnerOf(containerClass, userId);
    std::uint64_t removed = 0;
    std::vector<FileURL> batch;
    std::vector<FileURL> leftovers;
    const auto listed = needs_.fileManager.forEachItemInDirectoryAtURL(
        directory->url, ZORFileManager::Leftovers::shown, [&](int, const FileURL& entry) {
            (fs::isCopyLeftover(entry.lastPathComponent()) ? leftovers : batch).push_back(entry);
            if (batch.size() == orphanBatchMax)
                removed += removeOrphans(directory->opened->get(), std::exchange(batch, {}), containerClass, owner);
            return needs_.report.goOn();
        });
    if (!listed && !listed.error().isPosix(ENOENT))
        needs_.log.write(logLevelError, __func__, "Failed to get items at %s : %s", directory->url.c_str(),
                         listed.error().text().c_str());
    if (!listed || needs_.report.stopped())
        return removed;
    removed += removeOrphans(directory->opened->get(), batch, containerClass, owner);
    discard(leftovers, owner);
    return removed;
}

std::uint64_t OrphanCleanUp::removeOrphans(int classDirectory, const std::vector<FileURL>& entries,
                                           ContainerClass containerClass, std::optional<std::uint32_t> owner) {
    std::vector<Orphan> kinds(entries.size());
    fs::forEachStretch(kinds.size(), [&](std::size_t begin, std::size_t end) {
        for (std::size_t i = begin; i < end; ++i)
            kinds[i] = orphanKind(classDirectory, entries[i], containerClass);
    });
    std::uint64_t removed = 0;
    for (std::size_t i = 0; i < kinds.size() && needs_.report.goOn(); ++i) {
        const FileURL& entry = entries[i];
        if (kinds[i] == Orphan::no)
            continue;
        if (kinds[i] == Orphan::noMetadata)
            needs_.log.write(logLevelError, cleanUpFunction, "Deleting orphaned data missing a metadata file at: %s",
                             entry.c_str());
        if (needs_.internalBuild.isInternalBuild())
            reportOrphan(entry);
        // A failure has been logged where it happened; the next boot tries again.
        removed += needs_.deathRow._moveItemAtURLToDeathRow(entry, StartDeletionThread::no, owner) ? 1 : 0;
    }
    return removed;
}

void OrphanCleanUp::discardCopyLeftovers(const FileURL& directory) {
    discard(needs_.fileManager.copyLeftoversInDirectoryAtURL(directory), std::nullopt);
}

void OrphanCleanUp::discard(const std::vector<FileURL>& leftovers, std::optional<std::uint32_t> owner) {
    for (const FileURL& leftover : leftovers)
        (void)needs_.deathRow._moveItemAtURLToDeathRow(leftover, StartDeletionThread::no, owner);
}

namespace {

constexpr const char* launchFunction = "containerManagerSetup";
constexpr const char* rebootFunction = "rebootContainerManagerSetup";

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

void Setup::rebootContainerManagerSetup() {
    SetupReport& report = needs_.report;
    needs_.configuration.fenceHomes();
    report.run("bundle migration", [this] { return migrateBundles(); });
    report.run("well-known migration", [this] { return migrateWellknown(); });
    report.run("shared transient containers", [this] {
        std::uint64_t moved =
            discardAtBoot(needs_.configuration.transientDirectory(), "shared transient", std::nullopt);
        moved += discardAtBoot(needs_.configuration.transientBundleDirectory(), "shared transient bundle",
                               needs_.configuration.users().installer);
        return moved;
    });
    report.run("group identifiers of data containers",
               [this] { return needs_.entitlementPasses.migrateAppGroupIdsFromDataContainersToFile(); });
    report.run("system containers", [this] { return needs_.entitlementPasses.reconcileSystemContainers(); });
    report.run("system groups", [this] { return needs_.groups.reconcileGroupContainersOfType(GroupType::system); });
    report.run("application groups",
               [this] { return needs_.groups.reconcileGroupContainersOfType(GroupType::application); });
    report.run("orphans of users", [this] { return cleanUpUsers(); });
    report.run("orphans of the system", [this] { return cleanUpSystem(); });
}

std::uint64_t Setup::migrateBundles() {
    const auto outcome = needs_.migrator.performMigrationWithError();
    if (!outcome.succeeded)
        needs_.log.write(logLevelError, rebootFunction, "Failed to migrate bundle containers to system location : %s",
                         outcome.error ? outcome.error->text().c_str() : "(null)");
    // The places where the migrator's moves hide what they copy: beside either location, and beside class directories.
    needs_.orphans.discardCopyLeftovers(needs_.configuration.formerBundleDirectory().deletingLastPathComponent());
    needs_.orphans.discardCopyLeftovers(needs_.configuration.sharedContainersDirectory());
    needs_.orphans.discardCopyLeftovers(needs_.configuration.bundleDirectory());
    return outcome.migrated;
}

std::uint64_t Setup::migrateWellknown() {
    const auto outcome = needs_.migrator.performWhitelistMigrationWithError();
    if (!outcome.succeeded)
        needs_.log.write(logLevelError, rebootFunction, "Failed to migrate whitelisted bundle containers : %s",
                         outcome.error ? outcome.error->text().c_str() : "(null)");
    return outcome.migrated;
}

std::uint64_t Setup::discardAtBoot(const std::optional<FileURL>& url, const char* what,
                                   std::optional<std::uint32_t> owner) {
    if (!url)
        return 0;
    const auto moved = needs_.deathRow._moveItemAtURLToDeathRow(*url, StartDeletionThread::no, owner);
    if (!moved)
        needs_.log.write(logLevelError, rebootFunction, "Failed to delete %s URL %s : %s", what, url->c_str(),
                         moved.error().text().c_str());
    needs_.orphans.discardCopyLeftovers(url->deletingLastPathComponent());
    return moved ? 1 : 0;
}

std::uint64_t Setup::cleanUpUsers() {
    std::uint64_t removed = 0;
    for (std::uint32_t userId = needs_.configuration.users().first; userId <= needs_.configuration.users().last;
         ++userId) {
        ZORPerUserConfiguration* user = needs_.configuration.getPerUserConfigurationForUserId(userId);
        if (!user || !user->existsUserBaseDirectory())
            continue;
        if (!needs_.report.goOn())
            break;
        removed += discardAtBoot(user->transientDirectory(), "per-user transient", userId);
        forEachClass(isUserClass, [&](ContainerClass containerClass) {
            removed += needs_.orphans._cleanupOrphanedDataForUser(userId, containerClass);
        });
    }
    return removed;
}

std::uint64_t Setup::cleanUpSystem() {
    std::uint64_t removed = 0;
    forEachClass(isSharedClass, [&](ContainerClass containerClass) {
        removed += needs_.orphans._cleanupOrphanedDataForUser(isBundleClass(containerClass)
                                                                  ? needs_.configuration.users().installer
                                                                  : needs_.configuration.users().system,
                                                              containerClass);
    });
    return removed;
}

std::uint64_t Setup::sweepStaging() {
    const FileURL staging = needs_.configuration.stagingDirectory();
    const auto kept = needs_.recovery.stagedByJournals();
    if (!kept)
        return 0;
    std::uint64_t swept = 0;
    const auto listed = needs_.fileManager.forEachItemInDirectoryAtURL(
        staging, ZORFileManager::Leftovers::shown, [&](int, const FileURL& entry) {
            if (!kept->contains(entry.lastPathComponent()))
                swept += needs_.deathRow._moveItemAtURLToDeathRow(entry, StartDeletionThread::no) ? 1 : 0;
            return needs_.report.goOn();
        });
    if (!listed && !listed.error().isPosix(ENOENT))
        needs_.log.write(logLevelError, launchFunction, "Failed to get items at staging URL%s : %s", staging.c_str(),
                         listed.error().text().c_str());
    return swept + needs_.recovery.sweepAside(*kept);
}

bool Setup::showsContainers(std::uint32_t userId) {
    UserHome* const home = needs_.configuration.homeOf(userId);
    if (!home)
        return true;
    const auto seen = home->look();
    if (seen.state == UserHome::State::noAccount)
        return true;
    return seen.directory && needs_.fileManager.itemExistsAtURL(StorePlaces::userBaseDirectory(*seen.directory));
}

void Setup::makeDirectoriesDurable() {
    if (const auto failed = needs_.moves.syncDirectories({needs_.configuration.libraryDirectory()}))
        needs_.log.write(logLevelError, launchFunction, "%s", failed->description().value_or("").c_str());
}

std::uint64_t Setup::recoverReplaces() {
    const std::size_t journals = needs_.recovery.journalCount();
    if (!needs_.recovery._recoverFromReplaceOperationsWithError())
        needs_.log.write(logLevelError, launchFunction, "Failed recovering from replace operations");
    return journals - std::min(journals, needs_.recovery.journalCount());
}

std::uint64_t Setup::removeDanglingMappings() {
    // A stop between the move of a container and its mapping leaves a mapping that points to nothing.
    const unsigned removed = needs_.sandbox.removeDanglingMappings(
        [this](std::uint32_t userId) { return showsContainers(userId); },
        [this](const std::string& path) { return needs_.fileManager.itemIsGone(FileURL::directory(path)); });
    if (removed != 0)
        needs_.log.write(logLevelNotice, launchFunction, "Removed %u sandbox mappings whose container is gone",
                         removed);
    return removed;
}

void Setup::containerManagerSetup() {
    SetupReport& report = needs_.report;
    needs_.configuration.fenceHomes();
    report.run("replace recovery", [this] { return recoverReplaces(); });
    report.run("staging sweep", [this] { return sweepStaging(); });
    if (report.stopped())
        return;
    needs_.deathRow.deleteContainersOnDeathRowWithCompletion(nullptr);
    report.run("dangling mappings", [this] { return removeDanglingMappings(); });
    // Files that are acknowledged one by one later lie in directories that must not go with the power.
    makeDirectoriesDurable();
    // The records that the boot's passes read are older than their clean-up.
    needs_.cache.dropAll();
}

} // namespace zor
