// SPDX-License-Identifier: Apache-2.0
#include "crash/Scenarios.h"

#include "crash/Protocols.h"

#include <stdexcept>

namespace zor::support {

namespace {

constexpr std::uint32_t mobileUser = 501;
constexpr std::uint32_t bundleUser = 33;
constexpr std::uint32_t systemUser = 499;
constexpr const char* cachesPath = "/private/var/root/Library/Caches/com.veltra.zorvaned/";

void makeLeftover(Device& device, const std::string& parent, const char* name) {
    const platform::FileDescriptor directory = openBelow(parent);
    const bool made = device.disk->makeDirectory(directory.get(), name, 0755) == 0;
    const platform::FileDescriptor leftover = openBelow(parent + "/" + name);
    const platform::FileDescriptor file(device.disk->createFile(leftover.get(), "file", 0600));
    const std::uint8_t byte = 1;
    if (!made || device.disk->write(file.get(), std::span(&byte, 1)) != 0)
        throw std::runtime_error("no leftover");
}

Scenario creation(const std::string& name, ContainerClass containerClass, std::uint32_t user,
                  const std::string& identifier = "com.example.new") {
    const Request request{identifier, containerClass, user};
    const auto prepare = [](Device& device) {
        device.create({"com.example.first", ContainerClass::dataApplication, mobileUser});
    };
    return {.name = name,
            .prepare = prepare,
            .act = [request](Device& device) { device.create(request); },
            .requests = {request}};
}

Scenario transientAgain() {
    const Request request{"com.example.transient", ContainerClass::dataApplication, mobileUser, true};
    Scenario scenario = creation("transient re-creation", request.containerClass, request.userId);
    scenario.prepare = [request](Device& device) {
        device.create({"com.example.transient", ContainerClass::dataApplication, mobileUser});
        device.daemon->create(request);
    };
    scenario.act = [request](Device& device) { device.create(request); };
    scenario.requests = {request};
    return scenario;
}

std::string victimPath(const std::string& root) {
    const StoreFindings findings = judgeStore(readTree(root, {"run"}), Transients::judged);
    const auto* victim = findings.find(static_cast<std::uint64_t>(ContainerClass::dataApplication), false, "victim");
    return victim == nullptr ? "" : root + "/" + victim->path;
}

Scenario deathRow() {
    const Request victim{"victim", ContainerClass::dataApplication, mobileUser};
    Scenario scenario = creation("death row", victim.containerClass, victim.userId);
    scenario.prepare = [victim](Device& device) {
        device.create({"com.example.first", ContainerClass::dataApplication, mobileUser});
        if (!device.daemon->create(victim).acknowledged)
            throw std::runtime_error("no victim");
    };
    scenario.act = [](Device& device) {
        const auto& client = device.daemon->composition().sharedClientConnection();
        (void)client->_moveItemAtURLToDeathRow(FileURL::directory(victimPath(device.root.path())),
                                               StartDeletionThread::yes);
    };
    scenario.requests = {victim};
    scenario.goesOnAfterErrors = false;
    return scenario;
}

constexpr std::string_view groupsKey = "com.veltra.security.application-groups";

void saveGroup(Device& device, const std::string& group, bool& saved) {
    const plist::Dictionary value{{std::string(groupsKey), plist::Array{plist::Value(group)}}};
    const auto set =
        device.daemon->composition().entitlements()._setEntitlementDictionaryValues({value}, {"com.example.app"});
    saved = static_cast<bool>(set);
}

std::string judgeEntitlements(const std::string& root, bool acted) {
    MemoryBootMarker marker;
    marker.make();
    platform::LinuxDisk disk;
    StoreDaemon daemon(root, marker, disk, journalEverywhere);
    if (daemon.composition().entitlements().lostFile())
        return "the entitlement file was unreadable";
    const auto groups = daemon.composition().entitlements().appGroupIdentifiersForIdentifier("com.example.app");
    if (!groups || groups->size() != 1)
        return "the entitlements are lost";
    if (groups->front() != "group.new" && (acted || groups->front() != "group.old"))
        return "the entitlements were acknowledged and are lost: " + groups->front();
    return "";
}

Scenario entitlementFile() {
    Scenario scenario = creation("entitlement file", ContainerClass::dataApplication, mobileUser);
    scenario.prepare = [](Device& device) {
        bool saved = false;
        saveGroup(device, "group.old", saved);
        if (!saved)
            throw std::runtime_error("the first save failed");
    };
    scenario.act = [](Device& device) { saveGroup(device, "group.new", device.acted); };
    scenario.also = judgeEntitlements;
    return scenario;
}

Scenario launch() {
    const Request kept{"com.example.first", ContainerClass::dataApplication, mobileUser};
    const Request thrownAway{"com.example.transient", ContainerClass::dataApplication, mobileUser, true};
    Scenario scenario = creation("launch after a boot", kept.containerClass, kept.userId);
    scenario.prepare = [thrownAway, kept](Device& device) {
        device.create(kept);
        device.daemon->create(thrownAway);
        const std::string caches = device.root.path() + cachesPath;
        makeLeftover(device, caches + "Staging", "5DB3C5A9-6E4B-4C7C-9C57-1D6C7A1C0001");
        makeLeftover(device, caches + "Dead", "temp.abcdef");
        device.marker.forget();
    };
    scenario.act = [](Device& device) { device.daemon->launch(); };
    scenario.requests = {kept, thrownAway};
    return scenario;
}

} // namespace

std::vector<Scenario> storeScenarios() {
    return {
        creation("creation of a bundle container", ContainerClass::bundleApplication, bundleUser),
        creation("creation of a data container", ContainerClass::dataApplication, mobileUser),
        creation("creation of a group container", ContainerClass::sharedAppGroup, mobileUser),
        creation("creation of a system container", ContainerClass::dataSystem, systemUser),
        creation("creation of a well-known system container", ContainerClass::dataSystem, systemUser,
                 "com.veltra.settingsd"),
        creation("creation of a system group container", ContainerClass::sharedSystemGroup, systemUser),
        transientAgain(),
        deathRow(),
        entitlementFile(),
        launch(),
    };
}

std::vector<Scenario> homeScenarios() {
    return {creation("creation of a data container", ContainerClass::dataApplication, mobileUser), transientAgain(),
            deathRow(), launch()};
}

std::string scenarioName(const ::testing::TestParamInfo<Scenario>& parameter) {
    std::string name;
    for (const char character : parameter.param.name)
        name += character == ' ' || character == '-' ? '_' : character;
    return name;
}

} // namespace zor::support
