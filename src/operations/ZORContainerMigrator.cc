// SPDX-License-Identifier: Apache-2.0
#include "operations/ZORContainerMigrator.h"

#include "base/UserIdentity.h"
#include "fs/DictionaryFile.h"
#include "fs/Hidden.h"
#include "operations/StoreServices.h"
#include "operations/ZORClientConnection.h"
#include "store/Names.h"
#include "store/ZORWhitelist.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <ctime>

namespace zor {

namespace {

constexpr const char* whitelistOperation = "-[ZORContainerMigrator performWhitelistMigrationWithError:]";
constexpr const char* migrationFunction = "performMigrationWithError";
constexpr const char* whitelistFunction = "performWhitelistMigrationWithError";
constexpr std::size_t markerBytesMax = 4096;

constexpr std::array bundleClasses = {ContainerClass::bundleApplication, ContainerClass::bundleKolvexPlugin,
                                      ContainerClass::bundleVPNPlugin, ContainerClass::bundleFramework};

std::string currentTime() {
    const std::time_t now = std::time(nullptr);
    std::tm parts{};
    ::gmtime_r(&now, &parts);
    char text[64];
    (void)std::strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S +0000", &parts);
    return text;
}

/// Of a listing: there is a link, or a file, on the way or in the directory's place.
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

void ZORContainerMigrator::writeMigrationFileToDiskWithName(std::string_view name, const FileURL& directory) {
    const std::string version = systemVersion_.buildVersion();
    const plist::Dictionary marker{{"ZORMigrationVersionNumber", version.empty() ? "Unknown" : version},
                                   {"ZORMigrationTime", currentTime()}};
    const auto written = writeToURL(marker, directory.appendingFile(name), writeAtomically | writeWithoutProtection,
                                    markerBytesMax, services_.fileManager);
    const std::string shown(name);
    if (written)
        services_.log.write(logLevelNotice, __func__, "Migration successfully completed for %s", shown.c_str());
    else
        services_.log.write(logLevelError, __func__, "Failed to write migration file %s : %s", shown.c_str(),
                            written.error().text().c_str());
}

void ZORContainerMigrator::writeMigrationFileToDiskWithName(std::string_view name) {
    writeMigrationFileToDiskWithName(name, services_.configuration.libraryDirectory());
}

bool ZORContainerMigrator::existsMigrationFileWithName(std::string_view name) {
    return services_.fileManager.itemExistsAtURL(services_.configuration.libraryDirectory().appendingFile(name));
}

bool ZORContainerMigrator::isDue(std::string_view name) {
    return services_.fileManager.itemDoesNotExistAtURL(services_.configuration.libraryDirectory().appendingFile(name));
}

// The bundles of an older system.

ZORContainerMigrator::Outcome ZORContainerMigrator::performMigrationWithError() {
    const Log& log = services_.log;
    const FileURL former = services_.configuration.formerBundleDirectory();
    const FileURL bundles = services_.configuration.bundleDirectory();
    if (!isDue(names::bundleMigrationMarker))
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
    auto owned = services_.fileManager.standardizeOwnershipAtURL(
        bundles, services_.configuration.users().installer, services_.configuration.users().installer,
        services_.configuration.users().first, services_.setup.check());
    if (owned)
        if (const int failure = orderBeforeMarker(bundles); failure < 0)
            owned = posixError({migrationFunction, __LINE__}, -failure, "sync of %s failed: %s", bundles.c_str(),
                               errorText(-failure));
    if (!owned)
        return {.succeeded = false,
                .error = makeError(log, {migrationFunction, __LINE__}, ErrorCode::ownerNotChanged, &owned.error(),
                                   LogFlag::yes, "Failed to change owner of %s: %s", bundles.c_str(),
                                   owned.error().text().c_str()),
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
    writeMigrationFileToDiskWithName(names::bundleMigrationMarker);
    return {.succeeded = true, .error = std::move(count.last), .migrated = count.migrated};
}

std::optional<ZORError> ZORContainerMigrator::cannotLook(const FileURL& former) {
    struct stat status{};
    const fs::PathResolver& resolver = services_.fileManager.resolver();
    if (resolver.status(former, status) != ENOENT)
        return std::nullopt;
    const auto hider = fs::hiddenBy(resolver, services_.fileManager.disk(), former);
    if (hider)
        return posixError({migrationFunction, __LINE__}, ENOKEY, "An encryption whose key is away hides what is in %s",
                          hider->c_str());
    if (services_.configuration.homeOf(services_.configuration.users().first)->look().state == UserHome::State::missing)
        return posixError({migrationFunction, __LINE__}, ENOENT, "The home of user %u is not there",
                          services_.configuration.users().first);
    return std::nullopt;
}

bool ZORContainerMigrator::mayHoldBundles(const FileURL& former) {
    // Another's directory that its owner named so holds none.
    if (const auto judged = services_.fileManager.openDirectoryOf(services_.configuration.users().first, former);
        !judged && judged.error().isPosix(EPERM)) {
        services_.log.write(logLevelError, migrationFunction, "%s", judged.error().text().c_str());
        return false;
    }
    if (services_.fileManager.itemExistsAtURL(former))
        return true;
    // What cannot be examined counts as there: its move fails, no marker is written, and the next boot tries again. A
    // link on the way is the doing of the user who owned the place, and would keep failing.
    struct stat status{};
    const int failure = services_.fileManager.resolver().status(former, status);
    return failure != ENOENT && failure != ELOOP && failure != ENOTDIR;
}

Result<void> ZORContainerMigrator::moveFormerBundles(const FileURL& former, const FileURL& bundles) {
    const auto present = TRY(services_.fileManager.urlsForItemsInDirectoryAtURL(bundles));
    // Something lies there already: an earlier migration was cut short, or containers were made before this one. Or
    // what would come along is not all of the old owner's.
    if (!present.empty() || holdsOfOthers(former))
        return moveEachFormerBundle(former);
    return services_.fileManager.moveItemAtURL(former, bundles, services_.setup.check());
}

bool ZORContainerMigrator::isOfAnother(const FileURL& directory) {
    const auto judged = services_.fileManager.openDirectoryOf(services_.configuration.users().first, directory);
    return !judged && judged.error().isPosix(EPERM);
}

bool ZORContainerMigrator::holdsOfOthers(const FileURL& former) {
    const auto items = services_.fileManager.urlsForItemsInDirectoryAtURL(former);
    if (items && std::ranges::any_of(*items, [this](const FileURL& item) { return isOfAnother(item); }))
        return true;
    return std::ranges::any_of(bundleClasses, [this](ContainerClass containerClass) {
        const auto containers = services_.fileManager.urlsForItemsInDirectoryAtURL(
            services_.configuration.formerBundleDirectory(containerClass));
        return containers &&
               std::ranges::any_of(*containers, [this](const FileURL& container) { return isOfAnother(container); });
    });
}

Result<void> ZORContainerMigrator::moveEachFormerBundle(const FileURL& former) {
    std::optional<ZORError> failure;
    for (const ContainerClass containerClass : bundleClasses) {
        const FileURL source = services_.configuration.formerBundleDirectory(containerClass);
        if (isOfAnother(source))
            continue;
        const auto containers = services_.fileManager.urlsForItemsInDirectoryAtURL(source);
        // What the user put in a directory's place holds no containers; it goes with what is left.
        if (!containers && (containers.error().isPosix(ENOENT) || isMisshapen(containers.error())))
            continue;
        if (!containers) {
            failure = containers.error();
            continue;
        }
        const auto target = services_.configuration.containerDirectoryURLForUser(
            services_.configuration.users().installer, containerClass, false);
        for (const FileURL& container : *containers)
            if (!services_.setup.goOn())
                return posixError({migrationFunction, __LINE__}, ECANCELED, "The daemon was told to end");
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
        services_.log.write(logLevelError, migrationFunction,
                            "%s stays: something in it belongs to others than user %u; move that away, and remove it",
                            former.c_str(), services_.configuration.users().first);
        return {};
    }
    // What is left are directories that held containers, and what never was one. It is in nobody's way.
    return services_.sharedClientConnection->_moveItemAtURLToDeathRow(former, StartDeletionThread::no);
}

Result<void> ZORContainerMigrator::moveFormerBundle(const FileURL& container, const FileURL& target) {
    // One that lies in both places was copied from another file system, and the stop came before its source went.
    if (services_.fileManager.itemExistsAtURL(target))
        return services_.sharedClientConnection->_moveItemAtURLToDeathRow(container, StartDeletionThread::no);
    ZORFileManager& fileManager = services_.fileManager;
    const FileURL place = target.deletingLastPathComponent();
    const auto from = fileManager.resolver().openParent(container);
    if (!from)
        return posixError({migrationFunction, __LINE__}, from.error(), "rename of %s to %s failed: %s",
                          container.c_str(), target.c_str(), errorText(from.error()));
    // The old owner's until the end of a migration that was cut short.
    auto to = fileManager.openDirectoryOf(services_.configuration.users().first, place);
    if (!to)
        to = fileManager.openDirectoryOf(services_.configuration.users().installer, place);
    if (!to)
        return std::move(to).error();
    TRY(fileManager.moveItem(from->directory.get(), container, to->get(), target, services_.setup.check()));
    return {};
}

void ZORContainerMigrator::adoptBundlesOfClass(ContainerClass containerClass, Count& count) {
    const FileURL directory =
        services_.configuration.sharedContainersDirectory().appendingDirectory(className(containerClass));
    const auto containers = services_.fileManager.urlsForItemsInDirectoryAtURL(directory);
    if (!containers) {
        if (!containers.error().isPosix(ENOENT)) {
            services_.log.write(logLevelError, migrationFunction, "Failed to get items at staging URL%s : %s",
                                directory.c_str(), containers.error().text().c_str());
            count.unfinished += isMisshapen(containers.error()) ? 0 : 1;
        }
        // The user who owned the old place may have put anything there; a link in a class directory's place would keep
        // the class from ever having one.
        if (isMisshapen(containers.error()))
            (void)services_.sharedClientConnection->_moveItemAtURLToDeathRow(directory, StartDeletionThread::no);
        return;
    }
    for (const FileURL& container : *containers) {
        if (!services_.setup.goOn()) {
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
    const Log& log = services_.log;
    // Its owner was the mobile user, and so, perhaps, was its metadata file's.
    const auto read =
        readAndValidateMetadataAtUrl(log, services_.fileManager, container, services_.configuration.users().first,
                                     CheckClassPath::yes, services_.configuration.users().first);
    if (!read) {
        log.write(logLevelError, migrationFunction, "Failed to read metadata at URL %s : %s", container.c_str(),
                  read.error().text().c_str());
        return read.error();
    }
    const auto& record = *read;
    record->setUid(services_.configuration.users().installer);
    const auto written = record->writeMetadataToDiskWithError(log, services_.fileManager);
    if (!written)
        return makeError(log, {migrationFunction, __LINE__}, ErrorCode::propertyListNotWritten, &written.error(),
                         LogFlag::yes, "Failed to write metadata for %u : %s, url: %s",
                         services_.configuration.users().installer, ZOR_SHOWN(record->identifier()), container.c_str());
    const auto added =
        services_.cache.addContainerMetadata(record, services_.configuration.users().installer, record->place(), false);
    if (!added)
        return makeError(log, {migrationFunction, __LINE__}, ErrorCode::cacheAddFailed, &added.error(), LogFlag::yes,
                         "Failed to add to cache for %u : %s, url: %s", services_.configuration.users().installer,
                         ZOR_SHOWN(record->identifier()), container.c_str());
    return {};
}

int ZORContainerMigrator::orderBeforeMarker(const FileURL& bundles) {
    const auto changed = services_.fileManager.resolver().openDirectory(bundles);
    const auto next = services_.fileManager.resolver().openDirectory(services_.configuration.libraryDirectory());
    if (!changed || !next)
        return -(changed ? next.error() : changed.error());
    return services_.durability.between(changed->get(), next->get());
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
    if (!services_.whitelist.isWhole(containerClass)) {
        services_.log.write(logLevelError, whitelistFunction,
                            "Not migrating to well-known names in %s: their table could not be read",
                            className(containerClass));
        return true;
    }
    const auto classDirectory = services_.configuration.containerDirectoryURLForUser(
        services_.configuration.users().system, containerClass, false);
    const auto records =
        services_.cache.allContainersForUser(services_.configuration.users().system, containerClass, false);
    if (!records) {
        services_.log.write(logLevelError, whitelistFunction,
                            "Failed to get list of system containers for migration: (error= %s : %lld)",
                            records.error().domainName(), code(records.error()));
        outcome.succeeded = false;
        outcome.error = records.error();
        return false;
    }
    for (const auto& record : *records) {
        if (!services_.setup.goOn())
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
    const Log& log = services_.log;
    const std::string& identifier = record->identifier();
    if (identifier.empty() || !record->hasUrl() ||
        !services_.whitelist.containerIdIsWellknown(identifier, containerClass))
        return false;
    const FileURL target =
        classDirectory.appendingDirectory(*services_.whitelist.wellknownContainerForId(identifier, containerClass));
    const FileURL former = record->url();
    if (former == target)
        return false;
    log.write(logLevelError, whitelistFunction, "Migrating well-known container %s", ZOR_SHOWN(identifier));
    auto removed = services_.cache.removeContainerForUser(services_.configuration.users().system, containerClass,
                                                          &identifier, false);
    if (!removed) {
        log.write(logLevelError, whitelistFunction,
                  "%s: Failed to remove cache for whitelisted container %s: (error= %s: %lld)", whitelistOperation,
                  ZOR_SHOWN(identifier), removed.error().domainName(), code(removed.error()));
        return std::move(removed).error();
    }
    auto moved = [&]() -> Result<void> {
        const auto directory = TRY(services_.fileManager.openDirectoryOf(ownerUnchanged, classDirectory));
        TRY(services_.fileManager.moveItem(directory.get(), former, directory.get(), target));
        return {};
    }();
    if (!moved) {
        log.write(logLevelError, whitelistFunction,
                  "%s: Failed to move system container %s from %s to whitelisted location %s: (error= %s: %lld)",
                  whitelistOperation, ZOR_SHOWN(identifier), former.c_str(), target.c_str(), moved.error().domainName(),
                  code(moved.error()));
        return std::move(moved).error();
    }
    auto added = services_.cache.addContainerMetadata(record, services_.configuration.users().system,
                                                      ContainerPlace(target), false);
    if (!added) {
        log.write(logLevelError, whitelistFunction,
                  "%s: Failed to update cache for whitelisted container %s: (error= %s: %lld)", whitelistOperation,
                  ZOR_SHOWN(identifier), added.error().domainName(), code(added.error()));
        return std::move(added).error();
    }
    return true;
}

} // namespace zor
