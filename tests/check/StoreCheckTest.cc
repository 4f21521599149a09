// SPDX-License-Identifier: Apache-2.0
#include "check/StoreCheck.h"
#include "check/Repair.h"
#include "check/ShellText.h"
#include "entitlements/EntitlementFile.h"
#include "support/FileTree.h"
#include "world/World.h"

#include <atomic>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <gtest/gtest.h>
#include <thread>
#include <unistd.h>

namespace zor::check {
namespace {

namespace files = std::filesystem;
using test::World;

constexpr const char* uuid = "5DB3C5A9-6E4B-4C7C-9C57-1D6C7A1C0001";

/// A store with a container of each group of classes, as clients leave it.
struct Store {
    Store() {
        const plist::Dictionary owner{
            {std::string(entitlementKeys::systemContainer), true},
            {std::string(entitlementKeys::applicationGroups), plist::Array{plist::Value("group.a")}},
            {std::string(entitlementKeys::systemGroups), plist::Array{plist::Value("systemgroup.a")}}};
        EXPECT_TRUE(world.services().entitlements()._setEntitlementDictionaryValues({owner}, {"org.system"}));
        data = create("org.data", ContainerClass::dataApplication, 501);
        const std::string identifier = "org.data";
        dataUuid = world.daemonsClient()
                       .createOrLookupContainerForUser(501, &identifier, ContainerClass::dataApplication, {})
                       ->uuid.string();
        create("org.data", ContainerClass::dataApplication, 501, true);
        create("org.data", ContainerClass::dataApplication, 502);
        create("org.bundle", ContainerClass::bundleApplication, 33);
        group = create("group.a", ContainerClass::sharedAppGroup, 501);
        create("systemgroup.a", ContainerClass::sharedSystemGroup, 499);
        create("org.system", ContainerClass::dataSystem, 499);
        world.bootMarker.make();
    }
    std::string create(const std::string& identifier, ContainerClass containerClass, std::uint32_t user,
                       bool transient = false) {
        const auto made = world.daemonsClient().createOrLookupContainerForUser(
            user, &identifier, containerClass, {.createIfNecessary = true, .transient = transient});
        EXPECT_TRUE(made);
        return made->path;
    }
    std::vector<Finding> check(CheckOptions options = {.pause = std::chrono::milliseconds(0)}) {
        const auto system = CheckedSystem::open(world.path());
        EXPECT_TRUE(system) << system.error();
        options.bootMarker = &world.bootMarker;
        return checkStore(**system, options);
    }
    [[nodiscard]] std::string metadata() const { return data + "/" + names::metadataFile; }
    void writeMetadata(const plist::Dictionary& changes) const {
        plist::Dictionary content = test::metadataOf(2, 501, "org.data", uuid);
        for (const auto& [key, value] : changes)
            content.set(key, value);
        std::ofstream(metadata(), std::ios::binary) << test::binary(content);
    }
    void writeEntitlements(const std::string& bytes) {
        world.write(std::string(test::libraryPath) + "/" + names::entitlementFile, bytes);
    }

    World world;
    std::string data;
    std::string dataUuid;
    std::string group;
};

std::string textOf(const std::vector<Finding>& findings) {
    std::string text;
    for (const Finding& finding : findings)
        text += std::string(pageOf(finding.code).word) + " " + finding.path + ": " + finding.what + "\n";
    return text;
}

/// A directory of the daemon's caches, with a file in it.
void leave(Store& store, const std::string& where) {
    store.world.makeDirectories(std::string(test::cachesPath) + "/" + where);
}

struct Damage {
    const char* name;
    std::function<void(Store&)> inflict;
    FindingCode code;
    Mender mender;
    /// How the path ends.
    const char* path;
    const char* rule = "";
};

void replaceByLink(const std::string& path, const char* target) {
    files::rename(path, files::path(path).parent_path() / ".elsewhere");
    files::create_symlink(target, path);
}

const std::vector<Damage>& damages() {
    using enum FindingCode;
    static const std::vector<Damage> rows = {
        {"no metadata", [](Store& s) { files::remove(s.metadata()); }, metadataMissing, Mender::boot, ""},
        {"garbage", [](Store& s) { std::ofstream(s.metadata()) << "x"; }, metadataInvalid, Mender::person, "",
         "readable"},
        {"two names", [](Store& s) { files::create_hard_link(s.metadata(), s.data + "/second"); }, metadataInvalid,
         Mender::person, "", "readable"},
        {"writable", [](Store& s) { ::chmod(s.metadata().c_str(), 0666); }, metadataInvalid, Mender::person, "",
         "readable"},
        {"a link to it", [](Store& s) { replaceByLink(s.metadata(), "/etc/passwd"); }, metadataInvalid, Mender::person,
         "", "readable"},
        {"a FIFO",
         [](Store& s) {
             files::remove(s.metadata());
             ::mkfifo(s.metadata().c_str(), 0644);
         },
         metadataInvalid, Mender::person, "", "readable"},
        {"no identifier", [](Store& s) { s.writeMetadata({{"ZORMetadataIdentifier", 7}}); }, metadataInvalid,
         Mender::person, "", "identifier"},
        {"no UUID", [](Store& s) { s.writeMetadata({{"ZORMetadataUUID", "x"}}); }, metadataInvalid, Mender::person, "",
         "uuid"},
        {"no class", [](Store& s) { s.writeMetadata({{"ZORMetadataContentClass", 99}}); }, metadataInvalid,
         Mender::person, "", "class"},
        {"no info", [](Store& s) { s.writeMetadata({{"ZORMetadataInfo", plist::Array()}}); }, metadataInvalid,
         Mender::person, "", "info"},
        {"another user's", [](Store& s) { s.writeMetadata({{"ZORMetadataPersona", 502}}); }, wrongClassDirectory,
         Mender::person, "", "user"},
        {"another class's", [](Store& s) { s.writeMetadata({{"ZORMetadataContentClass", 4}}); }, wrongClassDirectory,
         Mender::person, "", "place"},
        {"copied",
         [](Store& s) {
             const std::string copy = files::path(s.data).parent_path() / uuid;
             if (std::system(("cp -a " + s.data + " " + copy).c_str()) != 0)
                 throw std::runtime_error("no copy");
         },
         doubledContainer, Mender::person, ""},
        {"renamed", [](Store& s) { files::rename(s.data, files::path(s.data).parent_path() / "Junk"); }, containerName,
         Mender::boot, "/Junk"},
        {"closed", [](Store& s) { ::chmod(s.data.c_str(), 0700); }, containerAttributes, Mender::person, ""},
        {"no subdirectory", [](Store& s) { files::remove_all(s.data + "/Library"); }, subdirectoryMissing,
         Mender::daemon, "/Library"},
        {"closed subdirectory", [](Store& s) { ::chmod((s.data + "/tmp").c_str(), 0700); }, subdirectoryAttributes,
         Mender::daemon, "/tmp"},
        {"a link for a subdirectory", [](Store& s) { replaceByLink(s.data + "/Library", "/"); }, wrongShape,
         Mender::person, "/Library"},
        {"a FIFO for a subdirectory",
         [](Store& s) {
             files::remove(s.data + "/tmp");
             ::mkfifo((s.data + "/tmp").c_str(), 0644);
         },
         wrongShape, Mender::person, "/tmp"},
        {"a link for a container", [](Store& s) { replaceByLink(s.data, "/"); }, wrongShape, Mender::person, ""},
        {"a FIFO among containers",
         [](Store& s) { ::mkfifo((files::path(s.data).parent_path() / "pipe").c_str(), 0644); }, wrongShape,
         Mender::boot, "/pipe"},
        {"a link for a class directory",
         [](Store& s) { replaceByLink(files::path(s.data).parent_path(), s.data.c_str()); }, wrongShape, Mender::person,
         "/Data/Application"},
        {"a file for all of a user's containers",
         [](Store& s) {
             files::remove_all(s.world.path("private/var/second/Containers"));
             s.world.write("private/var/second/Containers", "x");
         },
         wrongShape, Mender::person, "private/var/second/Containers"},
        {"a link for staging",
         [](Store& s) { replaceByLink(s.world.path(std::string(test::cachesPath) + "/Staging"), "/"); }, wrongShape,
         Mender::person, "/Staging"},
        {"a class that is not recorded",
         [](Store& s) {
             const platform::FileDescriptor file(::open((s.data + "/Documents").c_str(), O_RDONLY | O_CLOEXEC));
             EXPECT_EQ(s.world.protection().setClass(file.get(), 1), 0);
         },
         protectionDiffers, Mender::person, "/Documents"},
        {"a mapping to nothing",
         [](Store& s) {
             s.world.makeDirectories("run/zorvane/sandbox/501/1");
             files::create_symlink(s.world.path("gone"), s.world.path("run/zorvane/sandbox/501/1/org.data"));
         },
         mappingDangling, Mender::launch, "sandbox/501/1/org.data"},
        {"half a mapping",
         [](Store& s) {
             s.world.makeDirectories("run/zorvane/sandbox/501/1");
             files::create_symlink(s.data, s.world.path("run/zorvane/sandbox/501/1/.new-0"));
         },
         writeLeftover, Mender::launch, "sandbox/501/1/.new-0"},
        {"staging", [](Store& s) { leave(s, std::string("Staging/") + uuid); }, stagingLeftover, Mender::launch, uuid},
        {"a copy in staging", [](Store& s) { leave(s, "Staging/.zorvaned-copy-abcdef"); }, copyLeftover, Mender::launch,
         "/.zorvaned-copy-abcdef"},
        {"a copy among containers",
         [](Store& s) { files::create_directory(files::path(s.data).parent_path() / ".zorvaned-copy-abcdef"); },
         copyLeftover, Mender::boot, "/.zorvaned-copy-abcdef"},
        {"a copy beside the old location of bundles",
         [](Store& s) { s.world.makeDirectories(std::string(test::mobileContainers) + "/.zorvaned-copy-abcdef"); },
         copyLeftover, Mender::boot, "mobile/Containers/.zorvaned-copy-abcdef"},
        {"a copy of transient containers", [](Store& s) { leave(s, ".zorvaned-copy-abcdef"); }, copyLeftover,
         Mender::boot, "/.zorvaned-copy-abcdef"},
        {"death row", [](Store& s) { leave(s, "Dead/temp.abcdef"); }, deathRowItem, Mender::daemon, "/temp.abcdef"},
        {"no journal",
         [](Store& s) { s.world.write(std::string(test::libraryPath) + "/Replace/" + uuid + ".plist", "x"); },
         journalLeftover, Mender::launch, ".plist"},
        {"half a journal",
         [](Store& s) { s.world.write(std::string(test::libraryPath) + "/Replace/.A.plist.new-abcdef", "x"); },
         writeLeftover, Mender::launch, ".new-abcdef"},
        {"half an entitlement file",
         [](Store& s) { s.world.write(std::string(test::libraryPath) + "/.zor_entitlements.plist.new-abcdef", "x"); },
         writeLeftover, Mender::nextWrite, ".new-abcdef"},
        {"half a metadata file",
         [](Store& s) { std::ofstream(s.data + "/." + names::metadataFile + ".new-abcdef") << "x"; }, writeLeftover,
         Mender::nextWrite, ".new-abcdef"},
        {"half a subdirectory", [](Store& s) { files::create_directory(s.data + "/tmp.abcdef"); }, directoryLeftover,
         Mender::person, "/tmp.abcdef"},
        {"half a class directory",
         [](Store& s) { files::create_directory(files::path(s.data).parent_path().string() + ".abcdef"); },
         directoryLeftover, Mender::person, "/Application.abcdef"},
        {"nobody's system container",
         [](Store& s) {
             s.writeEntitlements(test::binary(plist::Dictionary{
                 {"org.other",
                  plist::Dictionary{
                      {std::string(entitlementKeys::applicationGroups), plist::Array{plist::Value("group.a")}},
                      {std::string(entitlementKeys::systemGroups), plist::Array{plist::Value("systemgroup.a")}}}}}));
         },
         systemUnentitled, Mender::boot, ""},
        {"nobody's group", [](Store& s) { s.create("group.b", ContainerClass::sharedAppGroup, 502); },
         groupUnreferenced, Mender::boot, ""},
        {"entitlements", [](Store& s) { s.writeEntitlements("x"); }, entitlementsUnreadable, Mender::launch,
         "/zor_entitlements.plist"},
        {"lost entitlements",
         [](Store& s) { s.world.write(std::string(test::libraryPath) + "/" + names::unreadableEntitlementFile, "x"); },
         entitlementsAside, Mender::person, ".unreadable"},
        {"a home that cannot be looked at",
         [](Store& s) {
             std::ofstream(s.world.path("etc/passwd"), std::ios::app)
                 << "third:x:504:504::/private/var/" + std::string(300, 'n') + ":/bin/sh\n";
         },
         unexamined, Mender::person, "nnn"},
        {"somebody's boot marker", [](Store& s) { s.world.bootMarker.state = {.present = false, .foreign = true}; },
         bootMarkerForeign, Mender::launch, "sem.marker"},
    };
    return rows;
}

// Goal: each kind of damage is found, as what it is, and nothing else is; looking at it changes nothing, follows no
// link and waits for nobody. Method: a real store, damaged in one way for each row; the tree before and after compared.
TEST(StoreCheckTest, FindsEachDamageAndChangesNothing) {
    for (const Damage& damage : damages()) {
        SCOPED_TRACE(damage.name);
        Store store;
        ASSERT_EQ(textOf(store.check()), "");
        damage.inflict(store);
        const std::string before = support::readTree(store.world.path()).describe();
        const auto findings = store.check();
        EXPECT_EQ(support::readTree(store.world.path()).describe(), before);
        ASSERT_EQ(findings.size(), 1U) << textOf(findings);
        const Finding& finding = findings.front();
        EXPECT_EQ(pageOf(finding.code).word, pageOf(damage.code).word) << textOf(findings);
        EXPECT_EQ(wordOf(finding.mender), wordOf(damage.mender));
        EXPECT_EQ(finding.rule, damage.rule);
        EXPECT_TRUE(finding.path.ends_with(damage.path)) << finding.path;
        EXPECT_EQ(finding.command.empty(), damage.mender != Mender::person) << finding.command;
        EXPECT_FALSE(finding.command.starts_with("rm ")) << finding.command;
        EXPECT_FALSE(isWhole(findings));
        EXPECT_EQ(repairSteps(findings, "/").size(), 1U);
    }
}

// Goal: what is given away by an owner is seen, where there are owners. Method: as root, another owner.
TEST(StoreCheckTest, FindsWhatChangedItsOwner) {
    if (::geteuid() != 0)
        GTEST_SKIP() << "skipped: only root gives things away";
    Store store;
    ASSERT_EQ(::chown((store.data + "/tmp").c_str(), 502, 502), 0);
    ASSERT_EQ(::chown(store.group.c_str(), 0, 0), 0);
    ASSERT_EQ(::chown((store.metadata()).c_str(), 501, 501), 0);
    EXPECT_EQ(textOf(store.check()).find("metadata-invalid") == std::string::npos, false);
    ASSERT_EQ(::chown((store.metadata()).c_str(), 0, 0), 0);
    const auto findings = store.check();
    ASSERT_EQ(findings.size(), 2U) << textOf(findings);
    EXPECT_EQ(findings[0].code, FindingCode::subdirectoryAttributes);
    EXPECT_EQ(findings[1].code, FindingCode::containerAttributes);
    EXPECT_NE(findings[1].command.find("chown 501:501 . && chmod 0755 ."), std::string::npos);
}

// Goal: what is as it should be is no finding. Method: a reference without a container, a mapping that leads to one, a
// pending change, a container under a well-known name, a missing marker without and with a daemon.
TEST(StoreCheckTest, KnowsWhatIsNoFault) {
    Store store;
    const plist::Dictionary wants{
        {std::string(entitlementKeys::applicationGroups), plist::Array{plist::Value("group.new")}},
        {std::string(entitlementKeys::systemContainer), true}};
    ASSERT_TRUE(
        store.world.services().entitlements()._setEntitlementDictionaryValues({wants}, {"com.veltra.settingsd"}));
    store.create("com.veltra.settingsd", ContainerClass::dataSystem, 499);
    ASSERT_EQ(store.world.sandbox.setMapping(501, platform::SandboxItemType::dataContainer, "org.data", store.data), 0);
    const platform::FileDescriptor file(::open((store.data + "/tmp").c_str(), O_RDONLY | O_CLOEXEC));
    ASSERT_EQ(store.world.protection().setClass(file.get(), 1), 0);
    CheckOptions options{.changingProtection = {store.dataUuid}, .pause = std::chrono::milliseconds(0)};
    const auto findings = store.check(options);
    ASSERT_EQ(findings.size(), 1U) << textOf(findings);
    EXPECT_EQ(findings[0].code, FindingCode::groupNotMade);
    EXPECT_TRUE(isWhole(findings));
    EXPECT_TRUE(repairSteps(findings, "/").empty());

    store.world.bootMarker.forget();
    EXPECT_TRUE(isWhole(store.check(options)));
    options.daemonServes = true;
    EXPECT_FALSE(isWhole(store.check(options)));
}

// Goal: what a request in flight shows is not reported. Method: threads that make, wipe and delete containers without
// pause, and checks meanwhile.
TEST(StoreCheckTest, ReportsNothingOfWhatIsInFlight) {
    Store store;
    std::atomic<bool> stop{false};
    std::vector<std::thread> threads;
    for (int i = 0; i < 2; ++i)
        threads.emplace_back([&, i] {
            const std::string identifier = "org.busy" + std::to_string(i);
            while (!stop) {
                store.create(identifier, ContainerClass::dataApplication, 501);
                (void)store.world.daemonsClient().deleteDataContainerContentForUser(501, &identifier,
                                                                                    ContainerClass::dataApplication);
                store.create(identifier, ContainerClass::dataApplication, 501, true);
            }
        });
    for (int round = 0; round < 5; ++round) {
        const auto findings = store.check({.daemonServes = true});
        EXPECT_EQ(textOf(findings), "");
    }
    stop = true;
    for (std::thread& thread : threads)
        thread.join();
    store.world.drainDeathRow();
    EXPECT_EQ(textOf(store.check()), "");
}

// Goal: one list of steps, each container once, and commands that hold whatever bytes a name has. Method: findings of
// one container with a hostile identifier, on another root.
TEST(StoreCheckTest, MakesOneStepForEachContainer) {
    Store store;
    const std::string identifier = "a'b\n$(c)";
    const std::string path = store.create(identifier, ContainerClass::dataApplication, 501);
    files::remove_all(path + "/Documents");
    files::remove_all(path + "/tmp");
    leave(store, "Dead/temp.abcdef");
    leave(store, "Dead/temp.abcdeg");
    const auto steps = repairSteps(store.check(), "/a root");
    ASSERT_EQ(steps.size(), 2U);
    EXPECT_EQ(steps[0].act, RepairStep::Act::recreateStructure);
    EXPECT_EQ(steps[0].command, "zorvanectl --root '/a root' repair --class Data/Application --user 501 -- "
                                "$'a\\047b\\012$(c)'");
    EXPECT_EQ(steps[1].act, RepairStep::Act::emptyDeathRow);
    EXPECT_TRUE(steps[1].destroys());
    EXPECT_NE(steps[1].text.find("2 items"), std::string::npos);
}

// Goal: a name is one word of a command, whatever shell that is typed into. Method: hostile names, each as a word of a
// command for sh and for bash; sh may know no word for a control character, but must run nothing of it.
TEST(StoreCheckTest, NamesNeverBecomeCommands) {
    const support::TemporaryDirectory place;
    const std::string victim = place.path() + "/victim";
    const std::string script = place.path() + "/script";
    for (const std::string& name :
         {"'; touch " + victim + " #", "'; touch " + victim + " #\x01", "\\'; touch " + victim + " #\x9b",
          "\\\\'; touch " + victim + " #\n", "$(touch " + victim + ")\x7f", "`touch " + victim + "`\\"}) {
        SCOPED_TRACE(name);
        std::ofstream(script) << "printf %s " + shellQuoted(name) + " > " + place.path() + "/said\n";
        for (const char* shell : {"sh", "bash"}) {
            EXPECT_EQ(std::system((std::string(shell) + " " + script).c_str()), 0);
            EXPECT_FALSE(files::exists(victim)) << shell;
        }
        std::ifstream said(place.path() + "/said");
        EXPECT_EQ(std::string(std::istreambuf_iterator<char>(said), {}), name) << "as bash reads it";
    }
}

// Goal: what is to be moved aside is, however often and from wherever something of that name was before. Method: links
// for the same directory of two containers, twice; the commands are run.
TEST(StoreCheckTest, MovesEverythingAside) {
    Store store;
    const std::string other = store.create("org.data", ContainerClass::dataApplication, 502);
    for (int round = 0; round < 2; ++round) {
        for (const std::string& container : {store.data, other}) {
            files::remove_all(container + "/Library");
            files::create_symlink("/", container + "/Library");
        }
        const auto findings = store.check();
        EXPECT_EQ(findings.size(), 2U) << textOf(findings);
        for (const Finding& finding : findings)
            EXPECT_EQ(std::system(finding.command.c_str()), 0) << finding.command;
        EXPECT_FALSE(files::is_symlink(store.data + "/Library"));
        EXPECT_FALSE(files::is_symlink(other + "/Library"));
    }
    const files::directory_iterator aside(store.world.path(names::rootHome));
    EXPECT_EQ(std::ranges::count_if(aside, [](const auto& entry) { return entry.is_symlink(); }), 4);
}

} // namespace
} // namespace zor::check
