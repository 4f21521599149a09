// SPDX-License-Identifier: Apache-2.0
#include "crash/Scenarios.h"

#include "crash/Protocols.h"
#include "upcall/packbuff/Packbuff.h"
#include "upcall/packbuff/UpcallMessage.h"

#include <functional>
#include <memory>
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

/// Shared and system containers that no identifier is entitled to go at the next boot.
void entitle(Device& device, const std::vector<Request>& requests) {
    plist::Array appGroups;
    plist::Array systemGroups;
    std::vector<plist::Dictionary> values;
    std::vector<std::string> identifiers;
    for (const Request& request : requests) {
        if (request.containerClass == ContainerClass::dataSystem) {
            values.push_back({{std::string(entitlementKeys::systemContainer), true}});
            identifiers.push_back(request.identifier);
        }
        if (request.containerClass == ContainerClass::sharedAppGroup)
            appGroups.emplace_back(request.identifier);
        if (request.containerClass == ContainerClass::sharedSystemGroup)
            systemGroups.emplace_back(request.identifier);
    }
    values.push_back({{std::string(entitlementKeys::applicationGroups), std::move(appGroups)},
                      {std::string(entitlementKeys::systemGroups), std::move(systemGroups)}});
    identifiers.emplace_back("com.example.groups");
    if (!device.daemon->composition().entitlements()._setEntitlementDictionaryValues(values, identifiers))
        throw std::runtime_error("no entitlements");
}

Scenario creation(const std::string& name, ContainerClass containerClass, std::uint32_t user,
                  const std::string& identifier = "com.example.new") {
    const Request request{identifier, containerClass, user};
    const auto prepare = [request](Device& device) {
        device.create({"com.example.first", ContainerClass::dataApplication, mobileUser});
        entitle(device, {request});
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

void saveGroup(Device& device, const std::string& group, bool& saved) {
    const plist::Dictionary value{{std::string(entitlementKeys::applicationGroups), plist::Array{plist::Value(group)}}};
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

/// What an upcall asks for: one of each kind of container, and two of each kind that there may be several of.
const std::vector<Request>& upcallRequests() {
    static const std::vector<Request> requests = {
        {"com.example.process", ContainerClass::dataApplication, mobileUser},
        {"com.example.system", ContainerClass::dataSystem, systemUser},
        {"group.a", ContainerClass::sharedAppGroup, mobileUser},
        {"group.b", ContainerClass::sharedAppGroup, mobileUser},
        {"systemgroup.a", ContainerClass::sharedSystemGroup, systemUser},
        {"systemgroup.b", ContainerClass::sharedSystemGroup, systemUser},
    };
    return requests;
}

std::uint16_t upcallItemOf(const Request& request) {
    switch (request.containerClass) {
    case ContainerClass::dataSystem:
        return upcall::CM_KERN_REQUEST_SYSTEM_CONTAINER_ID;
    case ContainerClass::sharedAppGroup:
        return upcall::CM_KERN_REQUEST_APP_GROUP_ID;
    case ContainerClass::sharedSystemGroup:
        return upcall::CM_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID;
    default:
        return upcall::CM_KERN_REQUEST_CONTAINER_ID;
    }
}

/// The answers are asked for without a socket; any of them would go through it.
class NoUpcallPort final : public platform::UpcallPort {
public:
    int checkIn() override { return 0; }
    [[nodiscard]] const char* checkInCallName() const override { return "none"; }
    bool serve(platform::RunLoop&, std::function<std::vector<std::uint8_t>(const platform::UpcallPacket&)>) override {
        return true;
    }
    [[nodiscard]] const char* sourceCallName() const override { return "none"; }
};

/// The container paths in the reply to an upcall for all of them, in the reply's order; none unless its status is 1.
std::vector<std::string> upcallPaths(Device& device) {
    const PackbuffPointer packbuff(sb_packbuff_new(256));
    sb_packbuff_pack_uint32(packbuff.get(), upcall::CM_KERN_REQUEST_PERSONA_ID, mobileUser);
    for (const Request& request : upcallRequests())
        sb_packbuff_pack_string(packbuff.get(), upcallItemOf(request), request.identifier.c_str(),
                                static_cast<std::uint32_t>(request.identifier.size()));
    const auto packet = upcall::encodeRequest({sb_packbuff_get_bytes(packbuff.get()), packbuff->bytes_used});
    const NoUpcallPort port;
    UpcallServer server(device.daemon->composition().store(), port);
    const auto answer = server.answer({.bytes = packet, .senderPid = 0, .senderUserId = 0});
    const auto reply = upcall::decodeReply(answer);
    if (!reply || reply->returnCode != upcall::ReturnCode::success || reply->buffer.empty())
        throw std::runtime_error("the upcall is not answered");
    std::vector<std::uint8_t> buffer(reply->buffer.begin(), reply->buffer.end());
    const PackbuffPointer reader(sb_packbuff_init_with_buffer(buffer.data(), buffer.size(), true, packbuffDeallocNone));
    std::vector<std::string> paths;
    std::uint16_t valueType = 0;
    while (sb_packbuff_get_item_value_type(reader.get(), &valueType) != 0) {
        if (valueType == upcall::CM_KERN_REPLY_STATUS) {
            const bool all = sb_packbuff_unpack_uint32(reader.get(), nullptr) == 1;
            return all ? paths : std::vector<std::string>();
        }
        const char* const text = sb_packbuff_unpack_string(reader.get(), nullptr, nullptr);
        if (!text)
            break;
        if (valueType == upcall::CM_KERN_REPLY_DATA_CONTAINER_PATH ||
            valueType == upcall::CM_KERN_REPLY_APP_GROUP_PATH ||
            valueType == upcall::CM_KERN_REPLY_SYSTEM_CONTAINER_PATH ||
            valueType == upcall::CM_KERN_REPLY_SYSTEM_GROUP_PATH)
            paths.emplace_back(text);
    }
    throw std::runtime_error("the reply to the upcall has no status");
}

/// Promises what the reply names. What it names and the daemon does not find afterwards is promised too, and missed.
void makeUpcall(Device& device) {
    const std::vector<std::string> paths = upcallPaths(device);
    if (paths.empty())
        return;
    constexpr std::size_t inReplyOrder[] = {0, 2, 3, 1, 4, 5};
    for (std::size_t i = 0; i < std::size(inReplyOrder); ++i) {
        const Request& request = upcallRequests()[inReplyOrder[i]];
        const auto found = device.daemon->lookUp(request);
        add(device.promised, {request, paths.at(i), found.acknowledged ? found.acknowledged->uuid : ""});
    }
}

Scenario upcallOfSix() {
    Scenario scenario = creation("upcall that creates six containers", ContainerClass::dataApplication, mobileUser);
    scenario.prepare = [](Device& device) { entitle(device, upcallRequests()); };
    scenario.act = makeUpcall;
    scenario.requests = upcallRequests();
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
        creation("creation of a system group container", ContainerClass::sharedSystemGroup, systemUser,
                 "systemgroup.new"),
        transientAgain(),
        deathRow(),
        entitlementFile(),
        launch(),
        upcallOfSix(),
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
