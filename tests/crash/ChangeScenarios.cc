// SPDX-License-Identifier: Apache-2.0
// Scenarios in which a container that is there changes: replaced, wiped, mended, renamed, given a value.
#include "crash/Scenarios.h"

#include "store/ReplaceJournal.h"
#include "support/Files.h"

namespace zor::support {

namespace {

using test::nameOf;

// The container that the scenarios change: its identifier, and the file that tells its content from another's.
const Request changed{"com.example.changed", ContainerClass::dataApplication, mobileUser};
constexpr const char* contentName = "content";

/// Made with a content, and not promised.
Acknowledged makeWithContent(Device& device, bool transient, const std::string& content) {
    Request request = changed;
    request.transient = transient;
    const Acknowledged made = device.mustCreate(request);
    const platform::FileDescriptor directory = openDirectory(made.path);
    const auto file = device.disk->createFile(directory.get(), contentName, 0600);
    must(file && !device.disk->write(file->get(), bytesOf(content)) && !device.disk->sync(file->get()) &&
             !device.disk->sync(directory.get()),
         "no content");
    return made;
}

UUID uuidOf(const Acknowledged& container) {
    return UUID::parse(container.uuid).value();
}

ZORClientConnection::ContainerAddress addressOf(const Acknowledged& container) {
    return {.userId = mobileUser,
            .uuid = uuidOf(container),
            .identifier = changed.identifier,
            .containerClass = changed.containerClass};
}

/// `old` is a container with the content "old", there before `prepare`. `act` says whether its change was acknowledged.
using Prepare = std::function<void(Device&, const Acknowledged& old)>;
using Act = std::function<bool(Device&, const Acknowledged& old)>;
using Also = std::function<std::string(const std::string& root, bool acted, const Acknowledged& old)>;
Scenario changing(const std::string& name, const Prepare& prepare, const Act& act, const Also& also) {
    const auto old = std::make_shared<Acknowledged>();
    return {.name = name,
            .prepare =
                [=](Device& device) {
                    *old = makeWithContent(device, false, "old");
                    prepare(device, *old);
                },
            .act = [=](Device& device) { device.acted = act(device, *old); },
            .requests = {},
            .goesOnAfterErrors = false,
            .callsPerStateMax = 2,
            .also = [=](const std::string& root, bool acted) { return also(root, acted, *old); }};
}

void prepareNothing(Device&, const Acknowledged&) {}

/// In the class directory, under the identifier that all of them change.
struct Changed {
    std::string content; // "none" without that file, "missing" without the container
    std::string uuid;
    std::string name; // of the directory
};
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

ZORClientConnection::ReplaceRequest swap(const Acknowledged& old, const Acknowledged& fresh, OldOne kind) {
    ZORClientConnection::ReplaceRequest request{.newUuid = uuidOf(fresh),
                                                .userIdOld = mobileUser,
                                                .userIdNew = mobileUser,
                                                .identifierNew = changed.identifier,
                                                .classOld = changed.containerClass,
                                                .classNew = changed.containerClass};
    if (kind != OldOne::none) {
        request.oldUuid = uuidOf(old);
        request.identifierOld = changed.identifier;
    }
    if (kind == OldOne::replacedAndUuidKept)
        request.preserveOldUuid = ZORClientConnection::PreserveOldUUID::yes;
    return request;
}

/// The new one in the old one's place. An error of the second move loses the old one; then the new one is where it was.
std::string judgeReplacement(const std::string& root, bool acted, const Acknowledged& old, const Acknowledged& fresh,
                             OldOne kind) {
    const Changed now = look(root);
    if (now.content == "new") {
        const bool keepsUuid = kind == OldOne::replacedAndUuidKept;
        if (keepsUuid && now.name != nameOf(old.path))
            return "the new one is at " + now.name;
        return now.uuid == (keepsUuid ? old : fresh).uuid ? "" : "the new one has another UUID";
    }
    if (acted)
        return "the content is " + now.content;
    if (now.content == "old")
        return now.uuid == old.uuid ? "" : "the old one has another UUID";
    // With none to be replaced, nothing is lost: after a boot, a transient one is made anew.
    const bool whole = now.content == "missing" && (kind == OldOne::none || look(root, true).content == "new");
    return whole ? "" : "the content is " + now.content;
}

Scenario replacement(const std::string& name, OldOne kind, bool exchanges = true) {
    const auto fresh = std::make_shared<Acknowledged>();
    const auto makeFresh = [=](Device& device) { *fresh = makeWithContent(device, true, "new"); };
    Scenario scenario = changing(
        name, [=](Device& device, const Acknowledged&) { makeFresh(device); },
        [=](Device& device, const Acknowledged& old) {
            return device.client().replaceContainer(swap(old, *fresh, kind), StartDeletionThread::no).has_value();
        },
        [=](const std::string& root, bool acted, const Acknowledged& old) {
            return judgeReplacement(root, acted, old, *fresh, kind);
        });
    if (kind == OldOne::none)
        scenario.prepare = makeFresh;
    scenario.exchanges = exchanges;
    scenario.afterOneError = [=](const std::string& root) -> std::string {
        const Changed waiting = look(root, true);
        return waiting.content == "missing" || waiting.uuid == fresh->uuid ? "" : "the new one has the old one's UUID";
    };
    return scenario;
}

/// The new one is deleted when it has the old one's place and the old one's file system has forgotten that: neither
/// comes back, nor a journal that nothing can be found for.
Scenario replacementAndDeletion() {
    Scenario scenario = replacement("replace and deletion", OldOne::replaced, false);
    scenario.act = [replace = scenario.act](Device& device) {
        replace(device);
        ZORClientConnection& client = device.client();
        device.acted = std::exchange(device.acted, false) && device.daemon->world.pass() == ErrorCode::success &&
                       client.deleteContainerForUser(mobileUser, &changed.identifier, changed.containerClass, false) &&
                       device.daemon->lookUp(changed).code == ErrorCode::notFound &&
                       device.daemon->world.pass() == ErrorCode::success;
    };
    scenario.afterOneError = nullptr;
    scenario.also = [](const std::string& root, bool acted) -> std::string {
        return acted && look(root).content != "missing" ? "a container came back" : "";
    };
    return scenario;
}

/// The old container waits in staging, the new one is where it was made, and their journal is on the disk.
struct StoppedReplace {
    FileURL newUrl;
    FileURL destUrl;
};
StoppedReplace stopAfterFirstMove(Device& device, const Acknowledged& old, OldOne kind) {
    const Acknowledged fresh = makeWithContent(device, true, "new");
    const UUID uuid = UUID::random();
    Composition& services = device.daemon->world.services();
    const FileURL oldUrl = FileURL::directory(old.path);
    const bool keepsUuid = kind == OldOne::replacedAndUuidKept;
    if (keepsUuid) {
        const auto record =
            services.cache().containerForUser(mobileUser, changed.containerClass, &changed.identifier, true).value();
        record->setUuid(uuidOf(old));
        must(record->writeMetadataToDiskWithError(services.log(), services.defaultManager()).has_value(),
             "no old UUID");
    }
    const ReplaceJournal journal{
        .oldUrl = oldUrl,
        .newUrl = FileURL::directory(fresh.path),
        .stagingUrl = services.configuration().stagingDirectory().appendingDirectory(uuid.string()),
        .destUrl = keepsUuid ? oldUrl : oldUrl.deletingLastPathComponent().appendingDirectory(nameOf(fresh.path))};
    const auto written =
        journal._writeToDiskReplaceAt(services.log(), services.defaultManager(),
                                      ReplaceJournal::urlFor(services.configuration().replaceDirectory(), uuid));
    must(written && services.defaultManager().moveItemAtURL(oldUrl, journal.stagingUrl) &&
             !device.disk->syncFileSystem(openDirectory(journal.stagingUrl.path()).get()),
         "no stopped replace");
    return {.newUrl = journal.newUrl, .destUrl = journal.destUrl};
}

/// A launch that finds a replace whose first move was made: whatever stops it, a later one puts the old one back. Or
/// one that finds both moves made, the second by a daemon that was killed before it synced it: where the power undoes
/// that move, the old one must not be on death row without a journal.
Scenario recovery(const std::string& name, OldOne kind, bool isDone = false) {
    const auto stopped = std::make_shared<StoppedReplace>();
    return changing((isDone ? "recovery of a done " : "recovery of a ") + name,
                    [=](Device& device, const Acknowledged& old) { *stopped = stopAfterFirstMove(device, old, kind); },
                    [=](Device& device, const Acknowledged&) {
                        if (!isDone || device.daemon->world.services().defaultManager().moveItemAtURL(stopped->newUrl,
                                                                                                      stopped->destUrl))
                            device.daemon->launch();
                        return true;
                    },
                    [=](const std::string& root, bool, const Acknowledged& old) -> std::string {
                        const Changed now = look(root);
                        const bool isOld = now.content == "old" && now.name == nameOf(old.path) && now.uuid == old.uuid;
                        const bool isNew =
                            isDone && now.content == "new" && (now.uuid == old.uuid) == (kind != OldOne::replaced);
                        return isOld || isNew ? "" : "the content is " + now.content + " under " + now.uuid;
                    });
}

Scenario structure() {
    const auto name = std::make_shared<std::string>();
    Scenario scenario = changing(
        "repair of the structure",
        [name](Device& device, const Acknowledged& old) {
            *name = nameOf(old.path);
            const FileURL caches = FileURL::directory(old.path + "/Library/Caches");
            must(device.client()._moveItemAtURLToDeathRow(caches, StartDeletionThread::yes).has_value(),
                 "nothing is missing");
        },
        [](Device& device, const Acknowledged& old) {
            return device.client().recreateDefaultStructureForUser(addressOf(old)).has_value();
        },
        [](const std::string& root, bool acted, const Acknowledged& old) -> std::string {
            const std::string path = root + old.path.substr(old.path.find("/private/"));
            std::ifstream file(path + "/" + contentName);
            std::string content;
            if (!std::getline(file, content) || content != "old")
                return "the content is lost";
            const bool mended = std::filesystem::is_directory(path + "/Library/Caches");
            return acted && !mended ? "what was acknowledged is missing" : "";
        });
    // Missing, or made and not yet its owner's.
    scenario.isDamage = [name](const std::string& complaint) {
        return complaint.find(*name) != std::string::npos && complaint.find("Library/Caches") != std::string::npos;
    };
    scenario.pointsMin = 3;
    return scenario;
}

Scenario wiping() {
    return changing(
        "wipe", prepareNothing,
        [](Device& device, const Acknowledged&) {
            return device.client()
                .deleteDataContainerContentForUser(mobileUser, &changed.identifier, changed.containerClass)
                .has_value();
        },
        [](const std::string& root, bool acted, const Acknowledged& old) -> std::string {
            const Changed now = look(root);
            if (now.content == "missing" && !acted)
                return ""; // an error of the second move: the old content has gone, as it was to
            if (now.uuid != old.uuid)
                return "the UUID changed with the content " + now.content;
            return now.content == "none" || (now.content == "old" && !acted) ? "" : "the content is " + now.content;
        });
}

const std::string infoKey = "key";

bool setInfo(Device& device, const Acknowledged& container, const char* text) {
    const plist::Value value(text);
    return device.client().setInfoValue(&value, &infoKey, addressOf(container), UseLocking::yes).has_value();
}

Scenario infoValue() {
    return changing(
        "info value",
        [](Device& device, const Acknowledged& old) {
            add(device.promised, old);
            must(setInfo(device, old, "old"), "the first value was not set");
        },
        [](Device& device, const Acknowledged& old) { return setInfo(device, old, "new"); },
        [](const std::string& root, bool acted, const Acknowledged& old) -> std::string {
            LaterDaemon later(root);
            const auto value = later.daemon.client().infoValueForKey(&infoKey, addressOf(old), UseLocking::yes);
            if (value && (*value == plist::Value("new") || (!acted && *value == plist::Value("old"))))
                return "";
            return value ? "the value is " + plist::describe(&*value) : "the value is lost";
        });
}

Scenario newDirectoryName() {
    return changing(
        "new directory name", prepareNothing,
        [](Device& device, const Acknowledged& old) {
            return device.client().regenerateDirectoryUUIDForUser(addressOf(old)).has_value();
        },
        [](const std::string& root, bool acted, const Acknowledged& old) -> std::string {
            const Changed now = look(root);
            if (now.content != "old" || now.uuid != old.uuid)
                return "the container is " + now.content;
            return acted && now.name == nameOf(old.path) ? "the acknowledged name is undone" : "";
        });
}

} // namespace

std::vector<Scenario> changeScenarios() {
    const std::string replace = "replace";
    const std::string keeping = "replace that keeps the UUID";
    return {atHome(replacement(replace, OldOne::replaced)),
            atHome(replacement(replace + " without exchange", OldOne::replaced, false)),
            atHome(replacementAndDeletion()),
            replacement(keeping, OldOne::replacedAndUuidKept),
            replacement("replace of nothing", OldOne::none),
            atHome(recovery(replace, OldOne::replaced)),
            recovery(keeping, OldOne::replacedAndUuidKept),
            atHome(recovery(replace, OldOne::replaced, true)),
            recovery(keeping, OldOne::replacedAndUuidKept, true),
            wiping(),
            structure(),
            infoValue(),
            newDirectoryName()};
}

} // namespace zor::support
