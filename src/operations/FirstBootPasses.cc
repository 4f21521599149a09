// SPDX-License-Identifier: Apache-2.0
// Bringing the containers on disk in line with the entitlement map, at the first launch after a boot.
//
// A stop in the middle leaves the rest as it was and no marker; the next boot does all of it again, and writing an
// entry once more changes nothing.
#include "base/UserIdentity.h"
#include "operations/ZORClientConnection.h"
#include "operations/ZORContainerMigrator.h"
#include "operations/ZOREntitlementMapping.h"
#include "plist/Value.h"
#include "store/Names.h"

#include <array>
#include <cerrno>
#include <set>

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

std::uint64_t ZOREntitlementMapping::migrateAppGroupIdsFromDataContainersToFile() {
    if (!services_.migrator.isDue(names::groupIdMigrationMarker))
        return 0;
    log_.write(logLevelNotice, migrateFunction, "Performing group ID migration");
    std::vector<ZORContainerCache::Record> containers;
    for (const ContainerClass containerClass : formerGroupHolders) {
        const auto records = services_.cache.allContainersForUser(configuration_.users().first, containerClass, false);
        if (!records) {
            log_.write(logLevelError, migrateFunction,
                       "Failed to fetch list of containers for userId: %u, class %ld : %s",
                       configuration_.users().first, static_cast<long>(containerClass), records.error().text().c_str());
            return 0;
        }
        containers.insert(containers.end(), records->begin(), records->end());
    }
    log_.write(logLevelNotice, migrateFunction, "We have %ld potential data containers to migrate",
               static_cast<long>(containers.size()));
    int errors = 0;
    std::uint64_t migrated = 0;
    for (const auto& container : containers) {
        if (!services_.setup.goOn()) {
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
        log_.write(logLevelError, migrateFunction,
                   "Not writing the migration complete file because there we had %d error(s)", errors);
    else if (const auto absent = userWithoutHome(configuration_))
        log_.write(logLevelError, migrateFunction,
                   "Not writing the migration complete file: the home of user %u is not there", *absent);
    else
        services_.migrator.writeMigrationFileToDiskWithName(names::groupIdMigrationMarker);
    groupIdsAreMigrated_ = errors == 0;
    return migrated;
}

bool ZOREntitlementMapping::groupIdsAreMigrated() {
    if (groupIdsAreMigrated_ || services_.migrator.existsMigrationFileWithName(names::groupIdMigrationMarker))
        return true;
    // Where that user is not, the lists can never be fetched, and there is never a marker.
    return configuration_.homeOf(configuration_.users().first)->look().state == UserHome::State::noAccount;
}

bool ZOREntitlementMapping::migrateGroupIdentifiers(const ZORMetadata& container) {
    const std::string& identifier = container.identifier();
    const plist::Value groups = *groupIdentifiersIn(container);
    const plist::Dictionary migrated{{std::string(entitlementKeys::applicationGroups), groups}};
    ZOR_LOG(log_, logLevelDebug, "Data container for userId: %u, identifier %s references container IDs: %s",
            configuration_.users().first, ZOR_SHOWN(identifier), plist::describe(&groups).c_str());
    // Whoever registered meanwhile did so under this system: what it said stays, and the older list is added.
    const auto stored = [&] {
        const platform::MutexLock held(entitlementQueue_);
        const plist::Dictionary* const entry = entitlementsOf(identifier);
        return _onQueue_setEntitlementDictionaryValues({entry ? plist::united(*entry, migrated) : migrated},
                                                       {identifier});
    }();
    if (!stored) {
        log_.write(logLevelError, migrateFunction, "Failed to write group id entitlements for %s to file : %s",
                   ZOR_SHOWN(identifier), stored.error().text().c_str());
        return false;
    }
    const std::string path = container.url().path();
    const std::string key(ipc::infoKeys::groupContainerIds);
    const auto cleared = services_.sharedClientConnection->setInfoValue(nullptr, &key,
                                                                        {.userId = configuration_.users().first,
                                                                         .uuid = container.uuid(),
                                                                         .identifier = identifier,
                                                                         .containerClass = container.containerClass()},
                                                                        UseLocking::yes);
    if (!cleared)
        log_.write(logLevelError, migrateFunction, "Failed to clear group id metadata for %s at %s : %llu",
                   ZOR_SHOWN(identifier), path.c_str(), static_cast<unsigned long long>(cleared.error().replyCode()));
    return cleared.has_value();
}

std::optional<std::set<std::string, std::less<>>> ZOREntitlementMapping::ownersOfSystemContainers() {
    // What was lost with the file is not known to be unentitled.
    if (const auto lost = lostFile()) {
        const ZORError error = posixError({reconcileFunction, __LINE__}, EIO,
                                          "the entitlement file could not be read and lies at %s", lost->c_str());
        log_.write(logLevelError, reconcileFunction, "Failed to fetch system container list: %s", error.text().c_str());
        return std::nullopt;
    }
    std::set<std::string, std::less<>> owners;
    const plist::Dictionary map = entitlementMappingDict();
    for (const auto& [identifier, entitlements] : map) {
        if (!identifierHasSystemContainer(identifier))
            continue;
        ZOR_LOG(log_, logLevelDebug, "System container exists for identifier %s", ZOR_SHOWN(identifier));
        owners.insert(identifier);
    }
    return owners;
}

std::uint64_t ZOREntitlementMapping::reconcileSystemContainers() {
    const auto owners = ownersOfSystemContainers();
    if (!owners)
        return 0;
    const auto containers =
        services_.cache.allContainersForUser(configuration_.users().system, ContainerClass::dataSystem, false);
    if (!containers) {
        log_.write(logLevelError, reconcileFunction, "Failed to fetch system container list: %s",
                   containers.error().text().c_str());
        return 0;
    }
    std::uint64_t removed = 0;
    for (const auto& container : *containers) {
        if (!services_.setup.goOn())
            break;
        const std::string& identifier = container->identifier();
        if (owners->contains(identifier))
            continue;
        log_.write(logLevelError, reconcileFunction, "Removing system container with identifier %s",
                   ZOR_SHOWN(identifier));
        const auto staged = services_.sharedClientConnection->stageForDeleteContainersWithUsers(
            ZORClientConnection::DeletionBatch::of(configuration_.users().system, container->uuid(), identifier,
                                                   ContainerClass::dataSystem),
            UseLocking::yes);
        if (staged)
            ++removed;
        else
            log_.write(logLevelError, reconcileFunction, "Failed to destroy system container with identifier %s: %llu",
                       ZOR_SHOWN(identifier), static_cast<unsigned long long>(staged.error().replyCode()));
    }
    return removed;
}

} // namespace zor
