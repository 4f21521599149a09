// SPDX-License-Identifier: Apache-2.0
// Scenarios in which containers go: told by their users, with a bundle, or with the last reference to them; and the
// first use of groups.
#include "crash/Scenarios.h"

namespace zor::support {

namespace {

const std::string app = "com.example.app";

void mustRegister(Device& device, const std::string& identifier, const plist::Dictionary& entitlements,
                  const plist::Dictionary& options = {}) {
    must(device.daemon->world.entitle(identifier, entitlements, options) == ErrorCode::success,
         "a registration before the first fault failed");
}

plist::Dictionary groupsAndSystemContainer() {
    return entitlements({"group.app"}, {"systemgroup.app"}, true);
}

using Victims = std::vector<Acknowledged>;

/// An error may leave a container where it is, which is logged and no failure. The daemon's word is what counts.
bool saysTheyAreGone(Device& device, const std::vector<Request>& requests) {
    return std::ranges::all_of(
        requests, [&](const Request& request) { return device.daemon->lookUp(request).code == ErrorCode::notFound; });
}

/// A container that was acknowledged as gone is gone; any other is whole or gone, and can be had again.
std::string judgeGone(const std::string& root, bool acted, const std::vector<Request>& requests) {
    LaterDaemon later(root);
    StoreDaemon& daemon = later.daemon;
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

/// `act` does to the victims what takes them away, and says whether that was acknowledged.
Scenario going(const std::string& name, const std::vector<Request>& requests,
               const std::function<void(Device&)>& prepare,
               const std::function<bool(Device&, const Victims& victims)>& act) {
    const auto victims = std::make_shared<Victims>();
    return {.name = name,
            .prepare =
                [=](Device& device) {
                    device.create({"com.example.first", ContainerClass::dataApplication, mobileUser});
                    prepare(device);
                    victims->clear();
                    for (const Request& request : requests)
                        victims->push_back(device.mustCreate(request));
                },
            .act = [=](Device& device) { device.acted = act(device, *victims) && saysTheyAreGone(device, requests); },
            .requests = {},
            .pointsMin = 2,
            .callsPerStateMax = 2,
            .also = [=](const std::string& root, bool acted) { return judgeGone(root, acted, requests); }};
}

void prepareNoMore(Device&) {}

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
    return device.client().stageForDeleteContainersWithUsers(batch, UseLocking::yes).has_value();
}

Scenario deletion() {
    const Request victim{"victim", ContainerClass::dataApplication, mobileUser};
    return going("deletion", {victim}, prepareNoMore, [victim](Device& device, const Victims&) {
        const auto deleted =
            device.client().deleteContainerForUser(victim.userId, &victim.identifier, victim.containerClass, false);
        return deleted || deleted.error().is(ErrorCode::notFound);
    });
}

Scenario deletionOfMany() {
    std::vector<Request> all;
    for (const char* identifier : {"victim.a", "victim.b", "victim.c"})
        all.push_back({identifier, ContainerClass::dataApplication, mobileUser});
    return going("deletion of many", all, prepareNoMore,
                 [](Device& device, const Victims& victims) { return stage(device, victims, victims.size()); });
}

/// The bundle is the last that refers to one group, its child to another.
Scenario deletionOfABundle() {
    return going(
        "deletion of a bundle",
        {{app, ContainerClass::bundleApplication, bundleUser},
         {app, ContainerClass::dataApplication, mobileUser},
         {"group.app", ContainerClass::sharedAppGroup, mobileUser},
         {"systemgroup.child", ContainerClass::sharedSystemGroup, systemUser}},
        [](Device& device) {
            mustRegister(device, app, groupsAndSystemContainer());
            mustRegister(device, "com.example.child", entitlements({}, {"systemgroup.child"}),
                         {{std::string(ipc::keys::parentBundleIdOption), app}});
        },
        [](Device& device, const Victims& victims) { return stage(device, victims, 2); });
}

/// A registration that drops the last references and the system container.
Scenario release() {
    const std::vector<Request> victims = {{app, ContainerClass::dataSystem, systemUser},
                                          {"group.app", ContainerClass::sharedAppGroup, mobileUser},
                                          {"systemgroup.app", ContainerClass::sharedSystemGroup, systemUser}};
    Scenario scenario = going(
        "release by a registration", victims,
        [](Device& device) { mustRegister(device, app, groupsAndSystemContainer()); },
        [](Device& device, const Victims&) {
            return device.daemon->world.entitle(app, plist::Dictionary{{"k", 1}}) == ErrorCode::success;
        });
    scenario.also = [judge = scenario.also](const std::string& root, bool acted) -> std::string {
        std::string complaint = judge(root, acted);
        LaterDaemon later(root);
        if (complaint.empty() && !later.daemon.entitlements().entitlementsExistForIdentifier(app))
            complaint = "the registration is lost";
        if (complaint.empty() && acted && later.daemon.entitlements().identifierHasSystemContainer(app))
            complaint = "the registration was acknowledged and is undone";
        return complaint;
    };
    return scenario;
}

Scenario firstUseOfGroups() {
    const std::vector<Request> requests = {{"group.a", ContainerClass::sharedAppGroup, mobileUser},
                                           {"systemgroup.a", ContainerClass::sharedSystemGroup, systemUser}};
    return {.name = "first use of groups",
            .prepare = [](Device& device) { mustRegister(device, app, entitlements({"group.a"}, {"systemgroup.a"})); },
            .act =
                [requests](Device& device) {
                    Composition& composition = device.daemon->world.services();
                    for (const Request& request : requests) {
                        const auto paths = composition.groups().groupContainerPathsForUser(
                            request.userId, composition.sharedClientConnection()->caller(), &app);
                        if (!paths || !paths->contains(request.identifier))
                            continue;
                        device.promise(request, paths->at(request.identifier));
                    }
                },
            .requests = requests};
}

} // namespace

std::vector<Scenario> deletionScenarios() {
    return {atHome(deletion()), deletionOfMany(), atHome(deletionOfABundle()), atHome(release()),
            atHome(firstUseOfGroups())};
}

} // namespace zor::support
