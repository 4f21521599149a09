// SPDX-License-Identifier: Apache-2.0
// Scenarios in which containers go: told by their users, with a bundle, or with the last reference to them; and the
// first use of groups.
#include "crash/Scenarios.h"

#include <algorithm>
#include <memory>
#include <stdexcept>

namespace zor::support {

namespace {

constexpr std::uint32_t mobileUser = 501;
constexpr std::uint32_t systemUser = 499;
const std::string app = "com.example.app";

ErrorCode registerApp(Device& device, const std::string& identifier, const plist::Dictionary& entitlements,
                      const plist::Dictionary& options = {}) {
    return device.daemon->composition().entitlements().processEntitlements(&entitlements, &identifier, &options);
}

void mustSucceed(ErrorCode code) {
    if (code != ErrorCode::success)
        throw std::runtime_error("a registration before the first fault failed");
}

plist::Dictionary groupsAndSystemContainer() {
    return {{std::string(entitlementKeys::applicationGroups), plist::Array{"group.app"}},
            {std::string(entitlementKeys::systemGroups), plist::Array{"systemgroup.app"}},
            {std::string(entitlementKeys::systemContainer), true}};
}

using Victims = std::vector<Acknowledged>;

Victims makeVictims(Device& device, const std::vector<Request>& requests) {
    Victims victims;
    for (const Request& request : requests) {
        const auto made = device.daemon->create(request);
        if (!made.acknowledged)
            throw std::runtime_error("no victim");
        victims.push_back(*made.acknowledged);
    }
    return victims;
}

/// An error may leave a container where it is, which is logged and no failure. What counts is what the daemon says.
bool saysTheyAreGone(Device& device, const std::vector<Request>& requests) {
    return std::ranges::all_of(
        requests, [&](const Request& request) { return device.daemon->lookUp(request).code == ErrorCode::notFound; });
}

/// What was acknowledged as gone is gone; anything else is whole or gone, and can be had again.
std::string judgeGone(const std::string& root, bool acted, const std::vector<Request>& requests) {
    MemoryBootMarker marker;
    marker.make();
    platform::LinuxDisk disk;
    StoreDaemon daemon(root, marker, disk, journalEverywhere);
    for (const Request& request : requests) {
        const auto found = daemon.lookUp(request);
        if (acted && found.acknowledged)
            return request.identifier + " was deleted and is back";
        if (!found.acknowledged && found.code != ErrorCode::notFound)
            return request.identifier + " is answered with " + std::to_string(static_cast<int>(found.code));
        if (!daemon.create(request).acknowledged)
            return request.identifier + " cannot be made again: " + daemon.log();
    }
    return "";
}

Scenario going(const std::string& name, const std::vector<Request>& victims, std::function<void(Device&)> prepare,
               std::function<bool(Device&)> act) {
    return {.name = name,
            .prepare =
                [prepare = std::move(prepare)](Device& device) {
                    device.create({"com.example.first", ContainerClass::dataApplication, mobileUser});
                    prepare(device);
                },
            .act = [act = std::move(act),
                    victims](Device& device) { device.acted = act(device) && saysTheyAreGone(device, victims); },
            .requests = {},
            .pointsMin = 2,
            .callsPerStateMax = 2,
            .also = [victims](const std::string& root, bool acted) { return judgeGone(root, acted, victims); }};
}

/// The first of them, in one batch.
bool stage(Device& device, const Victims& victims, std::size_t count) {
    ZORClientConnection::DeletionBatch batch;
    for (std::size_t i = 0; i < count; ++i) {
        const Acknowledged& victim = victims.at(i);
        batch.users.push_back(victim.request.userId);
        batch.uuids.push_back(UUID::parse(victim.uuid));
        batch.identifiers.emplace_back(victim.request.identifier);
        batch.classes.emplace_back(static_cast<std::uint64_t>(victim.request.containerClass));
    }
    return static_cast<bool>(device.daemon->composition().sharedClientConnection()->stageForDeleteContainersWithUsers(
        batch, UseLocking::yes));
}

Scenario deletion() {
    const Request victim{"victim", ContainerClass::dataApplication, mobileUser};
    return going(
        "deletion", {victim}, [victim](Device& device) { (void)makeVictims(device, {victim}); },
        [victim](Device& device) {
            const auto deleted = device.daemon->composition().sharedClientConnection()->deleteContainerForUser(
                victim.userId, &victim.identifier, victim.containerClass, false);
            return deleted || deleted.error().is(ErrorCode::notFound);
        });
}

Scenario deletionOfMany() {
    std::vector<Request> all;
    for (const char* identifier : {"victim.a", "victim.b", "victim.c"})
        all.push_back({identifier, ContainerClass::dataApplication, mobileUser});
    const auto victims = std::make_shared<Victims>();
    return going(
        "deletion of many", all, [victims, all](Device& device) { *victims = makeVictims(device, all); },
        [victims](Device& device) { return stage(device, *victims, victims->size()); });
}

/// The bundle is the last that refers to one group, its child to another.
Scenario deletionOfABundle() {
    const std::vector<Request> named = {{app, ContainerClass::bundleApplication, 33},
                                        {app, ContainerClass::dataApplication, mobileUser}};
    std::vector<Request> all = {{"group.app", ContainerClass::sharedAppGroup, mobileUser},
                                {"systemgroup.child", ContainerClass::sharedSystemGroup, systemUser}};
    all.insert(all.begin(), named.begin(), named.end());
    const auto victims = std::make_shared<Victims>();
    return going(
        "deletion of a bundle", all,
        [victims, all](Device& device) {
            mustSucceed(registerApp(device, app, groupsAndSystemContainer()));
            mustSucceed(registerApp(device, "com.example.child",
                                    {{std::string(entitlementKeys::systemGroups), plist::Array{"systemgroup.child"}}},
                                    {{std::string(ipc::keys::parentBundleIdOption), app}}));
            *victims = makeVictims(device, all);
        },
        [victims, count = named.size()](Device& device) { return stage(device, *victims, count); });
}

/// A registration that drops the last references and the system container.
Scenario release() {
    const std::vector<Request> victims = {{app, ContainerClass::dataSystem, systemUser},
                                          {"group.app", ContainerClass::sharedAppGroup, mobileUser},
                                          {"systemgroup.app", ContainerClass::sharedSystemGroup, systemUser}};
    Scenario scenario = going(
        "release by a registration", victims,
        [victims](Device& device) {
            mustSucceed(registerApp(device, app, groupsAndSystemContainer()));
            (void)makeVictims(device, victims);
        },
        [](Device& device) { return registerApp(device, app, {{"k", 1}}) == ErrorCode::success; });
    scenario.also = [judge = scenario.also](const std::string& root, bool acted) -> std::string {
        std::string complaint = judge(root, acted);
        MemoryBootMarker marker;
        marker.make();
        platform::LinuxDisk disk;
        StoreDaemon daemon(root, marker, disk, journalEverywhere);
        ZOREntitlementMapping& mapping = daemon.composition().entitlements();
        if (complaint.empty() && !mapping.entitlementsExistForIdentifier(app))
            complaint = "the registration is lost";
        if (complaint.empty() && acted && mapping.identifierHasSystemContainer(app))
            complaint = "the registration was acknowledged and is undone";
        return complaint;
    };
    return scenario;
}

Scenario firstUseOfGroups() {
    const std::vector<Request> requests = {{"group.a", ContainerClass::sharedAppGroup, mobileUser},
                                           {"group.b", ContainerClass::sharedAppGroup, mobileUser},
                                           {"systemgroup.a", ContainerClass::sharedSystemGroup, systemUser}};
    return {
        .name = "first use of groups",
        .prepare =
            [](Device& device) {
                mustSucceed(
                    registerApp(device, app,
                                {{std::string(entitlementKeys::applicationGroups), plist::Array{"group.a", "group.b"}},
                                 {std::string(entitlementKeys::systemGroups), plist::Array{"systemgroup.a"}}}));
            },
        .act =
            [requests](Device& device) {
                Composition& composition = device.daemon->composition();
                for (const Request& request : requests) {
                    const auto paths = composition.groups().groupContainerPathsForUser(
                        request.userId, *composition.sharedClientConnection(), &app);
                    const auto path =
                        paths ? paths->find(request.identifier) : ZORGroupManager::Paths::const_iterator();
                    if (!paths || path == paths->end())
                        continue;
                    const auto found = device.daemon->lookUp(request);
                    add(device.promised, {request, path->second, found.acknowledged ? found.acknowledged->uuid : ""});
                }
            },
        .requests = requests};
}

} // namespace

std::vector<Scenario> deletionScenarios() {
    return {deletion(), deletionOfMany(), deletionOfABundle(), release(), firstUseOfGroups()};
}

std::vector<Scenario> deletionScenariosAtHome() {
    return {deletion(), deletionOfABundle(), release(), firstUseOfGroups()};
}

} // namespace zor::support
