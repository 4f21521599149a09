// SPDX-License-Identifier: Apache-2.0
#include "crash/Scenarios.h"

#include "crash/Protocols.h"
#include "upcall/packbuff/Packbuff.h"
#include "upcall/packbuff/UpcallMessage.h"

#include <fstream>
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

// What changes a container that is there. Its identifier, and the file that tells its content from another's.
const Request changed{"com.example.changed", ContainerClass::dataApplication, mobileUser};
constexpr const char* contentName = "content";

void writeContent(Device& device, const std::string& container, const std::string& text) {
    const platform::FileDescriptor directory = openBelow(container);
    const platform::FileDescriptor file(device.disk->createFile(directory.get(), contentName, 0600));
    const std::vector<std::uint8_t> bytes(text.begin(), text.end());
    if (device.disk->write(file.get(), bytes) != 0 || device.disk->sync(file.get()) != 0 ||
        device.disk->sync(directory.get()) != 0)
        throw std::runtime_error("no content");
}

/// Made with a content, and not promised: what is done to it takes it away or changes its place.
Acknowledged makeWithContent(Device& device, bool transient, const std::string& content) {
    Request request = changed;
    request.transient = transient;
    const auto made = device.daemon->create(request);
    if (!made.acknowledged)
        throw std::runtime_error("no container to be changed");
    writeContent(device, made.acknowledged->path, content);
    return *made.acknowledged;
}

UUID uuidOf(const Acknowledged& container) {
    return UUID::parse(container.uuid).value();
}

/// The content of the live container; "none" without that file, "missing" without the container.
std::string contentOfChanged(const std::string& root, std::string* uuid = nullptr) {
    const StoreFindings findings = judgeStore(readTree(root, {"run"}), Transients::ignored);
    const auto* found = findings.find(static_cast<std::uint64_t>(changed.containerClass), false, changed.identifier);
    if (!found)
        return "missing";
    if (uuid)
        *uuid = found->uuid;
    std::ifstream file(root + "/" + found->path + "/" + contentName);
    std::string content;
    return std::getline(file, content) ? content : "none";
}

Scenario changing(const std::string& name, std::function<void(Device&)> prepare, std::function<void(Device&)> act,
                  std::function<std::string(const std::string&, bool)> also) {
    return {.name = name,
            .prepare = std::move(prepare),
            .act = std::move(act),
            .requests = {},
            .goesOnAfterErrors = false,
            .also = std::move(also)};
}

/// The new one in the old one's place. An error of the second move loses the old one; then the new one is where it was.
Scenario replacement() {
    struct Both {
        Acknowledged old;
        Acknowledged fresh;
    };
    const auto both = std::make_shared<Both>();
    return changing(
        "replace",
        [both](Device& device) {
            both->old = makeWithContent(device, false, "old");
            both->fresh = makeWithContent(device, true, "new");
        },
        [both](Device& device) {
            device.acted = static_cast<bool>(device.daemon->composition().sharedClientConnection()->replaceContainer(
                {.oldUuid = uuidOf(both->old),
                 .newUuid = uuidOf(both->fresh),
                 .userIdOld = mobileUser,
                 .userIdNew = mobileUser,
                 .identifierOld = changed.identifier,
                 .identifierNew = changed.identifier,
                 .classOld = changed.containerClass,
                 .classNew = changed.containerClass},
                StartDeletionThread::no));
        },
        [](const std::string& root, bool acted) -> std::string {
            const std::string content = contentOfChanged(root);
            if (content == "new" || (content == "old" && !acted))
                return "";
            const StoreFindings findings = judgeStore(readTree(root, {"run"}), Transients::judged);
            const bool freshIsThere =
                findings.find(static_cast<std::uint64_t>(changed.containerClass), true, changed.identifier) != nullptr;
            return content == "missing" && !acted && freshIsThere ? "" : "the content is " + content;
        });
}

Scenario wiping() {
    const auto wiped = std::make_shared<Acknowledged>();
    return changing(
        "wipe", [wiped](Device& device) { *wiped = makeWithContent(device, false, "old"); },
        [](Device& device) {
            device.acted = static_cast<bool>(
                device.daemon->composition().sharedClientConnection()->deleteDataContainerContentForUser(
                    mobileUser, &changed.identifier, changed.containerClass));
        },
        [wiped](const std::string& root, bool acted) -> std::string {
            std::string uuid;
            const std::string content = contentOfChanged(root, &uuid);
            if (content == "missing" && !acted)
                return ""; // an error of the second move: the old content has gone, as it was to
            if (uuid != wiped->uuid)
                return "the UUID changed with the content " + content;
            return content == "none" || (content == "old" && !acted) ? "" : "the content is " + content;
        });
}

Scenario infoValue() {
    const auto container = std::make_shared<Acknowledged>();
    const auto set = [container](Device& device, const char* text) {
        const std::string key = "key";
        const plist::Value value(text);
        return static_cast<bool>(device.daemon->composition().sharedClientConnection()->setInfoValue(
            &value, &key,
            {.userId = mobileUser,
             .uuid = uuidOf(*container),
             .identifier = changed.identifier,
             .containerClass = changed.containerClass},
            UseLocking::yes));
    };
    return changing(
        "info value",
        [container, set](Device& device) {
            *container = makeWithContent(device, false, "old");
            add(device.promised, *container);
            if (!set(device, "old"))
                throw std::runtime_error("the first value was not set");
        },
        [set](Device& device) { device.acted = set(device, "new"); },
        [container](const std::string& root, bool acted) -> std::string {
            MemoryBootMarker marker;
            marker.make();
            platform::LinuxDisk disk;
            StoreDaemon daemon(root, marker, disk, journalEverywhere);
            const std::string key = "key";
            const auto value = daemon.composition().sharedClientConnection()->infoValueForKey(
                &key,
                {.userId = mobileUser,
                 .uuid = uuidOf(*container),
                 .identifier = changed.identifier,
                 .containerClass = changed.containerClass},
                UseLocking::yes);
            if (value && (*value == plist::Value("new") || (!acted && *value == plist::Value("old"))))
                return "";
            return value ? "the value is " + plist::describe(&*value) : "the value is lost";
        });
}

Scenario newDirectoryName() {
    const auto renamed = std::make_shared<Acknowledged>();
    return changing(
        "new directory name", [renamed](Device& device) { *renamed = makeWithContent(device, false, "old"); },
        [renamed](Device& device) {
            device.acted =
                static_cast<bool>(device.daemon->composition().sharedClientConnection()->regenerateDirectoryUUIDForUser(
                    {.userId = mobileUser,
                     .uuid = uuidOf(*renamed),
                     .identifier = changed.identifier,
                     .containerClass = changed.containerClass}));
        },
        [renamed](const std::string& root, bool acted) -> std::string {
            std::string uuid;
            const std::string content = contentOfChanged(root, &uuid);
            if (content != "old" || uuid != renamed->uuid)
                return "the container is " + content;
            const std::string before = renamed->path.substr(renamed->path.rfind('/') + 1);
            const StoreFindings findings = judgeStore(readTree(root, {"run"}), Transients::ignored);
            const auto* found =
                findings.find(static_cast<std::uint64_t>(changed.containerClass), false, changed.identifier);
            return acted && found->path.ends_with(before) ? "the acknowledged name is undone" : "";
        });
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
        replacement(),
        wiping(),
        infoValue(),
        newDirectoryName(),
    };
}

std::vector<Scenario> homeScenarios() {
    return {creation("creation of a data container", ContainerClass::dataApplication, mobileUser), transientAgain(),
            deathRow(), launch(), replacement()};
}

std::string scenarioName(const ::testing::TestParamInfo<Scenario>& parameter) {
    std::string name;
    for (const char character : parameter.param.name)
        name += character == ' ' || character == '-' ? '_' : character;
    return name;
}

} // namespace zor::support
