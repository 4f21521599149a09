// SPDX-License-Identifier: Apache-2.0
#include "operations/ZORContainerMigrator.h"

#include "base/ContainerClass.h"
#include "fs/PathResolver.h"
#include "store/StorePlaces.h"

#include <algorithm>
#include <array>
#include <cerrno>

namespace zor {

namespace {

constexpr const char* whitelistOperation = "-[ZORContainerMigrator performWhitelistMigrationWithError:]";
constexpr const char* migrationFunction = "performMigrationWithError";
constexpr const char* whitelistFunction = "performWhitelistMigrationWithError";

constexpr std::array bundleClasses = {ContainerClass::bundleApplication, ContainerClass::bundleKolvexPlugin,
                                      ContainerClass::bundleVPNPlugin, ContainerClass::bundleFramework};

/// Whether a listing failed because a link, or a file, is on the way or in the directory's place.
bool isMisshapen(const ZORError& error) {
    return error.isPosix(ELOOP) || error.isPosix(ENOTDIR);
}

/// Whether a container was not looked at, or not written, rather than judged not to be a bundle's.
bool isUnfinished(const ZORError& error) {
    const ZORError* const cause = error.underlying();
    return error.is(ErrorCode::propertyListNotWritten) ||
           (cause && (cause->isOwnShortage() || cause->isPosix(EIO) || cause->isPosix(ENOKEY)));
}

long long code(const ZORError& error) {
    return error.code();
}

} // namespace

// The bundles of an older system.

ZORContainerMigrator::Outcome ZORContainerMigrator::performMigrationWithError() {
    const Log& log = needs_.log;
    const FileURL former = needs_.configuration.formerBundleDirectory();
    const FileURL bundles = needs_.configuration.bundleDirectory();
    if (!needs_.markers.isDue(names::bundleMigrationMarker))
        return {};
    if (auto hidden = cannotLook(former))
        return {.succeeded = false, .error = std::move(hidden)};
    if (mayHoldBundles(former)) {
        log.write(logLevelNotice, migrationFunction, "Moving bundle containers from user to system location");
        if (auto moved = moveFormerBundles(former, bundles); !moved) {
            log.write(logLevelError, migrationFunction,
                      "Failed to migrate to new bundle containers location : %s.  This is terrible.",
                      moved.error().text().c_str());
            return {.succeeded = false, .error = std::move(moved).error()};
        }
    }
    Count count;
    for (const ContainerClass containerClass : bundleClasses)
        adoptBundlesOfClass(containerClass, count);
    log.write(logLevelNotice, migrationFunction, "Changing ownership of bundle container content. %llu errors so far",
              static_cast<unsigned long long>(count.errors));
    auto owned = needs_.fileManager.standardizeOwnershipAtURL(
        bundles, needs_.configuration.users().installer, needs_.configuration.users().installer,
        needs_.configuration.users().first, needs_.report.check());
    if (owned)
        if (const Errno failure = needs_.moves.orderBetween(bundles, needs_.configuration.libraryDirectory()))
            owned = posixError({migrationFunction, __LINE__}, failure, "sync of %s failed: %s", bundles.c_str(),
                               failure.text());
    if (!owned)
        return {.succeeded = false,
                .error = Reporter(log, migrationFunction)
                             .error(ErrorCode::ownerNotChanged, &owned.error(), "Failed to change owner of %s: %s",
                                    bundles.c_str(), owned.error().text().c_str()),
                .migrated = count.migrated};
    if (count.unfinished != 0) {
        log.write(
            logLevelError, migrationFunction,
            "Not writing the marker file: %llu bundle containers or their places could not be read or written; the "
            "next boot tries again",
            static_cast<unsigned long long>(count.unfinished));
        return {.succeeded = true, .error = std::move(count.last), .migrated = count.migrated};
    }
    log.write(logLevelNotice, migrationFunction, "Successful bundle migration. Writing marker file.");
    needs_.markers.writeMigrationFileToDiskWithName(names::bundleMigrationMarker);
    return {.succeeded = true, .error = std::move(count.last), .migrated = count.migrated};
}

std::optional<ZORError> ZORContainerMigrator::cannotLook(const FileURL& former) {
    struct stat status{};
    const fs::PathResolver& resolver = needs_.fileManager.resolver();
    if (resolver.status(former, status) != ENOENT)
        return std::nullopt;
    const auto hider = fs::hiddenBy(resolver, needs_.fileManager.disk(), former);
    if (hider)
        return posixError({migrationFunction, __LINE__}, Errno(ENOKEY),
                          "An encryption whose key is away hides what is in %s", hider->c_str());
    if (needs_.configuration.homeOf(needs_.configuration.users().first)->look().state == UserHome::State::missing)
        return posixError({migrationFunction, __LINE__}, Errno(ENOENT), "The home of user %u is not there",
                          needs_.configuration.users().first);
    return std::nullopt;
}

bool ZORContainerMigrator::mayHoldBundles(const FileURL& former) {
    // Another's directory that its owner named so holds none.
    if (const auto judged = needs_.fileManager.openDirectoryOf(needs_.configuration.users().first, former);
        !judged && judged.error().isPosix(EPERM)) {
        needs_.log.write(logLevelError, migrationFunction, "%s", judged.error().text().c_str());
        return false;
    }
    if (needs_.fileManager.itemExistsAtURL(former))
        return true;
    // A directory that cannot be examined counts as there: its move fails, no marker is written, and the next boot
    // tries again. A link on the way is the doing of the user who owned the place, and would keep failing.
    struct stat status{};
    const Errno failure = needs_.fileManager.resolver().status(former, status);
    return failure != ENOENT && failure != ELOOP && failure != ENOTDIR;
}

Result<void> ZORContainerMigrator::moveFormerBundles(const FileURL& former, const FileURL& bundles) {
    const auto present = TRY(needs_.fileManager.urlsForItemsInDirectoryAtURL(bundles));
    // Something lies there already: an earlier migration was cut short, or containers were made before this one. Or
    // what would come along is not all of the old owner's.
    if (!present.empty() || holdsOfOthers(former))
        return moveEachFormerBundle(former);
    return needs_.fileManager.moveItemAtURL(former, bundles, needs_.report.check());
}

bool ZORContainerMigrator::isOfAnother(const FileURL& directory) {
    const auto judged = needs_.fileManager.openDirectoryOf(needs_.configuration.users().first, directory);
    return !judged && judged.error().isPosix(EPERM);
}

bool ZORContainerMigrator::holdsOfOthers(const FileURL& former) {
    const auto items = needs_.fileManager.urlsForItemsInDirectoryAtURL(former);
    if (items && std::ranges::any_of(*items, [this](const FileURL& item) { return isOfAnother(item); }))
        return true;
    return std::ranges::any_of(bundleClasses, [this](ContainerClass containerClass) {
        const auto containers =
            needs_.fileManager.urlsForItemsInDirectoryAtURL(needs_.configuration.formerBundleDirectory(containerClass));
        return containers &&
               std::ranges::any_of(*containers, [this](const FileURL& container) { return isOfAnother(container); });
    });
}

Result<void> ZORContainerMigrator::moveEachFormerBundle(const FileURL& former) {
    std::optional<ZORError> failure;
    for (const ContainerClass containerClass : bundleClasses) {
        const FileURL source = needs_.configuration.formerBundleDirectory(containerClass);
        if (isOfAnother(source))
            continue;
        const auto containers = needs_.fileManager.urlsForItemsInDirectoryAtURL(source);
        // A link or file that the user put in a directory's place holds no containers; it goes with what is left.
        if (!containers && (containers.error().isPosix(ENOENT) || isMisshapen(containers.error())))
            continue;
        if (!containers) {
            failure = containers.error();
            continue;
        }
        const auto target = needs_.configuration.containerDirectoryURLForUser(needs_.configuration.users().installer,
                                                                              containerClass, false);
        for (const FileURL& container : *containers)
            if (!needs_.report.goOn())
                return posixError({migrationFunction, __LINE__}, Errno(ECANCELED), "The daemon was told to end");
            else if (isOfAnother(container))
                continue;
            else if (auto moved =
                         moveFormerBundle(container, target->appendingDirectory(container.lastPathComponent()));
                     !moved)
                failure = std::move(moved).error();
    }
    if (failure)
        return *failure;
    if (holdsOfOthers(former)) {
        needs_.log.write(logLevelError, migrationFunction,
                         "%s stays: something in it belongs to others than user %u; move that away, and remove it",
                         former.c_str(), needs_.configuration.users().first);
        return {};
    }
    // The rest is directories that held containers, and items that never were containers: in nobody's way.
    return needs_.deathRow._moveItemAtURLToDeathRow(former, StartDeletionThread::no);
}

Result<void> ZORContainerMigrator::moveFormerBundle(const FileURL& container, const FileURL& target) {
    // One that lies in both places was copied from another file system, and the stop came before its source went.
    if (needs_.fileManager.itemExistsAtURL(target))
        return needs_.deathRow._moveItemAtURLToDeathRow(container, StartDeletionThread::no);
    ZORFileManager& fileManager = needs_.fileManager;
    const FileURL place = target.deletingLastPathComponent();
    const auto from = fileManager.resolver().openParent(container);
    if (!from)
        return posixError({migrationFunction, __LINE__}, from.error(), "rename of %s to %s failed: %s",
                          container.c_str(), target.c_str(), from.error().text());
    // The old owner's until the end of a migration that was cut short.
    auto to = fileManager.openDirectoryOf(needs_.configuration.users().first, place);
    if (!to)
        to = fileManager.openDirectoryOf(needs_.configuration.users().installer, place);
    if (!to)
        return std::move(to).error();
    TRY(fileManager.moveItem(from->directory.get(), container, to->get(), target, needs_.report.check()));
    return {};
}

void ZORContainerMigrator::adoptBundlesOfClass(ContainerClass containerClass, Count& count) {
    const FileURL directory =
        needs_.configuration.sharedContainersDirectory().appendingDirectory(className(containerClass));
    const auto containers = needs_.fileManager.urlsForItemsInDirectoryAtURL(directory);
    if (!containers) {
        if (!containers.error().isPosix(ENOENT)) {
            needs_.log.write(logLevelError, migrationFunction, "Failed to get items at staging URL%s : %s",
                             directory.c_str(), containers.error().text().c_str());
            count.unfinished += isMisshapen(containers.error()) ? 0 : 1;
        }
        // The user who owned the old place may have put anything there; a link in a class directory's place would keep
        // the class from ever having one.
        if (isMisshapen(containers.error()))
            (void)needs_.deathRow._moveItemAtURLToDeathRow(directory, StartDeletionThread::no);
        return;
    }
    for (const FileURL& container : *containers) {
        if (!needs_.report.goOn()) {
            ++count.unfinished;
            return;
        }
        if (auto adopted = adoptBundle(container); adopted) {
            ++count.migrated;
        } else {
            ++count.errors;
            count.unfinished += isUnfinished(adopted.error()) ? 1 : 0;
            count.last = std::move(adopted).error();
        }
    }
}

Result<void> ZORContainerMigrator::adoptBundle(const FileURL& container) {
    const Log& log = needs_.log;
    const Reporter report(log, migrationFunction);
    // Its owner was the mobile user, and so, perhaps, was its metadata file's.
    const auto read =
        readAndValidateMetadataAtUrl(log, needs_.fileManager, container, needs_.configuration.users().first,
                                     CheckClassPath::yes, needs_.configuration.users().first);
    if (!read) {
        report.write(logLevelError, "Failed to read metadata at URL %s : %s", container.c_str(),
                     read.error().text().c_str());
        return read.error();
    }
    const auto& record = *read;
    record->setUid(needs_.configuration.users().installer);
    const auto written = record->writeMetadataToDiskWithError(log, needs_.fileManager);
    if (!written)
        return report.error(ErrorCode::propertyListNotWritten, &written.error(),
                            "Failed to write metadata for %u : %s, url: %s", needs_.configuration.users().installer,
                            ZOR_SHOWN(record->identifier()), container.c_str());
    const auto added =
        needs_.cache.addContainerMetadata(record, needs_.configuration.users().installer, record->place(), false);
    if (!added)
        return report.error(ErrorCode::cacheAddFailed, &added.error(), "Failed to add to cache for %u : %s, url: %s",
                            needs_.configuration.users().installer, ZOR_SHOWN(record->identifier()), container.c_str());
    return {};
}

// Well-known containers.

ZORContainerMigrator::Outcome ZORContainerMigrator::performWhitelistMigrationWithError() {
    Outcome outcome;
    for (const ContainerClass containerClass : {ContainerClass::dataSystem, ContainerClass::sharedSystemGroup})
        if (!migrateWellknownOfClass(containerClass, outcome))
            break;
    return outcome;
}

bool ZORContainerMigrator::migrateWellknownOfClass(ContainerClass containerClass, Outcome& outcome) {
    if (!needs_.whitelist.isWhole(containerClass)) {
        needs_.log.write(logLevelError, whitelistFunction,
                         "Not migrating to well-known names in %s: their table could not be read",
                         className(containerClass));
        return true;
    }
    const auto classDirectory =
        needs_.configuration.containerDirectoryURLForUser(needs_.configuration.users().system, containerClass, false);
    const auto records = needs_.cache.allContainersForUser(needs_.configuration.users().system, containerClass, false);
    if (!records) {
        needs_.log.write(logLevelError, whitelistFunction,
                         "Failed to get list of system containers for migration: (error= %s : %lld)",
                         records.error().domainName(), code(records.error()));
        outcome.succeeded = false;
        outcome.error = records.error();
        return false;
    }
    for (const auto& record : *records) {
        if (!needs_.report.goOn())
            return false;
        auto migrated = migrateWellknown(record, containerClass, *classDirectory);
        if (!migrated) {
            outcome.succeeded = false;
            outcome.error = std::move(migrated).error();
            return false;
        }
        outcome.migrated += *migrated ? 1 : 0;
    }
    return true;
}

Result<bool> ZORContainerMigrator::migrateWellknown(const std::shared_ptr<ZORMetadata>& record,
                                                    ContainerClass containerClass, const FileURL& classDirectory) {
    const Reporter report(needs_.log, whitelistFunction);
    const std::string& identifier = record->identifier();
    if (identifier.empty() || !record->hasUrl() || !needs_.whitelist.containerIdIsWellknown(identifier, containerClass))
        return false;
    const FileURL target =
        classDirectory.appendingDirectory(*needs_.whitelist.wellknownContainerForId(identifier, containerClass));
    const FileURL former = record->url();
    if (former == target)
        return false;
    report.write(logLevelError, "Migrating well-known container %s", ZOR_SHOWN(identifier));
    auto removed =
        needs_.cache.removeContainerForUser(needs_.configuration.users().system, containerClass, &identifier, false);
    if (!removed) {
        report.write(logLevelError, "%s: Failed to remove cache for whitelisted container %s: (error= %s: %lld)",
                     whitelistOperation, ZOR_SHOWN(identifier), removed.error().domainName(), code(removed.error()));
        return std::move(removed).error();
    }
    auto moved = [&]() -> Result<void> {
        const auto directory = TRY(needs_.fileManager.openDirectoryOf(ownerUnchanged, classDirectory));
        TRY(needs_.fileManager.moveItem(directory.get(), former, directory.get(), target));
        return {};
    }();
    if (!moved) {
        report.write(logLevelError,
                     "%s: Failed to move system container %s from %s to whitelisted location %s: (error= %s: %lld)",
                     whitelistOperation, ZOR_SHOWN(identifier), former.c_str(), target.c_str(),
                     moved.error().domainName(), code(moved.error()));
        return std::move(moved).error();
    }
    auto added =
        needs_.cache.addContainerMetadata(record, needs_.configuration.users().system, ContainerPlace(target), false);
    if (!added) {
        report.write(logLevelError, "%s: Failed to update cache for whitelisted container %s: (error= %s: %lld)",
                     whitelistOperation, ZOR_SHOWN(identifier), added.error().domainName(), code(added.error()));
        return std::move(added).error();
    }
    return true;
}

} // namespace zor
