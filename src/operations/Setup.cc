// SPDX-License-Identifier: Apache-2.0
#include "operations/Setup.h"

#include "base/ContainerClass.h"
#include "ipc/Identifiers.h"
#include "ipc/Protocol.h"

#include <algorithm>
#include <cerrno>

namespace zor {

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
