// SPDX-License-Identifier: Apache-2.0
// The containers that identifiers share: application groups, one container a user, and system groups.
//
// Nothing is counted ahead: how many identifiers refer to a group is worked out from the entitlement map when somebody
// has to know. A container is made when a client first asks for its paths, and goes when the last reference goes. Where
// the map is known to be incomplete nothing goes: a guess would delete what somebody still uses.
#pragma once

#include "base/ContainerClass.h"
#include "base/Result.h"
#include "plist/Value.h"
#include "store/EntitlementFile.h"

#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zor {

struct StoreServices;
class ZORClientConnection;
class ZORMetadata;
enum class UseLocking : std::int32_t;

class ZORGroupManager {
public:
    using Identifiers = std::optional<std::vector<std::string>>;
    /// Group identifier to container path.
    using Paths = std::map<std::string, std::string, std::less<>>;
    using References = GroupReferences;

    /// `services` may still be in the making.
    ZORGroupManager(const Log& log, StoreServices& services) : log_(log), services_(services) {}
    ZORGroupManager(const ZORGroupManager&) = delete;
    ZORGroupManager& operator=(const ZORGroupManager&) = delete;

    /// The containers of an identifier's groups (of the system groups for user 499), made where they are missing. A
    /// group whose container cannot be had is left out. Takes the all-identifiers lock for writing. `identifier`
    /// nullptr: error 11; 40.
    Result<Paths> groupContainerPathsForUser(std::uint32_t userId, ZORClientConnection& clientConnection,
                                             const std::string* identifier);
    /// The application groups of an identifier. `identifier` nullptr: error 11; 40.
    Result<std::vector<std::string>> groupContainerIdentifiersForUser(std::uint32_t userId,
                                                                      const std::string* identifier);

    /// Stages the containers of groups that lose their last reference by a change of `identifier`. `map` is the
    /// entitlement map before the change; the caller holds the all-identifiers lock for writing.
    void handleChangeFromOldGroupContainerIds(Identifiers oldGroups, const Identifiers& newGroups, GroupType type,
                                              const std::string& identifier, const plist::Dictionary& map);
    /// Stages every group container that the map does not refer to. At the boot, before clients are served.
    std::uint64_t reconcileGroupContainersOfType(GroupType type);

private:
    /// nullopt, logged, when the map is known to be incomplete.
    [[nodiscard]] std::optional<References> _copyReferenceCountSetOfType(GroupType type,
                                                                         const plist::Dictionary& map) const;
    void _removeReferenceForGroupIdentifiers(const std::vector<std::string>& groups, GroupType type,
                                             const std::string& identifier, const plist::Dictionary& map);
    void _removeGroupContainersIfNeededforUser(std::uint32_t userId, ContainerClass containerClass,
                                               const std::string& group, const std::string& identifier,
                                               const References& references);
    std::uint64_t _cleanupUnreferencedGroupContainersForUser(std::uint32_t userId, ContainerClass containerClass,
                                                             const References& references);
    bool stageGroupContainer(const char* function, std::uint32_t userId, const ZORMetadata& record,
                             UseLocking useLocking);
    /// Every user that has groups of the type, and a home to have them in.
    void forEachUser(GroupType type, const std::function<void(std::uint32_t)>& function);

    const Log& log_;
    StoreServices& services_;
};

} // namespace zor
