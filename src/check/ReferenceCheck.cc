// SPDX-License-Identifier: Apache-2.0
// Shared and system containers against the entitlements that keep them.
#include "check/Checks.h"

#include "base/ContainerClass.h"
#include "store/EntitlementFile.h"

#include <algorithm>
#include <cerrno>

namespace zor::check {

void ReferenceCheck::checkAll() {
    const auto map = readMap();
    if (!map)
        return;
    checkGroups(*map, false);
    checkGroups(*map, true);
    checkSystemContainers(*map);
}

std::optional<plist::Dictionary> ReferenceCheck::readMap() {
    ZORFileManager& fileManager = look_.device().fileManager();
    const FileURL file = look_.device().places().entitlementFile();
    const FileURL aside = look_.device().places().unreadableEntitlementFile();
    const bool lost = !fileManager.itemDoesNotExistAtURL(aside);
    if (lost)
        // No command removes it: that accepts the loss, and what was lost has to be registered before.
        look_.addForPerson(FindingCode::entitlementsAside, aside, "holds entitlements that could not be read",
                           "zorvanectl explain " + std::string(pageOf(FindingCode::entitlementsAside).word));
    auto map = readEntitlementFile(file, fileManager);
    if (!map && map.error().isPosix(ENOENT))
        return lost ? std::nullopt : std::optional(plist::Dictionary());
    if (!map) {
        look_.add(FindingCode::entitlementsUnreadable, file,
                  map.error().isPosix(EPERM) ? "is not the daemon's alone: its owner, its permissions or a second name"
                                             : map.error().description().value_or("cannot be read"),
                  Mender::launch);
        return std::nullopt;
    }
    return lost ? std::nullopt : std::optional(std::move(*map));
}

void ReferenceCheck::checkGroups(const plist::Dictionary& map, bool system) {
    const ContainerClass containerClass = system ? ContainerClass::sharedSystemGroup : ContainerClass::sharedAppGroup;
    const auto references = groupReferencesIn(map, system ? GroupType::system : GroupType::application, nullptr);
    std::set<std::string, std::less<>> made;
    for (const auto& [place, containers] : look_.sharedContainers) {
        if (place.first != containerClass)
            continue;
        for (const auto& [group, url] : containers) {
            made.insert(group);
            if (references.contains(group))
                continue;
            Finding& finding = look_.add(FindingCode::groupUnreferenced, url,
                                         "belongs to a group that is in nobody's entitlements", Mender::boot);
            finding.containerClass = containerClass;
            finding.user = place.second;
            finding.identifier = group;
        }
    }
    for (const auto& [group, holders] : references) {
        // A list may name what can never have a container.
        if (made.contains(group) || (system && !group.starts_with(systemGroupPrefix)))
            continue;
        Finding& finding = look_.add(FindingCode::groupNotMade, look_.device().places().entitlementFile(),
                                     "names the group " + group + ", which has no container yet", Mender::nobody);
        finding.containerClass = containerClass;
        finding.identifier = group;
    }
}

void ReferenceCheck::checkSystemContainers(const plist::Dictionary& map) {
    const auto found = look_.sharedContainers.find({ContainerClass::dataSystem, look_.device().users().system});
    if (found == look_.sharedContainers.end())
        return;
    for (const auto& [identifier, url] : found->second) {
        if (ownsSystemContainer(map, identifier))
            continue;
        Finding& finding = look_.add(FindingCode::systemUnentitled, url,
                                     "belongs to an identifier that is not entitled to it", Mender::boot);
        finding.containerClass = ContainerClass::dataSystem;
        finding.user = look_.device().users().system;
        finding.identifier = identifier;
    }
}

} // namespace zor::check
