// SPDX-License-Identifier: Apache-2.0
#include "operations/ZORGroupManager.h"

#include "base/ContainerClass.h"

#include <algorithm>
#include <map>
#include <set>
#include <utility>

namespace zor {

namespace {

ContainerClass classOf(GroupType type) {
    return type == GroupType::application ? ContainerClass::sharedAppGroup : ContainerClass::sharedSystemGroup;
}

ContainerToGo toGo(std::uint32_t userId, const ZORMetadata& record) {
    return {.userId = userId,
            .uuid = record.uuid(),
            .identifier = record.identifier(),
            .containerClass = record.containerClass()};
}

} // namespace

void ZORGroupManager::forEachUser(GroupType type, const std::function<void(std::uint32_t)>& function) {
    if (type == GroupType::system) {
        function(needs_.configuration.users().system);
        return;
    }
    for (std::uint32_t userId = needs_.configuration.users().first; userId <= needs_.configuration.users().last;
         ++userId) {
        ZORPerUserConfiguration* user = needs_.configuration.getPerUserConfigurationForUserId(userId);
        if (user && user->existsUserBaseDirectory())
            function(userId);
    }
}

std::optional<ZORGroupManager::References> ZORGroupManager::_copyReferenceCountSetOfType(GroupType type) {
    if (const auto lost = needs_.entitlements.lostFile()) {
        needs_.log.write(logLevelError, __func__,
                         "%s holds entitlements that could not be read; references cannot be counted", lost->c_str());
        return std::nullopt;
    }
    if (type == GroupType::application && !needs_.entitlements.groupIdsAreMigrated()) {
        needs_.log.write(logLevelError, __func__,
                         "Groups that data containers refer to have not been migrated; references cannot be counted");
        return std::nullopt;
    }
    return needs_.entitlements.groupReferences(type);
}

void ZORGroupManager::prepare(const std::string& identifier) {
    for (const GroupType type : {GroupType::application, GroupType::system})
        if (needs_.entitlements.mayHaveGroups(identifier, type))
            forEachUser(type, [&](std::uint32_t userId) { needs_.cache.prepare(userId, classOf(type), false); });
}

Result<void> ZORGroupManager::refuseIfUnderWay(const std::string& identifier, const AllIdentifiersWriteLock& /*held*/) {
    if (needs_.replaces.noneUnderWay())
        return {}; // the groups need not be put together
    const UserNumbers& users = needs_.configuration.users();
    const auto refuse = [&](GroupType type, const Identifiers& groups, std::uint32_t first,
                            std::uint32_t last) -> Result<void> {
        for (const std::string& group : groups.value_or(std::vector<std::string>()))
            for (std::uint32_t userId = first; userId <= last; ++userId)
                TRY(needs_.replaces.refuseIfUnderWay(userId, classOf(type), group));
        return {};
    };
    TRY(refuse(GroupType::application, needs_.entitlements.appGroupIdentifiersForIdentifier(identifier), users.first,
               users.last));
    return refuse(GroupType::system, needs_.entitlements.systemGroupIdentifiersForIdentifier(identifier), users.system,
                  users.system);
}

Result<void> ZORGroupManager::handleChangeFromOldGroupContainerIds(Identifiers oldGroups, const Identifiers& newGroups,
                                                                   GroupType type, const std::string& identifier,
                                                                   std::vector<FileURL>& changed,
                                                                   const AllIdentifiersWriteLock& lock) {
    if (!oldGroups || oldGroups == newGroups)
        return {};
    if (newGroups)
        std::erase_if(*oldGroups, [&](const std::string& group) {
            return std::ranges::find(*newGroups, group) != newGroups->end();
        });
    return _removeReferenceForGroupIdentifiers(*oldGroups, type, identifier, changed, lock);
}

Result<void> ZORGroupManager::_removeReferenceForGroupIdentifiers(const std::vector<std::string>& groups,
                                                                  GroupType type, const std::string& identifier,
                                                                  std::vector<FileURL>& changed,
                                                                  const AllIdentifiersWriteLock& lock) {
    if (groups.empty())
        return {};
    const auto references = _copyReferenceCountSetOfType(type);
    if (!references) {
        needs_.log.write(logLevelError, __func__, "Failed to get reference count information for group type: %ld",
                         static_cast<long>(type));
        return {};
    }
    Result<void> met;
    forEachUser(type, [&](std::uint32_t userId) {
        for (const std::string& group : groups)
            if (auto removed = _removeGroupContainersIfNeededforUser(userId, classOf(type), group, identifier,
                                                                     *references, changed, lock);
                !removed)
                met = std::move(removed);
    });
    return met;
}

Result<void> ZORGroupManager::_removeGroupContainersIfNeededforUser(
    std::uint32_t userId, ContainerClass containerClass, const std::string& group, const std::string& identifier,
    const References& references, std::vector<FileURL>& changed, const AllIdentifiersWriteLock& lock) {
    const auto holders = references.find(group);
    const std::size_t count = holders == references.end() ? 0 : holders->second.size();
    // One reference that is somebody else's is not the one that goes.
    if (count != 1 || holders->second.front() != identifier) {
        ZOR_LOG(needs_.log, logLevelDebug, "Reference count for user: %u, ID: %s is %ld", userId, ZOR_SHOWN(group),
                static_cast<long>(count));
        return {};
    }
    // Between its moves a replace has no live container.
    TRY(needs_.replaces.refuseIfUnderWay(userId, containerClass, group));
    const auto record = needs_.cache.containerForUser(userId, containerClass, &group, false);
    if (!record) {
        ZOR_LOG(needs_.log, logLevelDebug,
                "Failed to retrieve group container %s for %u : %s.  May not exist for this user", ZOR_SHOWN(group),
                userId, record.error().text().c_str());
        return {};
    }
    needs_.log.write(logLevelNotice, __func__,
                     "Last reference to group container %s for %u is going away; removing it.", ZOR_SHOWN(group),
                     userId);
    (void)isStaged(__func__, userId, **record, needs_.removal.stage(toGo(userId, **record), changed, lock));
    return {};
}

bool ZORGroupManager::isStaged(const char* function, std::uint32_t userId, const ZORMetadata& record,
                               const Result<void>& staged) {
    if (!staged)
        needs_.log.write(logLevelError, function, "Failed to destroy group container with identifier %s for %u: %llu",
                         ZOR_SHOWN(record.identifier()), userId,
                         static_cast<unsigned long long>(staged.error().replyCode()));
    return staged.has_value();
}

std::uint64_t ZORGroupManager::reconcileGroupContainersOfType(GroupType type) {
    const auto references = _copyReferenceCountSetOfType(type);
    if (!references) {
        needs_.log.write(logLevelError, __func__, "Failed to get reference count information for group type: %ld",
                         static_cast<long>(type));
        return 0;
    }
    std::uint64_t removed = 0;
    forEachUser(type, [&](std::uint32_t userId) {
        removed += _cleanupUnreferencedGroupContainersForUser(userId, classOf(type), *references);
    });
    return removed;
}

std::uint64_t ZORGroupManager::_cleanupUnreferencedGroupContainersForUser(std::uint32_t userId,
                                                                          ContainerClass containerClass,
                                                                          const References& references) {
    const auto records = needs_.cache.allContainersForUser(userId, containerClass, false);
    if (!records) {
        needs_.log.write(logLevelError, __func__, "Failed to fetch group container list for %u: %s", userId,
                         records.error().text().c_str());
        return 0;
    }
    std::uint64_t removed = 0;
    for (const auto& record : *records) {
        if (!needs_.report.goOn())
            break;
        if (references.contains(record->identifier()))
            continue;
        needs_.log.write(logLevelError, __func__, "Removing group container with identifier %s for %u",
                         ZOR_SHOWN(record->identifier()), userId);
        removed += isStaged(__func__, userId, *record, needs_.removal.stage(toGo(userId, *record))) ? 1 : 0;
    }
    return removed;
}

Result<std::vector<FoundContainer>> ZORGroupManager::groupContainers(std::uint32_t userId, const Caller& caller,
                                                                     const std::string& identifier, GroupType type,
                                                                     const Failed& failed) {
    std::map<std::string, BuiltAhead> ahead;
    std::set<std::string> unavailable;
    const auto isUnavailable = [&](const std::string& group, const ZORError& error) {
        failed(error);
        unavailable.insert(group);
    };
    std::vector<FoundContainer> containers;
    std::vector<std::string> missing;
    const auto look = [&]() -> Result<void> {
        containers.clear();
        missing.clear();
        const AllIdentifiersWriteLock lock(needs_.locks, Touches::nothing());
        const auto groups = type == GroupType::system
                                ? needs_.entitlements.systemGroupIdentifiersForIdentifier(identifier)
                                : needs_.entitlements.appGroupIdentifiersForIdentifier(identifier);
        // A client that may ask at all may ask for any identifier's: a path opens nothing, its directory has an owner.
        for (const std::string& group : groups.value_or(std::vector<std::string>())) {
            if (unavailable.contains(group))
                continue;
            auto found = needs_.creation.createOrLookupContainerForUser(
                caller, userId, &group, classOf(type), {.createIfNecessary = true},
                ahead.try_emplace(group, needs_.maker).first->second, lock);
            if (!found && WaitingReplaces::metOneUnderWay(found.error()))
                return std::move(found).error();
            if (!found)
                isUnavailable(group, found.error());
            else if (*found)
                containers.push_back(std::move(**found));
            else
                missing.push_back(group);
        }
        return {};
    };
    for (;;) {
        TRY(needs_.replaces.undisturbed(look));
        if (missing.empty())
            return containers;
        for (const std::string& group : missing)
            if (const auto built = ahead.at(group).build(userId, group, classOf(type)); !built)
                isUnavailable(group, built.error());
    }
}

Result<ZORGroupManager::Paths> ZORGroupManager::groupContainerPathsForUser(std::uint32_t userId, const Caller& caller,
                                                                           const std::string* identifier) {
    constexpr Here here{"groupContainerPathsForUser", __LINE__};
    return needs_.boundary.run(here, [&]() -> Result<Paths> {
        if (!identifier)
            return Reporter(needs_.log, here.function)
                .error({ErrorCode::invalidObject, here.line}, "Can't act on an invalid object: userId: %u, ID: %s",
                       userId, "(null)");
        const auto groupFailed = [&](const ZORError& error) {
            needs_.log.write(logLevelError, here.function,
                             "Failed to create or lookup group container-userId: %u, ID: %s : %llu", userId,
                             ZOR_SHOWN(*identifier), static_cast<unsigned long long>(error.replyCode()));
        };
        const GroupType type =
            userId == needs_.configuration.users().system ? GroupType::system : GroupType::application;
        needs_.cache.prepare(userId, classOf(type), false);
        Paths paths;
        for (const FoundContainer& container : TRY(groupContainers(userId, caller, *identifier, type, groupFailed)))
            if (const auto synced = needs_.creation.makeDurable(container))
                paths.emplace(container.record->identifier(), container.path);
            else
                groupFailed(synced.error());
        return paths;
    });
}

Result<std::vector<std::string>> ZORGroupManager::groupContainerIdentifiersForUser(std::uint32_t userId,
                                                                                   const std::string* identifier) {
    constexpr Here here{"groupContainerIdentifiersForUser", __LINE__};
    return needs_.boundary.run(here, [&]() -> Result<std::vector<std::string>> {
        if (!identifier)
            return Reporter(needs_.log, here.function)
                .error({ErrorCode::invalidObject, here.line}, "Can't act on an invalid object: userId: %u, ID: %s",
                       userId, "(null)");
        const AllIdentifiersWriteLock lock(needs_.locks, Touches::nothing());
        return needs_.entitlements.appGroupIdentifiersForIdentifier(*identifier).value_or(std::vector<std::string>());
    });
}

} // namespace zor
