// SPDX-License-Identifier: Apache-2.0
// Scenarios in which a container that is there changes: replaced, wiped, mended, renamed, given a value.
#include "crash/Scenarios.h"

#include "crash/Protocols.h"
#include "store/operations/ReplaceJournal.h"

#include <filesystem>
#include <fstream>
#include <memory>
#include <stdexcept>

namespace zor::support {

namespace {

constexpr std::uint32_t mobileUser = 501;

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

Scenario changing(const std::string& name, std::function<void(Device&)> prepare, std::function<void(Device&)> act,
                  std::function<std::string(const std::string&, bool)> also) {
    return {.name = name,
            .prepare = std::move(prepare),
            .act = std::move(act),
            .requests = {},
            .goesOnAfterErrors = false,
            .callsPerStateMax = 2,
            .also = std::move(also)};
}

/// In the class directory, under the identifier that all of them change.
struct Changed {
    std::string content; // "none" without that file, "missing" without the container
    std::string uuid;
    std::string name; // of the directory
};
std::string nameOf(const std::string& path) {
    return path.substr(path.rfind('/') + 1);
}
Changed look(const std::string& root, bool transient = false) {
    const StoreFindings findings = judgeStore(readTree(root, {"run"}), Transients::judged);
    const auto* found =
        findings.find(static_cast<std::uint64_t>(changed.containerClass), transient, changed.identifier);
    if (!found)
        return {"missing", "", ""};
    std::ifstream file(root + "/" + found->path + "/" + contentName);
    std::string content;
    return {std::getline(file, content) ? content : "none", found->uuid, nameOf(found->path)};
}

enum class OldOne : std::uint8_t { none, replaced, replacedAndUuidKept };

ZORClientConnection::ReplaceRequest swap(const std::optional<Acknowledged>& old, const Acknowledged& fresh,
                                         OldOne kind) {
    ZORClientConnection::ReplaceRequest request{.newUuid = uuidOf(fresh),
                                                .userIdOld = mobileUser,
                                                .userIdNew = mobileUser,
                                                .identifierNew = changed.identifier,
                                                .classOld = changed.containerClass,
                                                .classNew = changed.containerClass};
    if (old) {
        request.oldUuid = uuidOf(*old);
        request.identifierOld = changed.identifier;
    }
    if (kind == OldOne::replacedAndUuidKept)
        request.preserveOldUuid = ZORClientConnection::PreserveOldUUID::yes;
    return request;
}

struct Both {
    std::optional<Acknowledged> old;
    Acknowledged fresh;
};

/// The new one in the old one's place. An error of the second move loses the old one; then the new one is where it was.
std::string judgeReplacement(const std::string& root, bool acted, const Both& both, OldOne kind) {
    const Changed now = look(root);
    if (now.content == "new") {
        const std::string& uuid = kind == OldOne::replacedAndUuidKept ? both.old->uuid : both.fresh.uuid;
        if (kind == OldOne::replacedAndUuidKept && now.name != nameOf(both.old->path))
            return "the new one is at " + now.name;
        return now.uuid == uuid ? "" : "the new one has another UUID";
    }
    if (acted)
        return "the content is " + now.content;
    if (now.content == "old")
        return now.uuid == both.old->uuid ? "" : "the old one has another UUID";
    // With none to be replaced, nothing is lost: after a boot, a transient one is made anew.
    const bool whole = now.content == "missing" && (kind == OldOne::none || look(root, true).content == "new");
    return whole ? "" : "the content is " + now.content;
}

Scenario replacement(const std::string& name, OldOne kind) {
    const auto both = std::make_shared<Both>();
    return changing(
        name,
        [both, kind](Device& device) {
            if (kind != OldOne::none)
                both->old = makeWithContent(device, false, "old");
            both->fresh = makeWithContent(device, true, "new");
        },
        [both, kind](Device& device) {
            device.acted = static_cast<bool>(device.daemon->composition().sharedClientConnection()->replaceContainer(
                swap(both->old, both->fresh, kind), StartDeletionThread::no));
        },
        [both, kind](const std::string& root, bool acted) { return judgeReplacement(root, acted, *both, kind); });
}

/// The old container waits in staging, the new one is where it was made, and their journal is on the disk.
struct StoppedReplace {
    FileURL newUrl;
    FileURL destUrl;
};
StoppedReplace stopAfterFirstMove(Device& device) {
    const Acknowledged old = makeWithContent(device, false, "old");
    const Acknowledged fresh = makeWithContent(device, true, "new");
    const UUID uuid = UUID::random();
    StoreServices& services = device.daemon->composition().store();
    const FileURL oldUrl = FileURL::directory(old.path);
    const ReplaceJournal journal{.oldUrl = oldUrl,
                                 .newUrl = FileURL::directory(fresh.path),
                                 .stagingUrl =
                                     services.configuration.stagingDirectory().appendingDirectory(uuid.string()),
                                 .destUrl = oldUrl.deletingLastPathComponent().appendingDirectory(nameOf(fresh.path))};
    const auto written = journal._writeToDiskReplaceAt(
        services.log, services.fileManager, ReplaceJournal::urlFor(services.configuration.replaceDirectory(), uuid));
    if (!written || !services.fileManager.moveItemAtURL(oldUrl, journal.stagingUrl) ||
        device.disk->syncFileSystem(openBelow(journal.stagingUrl.path()).get()) != 0)
        throw std::runtime_error("no stopped replace");
    return {.newUrl = journal.newUrl, .destUrl = journal.destUrl};
}

/// A launch that finds a replace whose first move was made. Whatever stops it, a later one puts the old one back.
Scenario recovery() {
    return changing(
        "recovery of a replace", [](Device& device) { stopAfterFirstMove(device); },
        [](Device& device) { device.daemon->launch(); },
        [](const std::string& root, bool) -> std::string {
            const Changed now = look(root);
            return now.content == "old" ? "" : "the content is " + now.content;
        });
}

/// A launch that finds both moves made, the second by a daemon that was killed before it synced it. Where the power
/// undoes that move, the old one must not be on death row without a journal.
Scenario recoveryOfADoneReplace() {
    const auto stopped = std::make_shared<StoppedReplace>();
    return changing(
        "recovery of a replace that was done", [stopped](Device& device) { *stopped = stopAfterFirstMove(device); },
        [stopped](Device& device) {
            if (device.daemon->composition().store().fileManager.moveItemAtURL(stopped->newUrl, stopped->destUrl))
                device.daemon->launch();
        },
        [](const std::string& root, bool) -> std::string {
            const Changed now = look(root);
            return now.content == "old" || now.content == "new" ? "" : "the content is " + now.content;
        });
}

Scenario structure() {
    const auto container = std::make_shared<Acknowledged>();
    Scenario scenario = changing(
        "repair of the structure",
        [container](Device& device) {
            *container = makeWithContent(device, false, "old");
            if (!device.daemon->composition().sharedClientConnection()->_moveItemAtURLToDeathRow(
                    FileURL::directory(container->path + "/Library/Caches"), StartDeletionThread::yes))
                throw std::runtime_error("nothing is missing");
        },
        [container](Device& device) {
            device.acted = static_cast<bool>(
                device.daemon->composition().sharedClientConnection()->recreateDefaultStructureForUser(
                    {.userId = mobileUser,
                     .uuid = uuidOf(*container),
                     .identifier = changed.identifier,
                     .containerClass = changed.containerClass}));
        },
        [container](const std::string& root, bool acted) -> std::string {
            const std::string path = root + container->path.substr(container->path.find("/private/"));
            std::ifstream file(path + "/" + contentName);
            std::string content;
            if (!std::getline(file, content) || content != "old")
                return "the content is lost";
            const bool mended = std::filesystem::is_directory(path + "/Library/Caches");
            return acted && !mended ? "what was acknowledged is missing" : "";
        });
    // Missing, or made and not yet its owner's.
    scenario.isDamage = [container](const std::string& complaint) {
        const std::string name = container->path.substr(container->path.rfind('/') + 1);
        return complaint.find(name) != std::string::npos && complaint.find("Library/Caches") != std::string::npos;
    };
    scenario.pointsMin = 3;
    return scenario;
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
            const Changed now = look(root);
            if (now.content == "missing" && !acted)
                return ""; // an error of the second move: the old content has gone, as it was to
            if (now.uuid != wiped->uuid)
                return "the UUID changed with the content " + now.content;
            return now.content == "none" || (now.content == "old" && !acted) ? "" : "the content is " + now.content;
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
            const Changed now = look(root);
            if (now.content != "old" || now.uuid != renamed->uuid)
                return "the container is " + now.content;
            return acted && now.name == nameOf(renamed->path) ? "the acknowledged name is undone" : "";
        });
}

} // namespace

std::vector<Scenario> changeScenarios() {
    return {replacement("replace", OldOne::replaced),
            replacement("replace that keeps the UUID", OldOne::replacedAndUuidKept),
            replacement("replace of nothing", OldOne::none),
            recovery(),
            recoveryOfADoneReplace(),
            wiping(),
            structure(),
            infoValue(),
            newDirectoryName()};
}

std::vector<Scenario> changeScenariosAtHome() {
    return {replacement("replace", OldOne::replaced), recovery(), recoveryOfADoneReplace()};
}

} // namespace zor::support
