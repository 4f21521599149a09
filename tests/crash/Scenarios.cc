// SPDX-License-Identifier: Apache-2.0
#include "crash/Scenarios.h"

#include "support/FaultDisk.h"
#include "support/Files.h"
#include "support/LongRun.h"

#include <iterator>
#include <stdexcept>

namespace zor::support {

namespace {

constexpr const char* cachesPath = "/private/var/root/Library/Caches/com.veltra.zorvaned/";

void makeLeftover(Device& device, const std::string& parent, const char* name) {
    const platform::FileDescriptor directory = openDirectory(parent);
    const bool made = !device.disk->makeDirectory(directory.get(), name, 0755);
    const platform::FileDescriptor leftover = openDirectory(directory.get(), name);
    const auto file = device.disk->createFile(leftover.get(), "file", 0600);
    must(made && file && !device.disk->write(file->get(), bytesOf("x")), "no leftover");
}

/// A shared or system container that no identifier is entitled to goes at the next boot.
void entitle(Device& device, const Request& request) {
    const auto namedBy = [&](ContainerClass containerClass) {
        return request.containerClass == containerClass ? plist::Array{request.identifier} : plist::Array{};
    };
    const auto entitled =
        entitlements(namedBy(ContainerClass::sharedAppGroup), namedBy(ContainerClass::sharedSystemGroup),
                     request.containerClass == ContainerClass::dataSystem);
    must(device.daemon->world.entitle(request.identifier, entitled) == ErrorCode::success, "no entitlements");
}

Scenario scenarioOf(const std::string& name, std::function<void(Device&)> prepare, std::function<void(Device&)> act,
                    const std::vector<Request>& requests) {
    return {.name = name, .prepare = std::move(prepare), .act = std::move(act), .requests = requests};
}

Scenario creation(const std::string& name, ContainerClass containerClass, std::uint32_t user,
                  const std::string& identifier = "com.example.new") {
    const Request request{identifier, containerClass, user};
    Scenario scenario = scenarioOf(
        "creation of a " + name + " container",
        [request](Device& device) {
            device.create({"com.example.first", ContainerClass::dataApplication, mobileUser});
            entitle(device, request);
        },
        [request](Device& device) { device.create(request); }, {request});
    scenario.afterOneError = [](const std::string& root) -> std::string {
        const auto staged = judgeStore(readTree(root, {"run"}), Transients::ignored).staging;
        return staged.empty() ? "" : staged.front() + " is left in staging";
    };
    return scenario;
}

/// A client whose daemon was killed between the move of a new container and its sync asks the next daemon again, and is
/// told of what that one finds.
Scenario lookupAfterAKill() {
    const Request request{"com.example.killed", ContainerClass::dataApplication, mobileUser};
    return scenarioOf(
        "look-up after a kill", [](Device&) {},
        [request](Device& device) {
            FaultDisk killing(*device.disk);
            device.restart(killing);
            killing.arm({.kind = FaultKind::stop, .filter = [moved = false](const DiskCallInfo& info) mutable {
                             const bool isMove = info.call == DiskCall::rename;
                             return std::exchange(moved, moved || isMove) && !isMove;
                         }});
            try {
                device.create(request);
            } catch (const ProcessStopped&) {
                device.daemon.reset();
            }
            device.restart(*device.disk);
            device.create(request);
        },
        {request});
}

Scenario transientAgain() {
    const Request request{"com.example.transient", ContainerClass::dataApplication, mobileUser, true};
    return scenarioOf(
        "transient re-creation",
        [request](Device& device) {
            device.create({"com.example.transient", ContainerClass::dataApplication, mobileUser});
            (void)device.mustCreate(request);
        },
        [request](Device& device) { device.create(request); }, {request});
}

std::string victimPath(const std::string& root) {
    const StoreFindings findings = judgeStore(readTree(root, {"run"}), Transients::judged);
    const auto* victim = findings.find(static_cast<std::uint64_t>(ContainerClass::dataApplication), false, "victim");
    return victim == nullptr ? "" : root + "/" + victim->path;
}

Scenario deathRow() {
    const Request victim{"victim", ContainerClass::dataApplication, mobileUser};
    Scenario scenario = scenarioOf(
        "death row",
        [victim](Device& device) {
            device.create({"com.example.first", ContainerClass::dataApplication, mobileUser});
            (void)device.mustCreate(victim);
        },
        [](Device& device) {
            (void)device.client()._moveItemAtURLToDeathRow(FileURL::directory(victimPath(device.root.path())),
                                                           StartDeletionThread::yes);
        },
        {victim});
    scenario.goesOnAfterErrors = false;
    return scenario;
}

bool saveGroup(Device& device, const std::string& group) {
    return device.daemon->world.entitle("com.example.app", entitlements({group})) == ErrorCode::success;
}

std::string judgeEntitlements(const std::string& root, bool acted) {
    LaterDaemon later(root);
    if (later.daemon.entitlements().lostFile())
        return "the entitlement file was unreadable";
    const auto groups = later.daemon.entitlements().appGroupIdentifiersForIdentifier("com.example.app");
    if (!groups || groups->size() != 1)
        return "the entitlements are lost";
    if (groups->front() != "group.new" && (acted || groups->front() != "group.old"))
        return "the entitlements were acknowledged and are lost: " + groups->front();
    return "";
}

Scenario entitlementFile() {
    Scenario scenario = scenarioOf(
        "entitlement file",
        [](Device& device) {
            must(saveGroup(device, "group.gone"), "the first save failed");
            // A launch without a boot makes the directories that it lies in: it finds nothing for which it would sync
            // all.
            const FileURL library = device.daemon->world.services().configuration().libraryDirectory();
            must(device.client()._moveItemAtURLToDeathRow(library, StartDeletionThread::yes).has_value(), "it stays");
            device.restart(*device.disk);
            must(saveGroup(device, "group.old"), "the second save failed");
        },
        [](Device& device) { device.acted = saveGroup(device, "group.new"); },
        {{"com.example.new", ContainerClass::dataApplication, mobileUser}});
    scenario.also = judgeEntitlements;
    return scenario;
}

Scenario launch() {
    const Request kept{"com.example.first", ContainerClass::dataApplication, mobileUser};
    const Request thrownAway{"com.example.transient", ContainerClass::dataApplication, mobileUser, true};
    return scenarioOf(
        "launch after a boot",
        [thrownAway, kept](Device& device) {
            device.create(kept);
            (void)device.mustCreate(thrownAway);
            const std::string caches = device.root.path() + cachesPath;
            makeLeftover(device, caches + "Staging", "5DB3C5A9-6E4B-4C7C-9C57-1D6C7A1C0001");
            makeLeftover(device, caches + "Dead", "temp.abcdef");
            device.marker.forget();
        },
        [](Device& device) { device.daemon->launch(); }, {kept, thrownAway});
}

} // namespace

plist::Dictionary entitlements(plist::Array appGroups, plist::Array systemGroups, bool systemContainer) {
    plist::Dictionary all;
    if (!appGroups.empty())
        all.set(entitlementKeys::applicationGroups, std::move(appGroups));
    if (!systemGroups.empty())
        all.set(entitlementKeys::systemGroups, std::move(systemGroups));
    if (systemContainer)
        all.set(entitlementKeys::systemContainer, true);
    return all;
}

void must(bool happened, const char* what) {
    if (!happened)
        throw std::runtime_error(what);
}

std::vector<Scenario> storeScenarios() {
    return {
        creation("bundle", ContainerClass::bundleApplication, bundleUser),
        atHome(creation("data", ContainerClass::dataApplication, mobileUser)),
        creation("group", ContainerClass::sharedAppGroup, mobileUser),
        creation("system", ContainerClass::dataSystem, systemUser),
        creation("well-known system", ContainerClass::dataSystem, systemUser, "com.veltra.settingsd"),
        creation("system group", ContainerClass::sharedSystemGroup, systemUser, "systemgroup.new"),
        atHome(lookupAfterAKill()),
        atHome(transientAgain()),
        atHome(deathRow()),
        entitlementFile(),
        atHome(launch()),
    };
}

Scenario atHome(Scenario scenario) {
    scenario.worksAtHome = true;
    return scenario;
}

std::vector<Scenario> allScenarios() {
    std::vector<Scenario> all = storeScenarios();
    std::ranges::move(changeScenarios(), std::back_inserter(all));
    std::ranges::move(deletionScenarios(), std::back_inserter(all));
    return all;
}

std::vector<Scenario> homeScenarios(const std::set<std::string>& always) {
    std::vector<Scenario> atHome = allScenarios();
    std::erase_if(atHome, [&](const Scenario& scenario) {
        return !scenario.worksAtHome || (!isLongRun() && !always.contains(scenario.name));
    });
    return atHome;
}

std::string scenarioName(const ::testing::TestParamInfo<Scenario>& parameter) {
    std::string name = parameter.param.name;
    std::ranges::replace_if(name, [](char character) { return character == ' ' || character == '-'; }, '_');
    return name;
}

} // namespace zor::support
