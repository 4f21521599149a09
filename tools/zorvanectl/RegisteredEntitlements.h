// SPDX-License-Identifier: Apache-2.0
// The registered entitlements, as the daemon tells them to the owner of its root.
#pragma once

#include "zorvane/Client.h"

#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace zorvanectl {

// Keys of the status.
inline constexpr const char* statusEntitlements = "Entitlements";
inline constexpr const char* statusGroupReferences = "GroupReferences";
inline constexpr const char* statusEntitlementsLeftOut = "EntitlementsLeftOut";

// Entitlements that decide about containers.
inline constexpr const char* applicationGroupsKey = "com.veltra.security.application-groups";
inline constexpr const char* systemGroupsKey = "com.veltra.security.system-groups";
inline constexpr const char* systemContainerKey = "com.veltra.security.system-container";
/// So do the keys that the map keeps for itself.
inline constexpr std::string_view ownKeysBegin = "com.veltra.Zorvane.";
/// The map's own dictionary of parents to children.
inline constexpr const char* childrenKey = "com.veltra.Zorvane.ChildPluginBundleIDs";

class RegisteredEntitlements {
public:
    /// An error when this program may not see them.
    [[nodiscard]] static zorvane::Result<RegisteredEntitlements> ask(const zorvane::ConnectOptions& connect);

    /// For which something is registered, in order.
    [[nodiscard]] std::vector<std::string> identifiers() const;
    /// nullptr when nothing is registered.
    [[nodiscard]] const zorvane::Map* of(const std::string& identifier) const;
    [[nodiscard]] bool hasSystemContainer(const std::string& identifier) const;
    [[nodiscard]] std::vector<std::string> childrenOf(const std::string& identifier) const;

    struct Group {
        std::string identifier;
        /// The identifiers that list the group, once for each time.
        std::vector<std::string> holders;
    };
    enum class GroupKind { application, system };
    static constexpr std::pair<GroupKind, const char*> groupKinds[] = {{GroupKind::application, "application"},
                                                                       {GroupKind::system, "system"}};
    /// All that are referred to.
    [[nodiscard]] std::vector<Group> groups(GroupKind kind) const;
    /// The groups of this kind that an identifier refers to.
    [[nodiscard]] std::vector<Group> groupsOf(const std::string& identifier, GroupKind kind) const;

private:
    explicit RegisteredEntitlements(zorvane::Map status) : status_(std::move(status)) {}
    [[nodiscard]] const zorvane::Map* map(const char* key) const;
    zorvane::Map status_;
};

} // namespace zorvanectl
