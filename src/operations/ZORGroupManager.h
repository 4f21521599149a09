// SPDX-License-Identifier: Apache-2.0
// The containers that identifiers share: application groups, one container a user, and system groups.
//
// Nothing is counted ahead: how many identifiers refer to a group is worked out from the entitlement map when somebody
// has to know. A container is made when a client first asks for its paths, and goes when the last reference goes. If
// the map is known to be incomplete, nothing goes: a guess would delete what somebody still uses.
#pragma once

#include "base/ContainerClass.h"
#include "base/ZORError.h"
#include "operations/Basics.h"
#include "operations/ContainerMaker.h"
#include "operations/Creation.h"
#include "operations/Deletion.h"
#include "operations/ReplaceRecovery.h"
#include "store/Configuration.h"
#include "store/EntitlementFile.h"
#include "store/SetupProgress.h"
#include "store/ZOREntitlementMapping.h"

#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <vector>

namespace zor {

class ZORGroupManager {
public:
    struct Needs : RecordNeeds {
        ZORGlobalConfiguration& configuration;
        ZOREntitlementMapping& entitlements;
        ReplaceRecovery& recovery;
        ContainerMaker& maker;
        Creation& creation;
        ContainerRemoval& removal;
        SetupReport& report;
    };
    using Identifiers = ZOREntitlementMapping::Identifiers;
    /// Group identifier to container path.
    using Paths = std::map<std::string, std::string, std::less<>>;
    using References = GroupReferences;

    explicit ZORGroupManager(const Needs& needs) : needs_(needs) {}
    ZORGroupManager(const ZORGroupManager&) = delete;
    ZORGroupManager& operator=(const ZORGroupManager&) = delete;

    /// The containers of an identifier's groups (of the system groups for the system's user), made where they are
    /// missing. A group whose container cannot be had is left out. Takes the all-identifiers lock for writing.
    /// `identifier` nullptr: error 11; 40.
    Result<Paths> groupContainerPathsForUser(std::uint32_t userId, const Caller& caller, const std::string* identifier);
    /// The application groups of an identifier. `identifier` nullptr: error 11; 40.
    Result<std::vector<std::string>> groupContainerIdentifiersForUser(std::uint32_t userId,
                                                                      const std::string* identifier);

    /// Reads what the next two operations need. Called without a lock, before entitlements of `identifier` change.
    void prepare(const std::string& identifier);
    /// Error WaitingReplaces::metOneUnderWay while the container of a group of `identifier` is being replaced, whoever
    /// else refers to it.
    [[nodiscard]] Result<void> refuseIfUnderWay(const std::string& identifier, const AllIdentifiersWriteLock& lock);
    /// Stages the containers of groups that lose their last reference by a change of `identifier` that has not been
    /// applied: the map still holds what was before. `changed` as ContainerRemoval::stage has it. One that cannot be
    /// staged is logged and stays for the next boot; an error only where WaitingReplaces::metOneUnderWay.
    Result<void> handleChangeFromOldGroupContainerIds(Identifiers oldGroups, const Identifiers& newGroups,
                                                      GroupType type, const std::string& identifier,
                                                      std::vector<FileURL>& changed,
                                                      const AllIdentifiersWriteLock& lock);
    /// Stages every group container that the map does not refer to. At the boot, before clients are served.
    std::uint64_t reconcileGroupContainersOfType(GroupType type);

private:
    /// nullopt, logged, when the map is known to be incomplete.
    [[nodiscard]] std::optional<References> _copyReferenceCountSetOfType(GroupType type);
    Result<void> _removeReferenceForGroupIdentifiers(const std::vector<std::string>& groups, GroupType type,
                                                     const std::string& identifier, std::vector<FileURL>& changed,
                                                     const AllIdentifiersWriteLock& lock);
    Result<void> _removeGroupContainersIfNeededforUser(std::uint32_t userId, ContainerClass containerClass,
                                                       const std::string& group, const std::string& identifier,
                                                       const References& references, std::vector<FileURL>& changed,
                                                       const AllIdentifiersWriteLock& lock);
    std::uint64_t _cleanupUnreferencedGroupContainersForUser(std::uint32_t userId, ContainerClass containerClass,
                                                             const References& references);
    /// Says it where a container could not be staged; whether it was.
    bool isStaged(const char* function, std::uint32_t userId, const ZORMetadata& record, const Result<void>& staged);
    using Failed = std::function<void(const ZORError&)>;
    /// Those of the groups that the map has for the identifier, made where there is none. Each that there is none of is
    /// told to `failed`.
    Result<std::vector<FoundContainer>> groupContainers(std::uint32_t userId, const Caller& caller,
                                                        const std::string& identifier, GroupType type,
                                                        const Failed& failed);
    /// Every user that has groups of the type, and a home to have them in.
    void forEachUser(GroupType type, const std::function<void(std::uint32_t)>& function);

    const Needs needs_;
};

} // namespace zor
