// SPDX-License-Identifier: Apache-2.0
#include "check/StoreCheck.h"
#include "check/Finding.h"
#include "store/EntitlementFile.h"
#include "support/EncryptedDisk.h"
#include "support/FileTree.h"
#include "world/World.h"

#include <fcntl.h>
#include <fstream>
#include <gtest/gtest.h>

namespace zor::check {
namespace {

namespace files = std::filesystem;
using test::World;

constexpr const char* uuid = "5DB3C5A9-6E4B-4C7C-9C57-1D6C7A1C0001";

plist::Dictionary entitlements(const char* group, const char* systemGroup) {
    return {{std::string(entitlementKeys::applicationGroups), plist::Array{plist::Value(group)}},
            {std::string(entitlementKeys::systemGroups), plist::Array{plist::Value(systemGroup)}}};
}

/// A store with a container of each group of classes, as clients leave it.
struct Store {
    Store() {
        registerOwner("org.system", entitlements("group.a", "systemgroup.a"));
        const FoundContainer made = world.make("org.data");
        data = made.path;
        dataUuid = made.uuid.string();
        create("org.data", ContainerClass::dataApplication, 501, true);
        create("org.data", ContainerClass::dataApplication, 502);
        create("org.bundle", ContainerClass::bundleApplication, 33);
        group = create("group.a", ContainerClass::sharedAppGroup, 501);
        create("systemgroup.a", ContainerClass::sharedSystemGroup, 499);
        create("org.system", ContainerClass::dataSystem, 499);
        (void)world.bootMarker.make();
    }
    void registerOwner(const char* identifier, plist::Dictionary entitlements) {
        entitlements.set(std::string(entitlementKeys::systemContainer), true);
        EXPECT_TRUE(world.services().entitlements()._setEntitlementDictionaryValues({entitlements}, {identifier}));
    }
    void setProtectionClass(const std::string& subdirectory) {
        const platform::FileDescriptor file(::open((data + subdirectory).c_str(), O_RDONLY | O_CLOEXEC));
        EXPECT_FALSE(world.protection().setClass(file.get(), 1));
    }
    std::string create(const std::string& identifier, ContainerClass containerClass, std::uint32_t user,
                       bool transient = false) {
        return world.make(identifier, containerClass, transient, user).path;
    }
    std::vector<Finding> check(CheckOptions options = {.pause = std::chrono::milliseconds(0)}) {
        const auto system = CheckedSystem::open(world.path());
        EXPECT_TRUE(system) << system.error();
        options.bootMarker = &world.bootMarker;
        return checkStore(**system, options);
    }
    [[nodiscard]] std::string metadata() const { return data + "/" + names::metadataFile; }
    /// Beside the container.
    [[nodiscard]] std::string sibling(const std::string& name) const { return classDirectory() + "/" + name; }
    [[nodiscard]] std::string classDirectory() const { return files::path(data).parent_path(); }
    void setMetadata(const std::string& key, plist::Value value) const {
        plist::Dictionary content = test::metadataOf(2, 501, "org.data", uuid);
        content.set(key, std::move(value));
        std::ofstream(metadata(), std::ios::binary) << test::binary(content);
    }
    /// A file of the daemon's own.
    void write(const std::string& name, const std::string& bytes = "x") {
        world.write(std::string(test::libraryPath) + "/" + name, bytes);
    }
    /// A directory in its caches.
    void leave(const std::string& where) { world.makeDirectories(std::string(test::cachesPath) + "/" + where); }
    /// A link in its sandbox's state.
    void map(const std::string& target, const std::string& name) {
        world.makeDirectories("run/zorvane/sandbox/501/1");
        files::create_symlink(target, world.path("run/zorvane/sandbox/501/1/" + name));
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

struct Damage {
    const char* name;
    std::function<void(Store&)> inflict;
    FindingCode code;
    Mender mender;
    /// How the path ends.
    std::string path = "";
    const char* rule = "";
};

void replaceByLink(const std::string& path, const std::string& target) {
    files::rename(path, files::path(path).parent_path() / ".elsewhere");
    files::create_symlink(target, path);
}

void replaceByFifo(const std::string& path) {
    files::remove(path);
    EXPECT_EQ(::mkfifo(path.c_str(), 0644), 0);
}

void giveAway(const std::string& path, uid_t user) {
    EXPECT_EQ(::chown(path.c_str(), user, user), 0);
}

/// A metadata file that no reader takes, by which rule.
Damage invalid(const char* name, std::function<void(Store&)> inflict, const char* rule = "readable") {
    return {name, std::move(inflict), FindingCode::metadataInvalid, Mender::person, "", rule};
}

std::function<void(Store&)> with(const char* key, const plist::Value& value) {
    return [=](Store& store) { store.setMetadata(std::string("ZORMetadata") + key, value); };
}

std::vector<Damage> damages() {
    using enum FindingCode;
    using enum Mender;
    using S = Store&;
    static const std::string mapping = "sandbox/501/1/";
    std::vector<Damage> rows = {
        {"no metadata", [](S s) { files::remove(s.metadata()); }, metadataMissing, boot},
        invalid("garbage", [](S s) { std::ofstream(s.metadata()) << "x"; }),
        invalid("two names", [](S s) { files::create_hard_link(s.metadata(), s.data + "/second"); }),
        invalid("writable", [](S s) { ::chmod(s.metadata().c_str(), 0666); }),
        invalid("a link to it", [](S s) { replaceByLink(s.metadata(), "/etc/passwd"); }),
        invalid("a FIFO", [](S s) { replaceByFifo(s.metadata()); }),
        invalid("no identifier", with("Identifier", 7), "identifier"),
        invalid("an identifier that is too long", with("Identifier", std::string(1025, 'i')), "identifier"),
        invalid("a UUID in braces", with("UUID", "{0000000-0000-4000-8000-000000000001}"), "uuid"),
        invalid("a class cut to 32 bits", with("ContentClass", std::int64_t{4294967298}), "class"),
        invalid("no UUID", with("UUID", "x"), "uuid"),
        invalid("no class", with("ContentClass", 99), "class"),
        invalid("no info", with("Info", plist::Array()), "info"),
        {"another user's", with("Persona", 502), wrongClassDirectory, person, "", "user"},
        {"another class's", with("ContentClass", 4), wrongClassDirectory, person, "", "place"},
        {"copied", [](S s) { EXPECT_EQ(std::system(("cp -a " + s.data + " " + s.sibling(uuid)).c_str()), 0); },
         doubledContainer, person},
        {"renamed", [](S s) { files::rename(s.data, s.sibling("Junk")); }, containerName, boot, "/Junk"},
        {"closed", [](S s) { ::chmod(s.data.c_str(), 0700); }, containerAttributes, person},
        {"no subdirectory", [](S s) { files::remove_all(s.data + "/Library"); }, subdirectoryMissing, Mender::daemon,
         "/Library"},
        {"closed subdirectory", [](S s) { ::chmod((s.data + "/tmp").c_str(), 0700); }, subdirectoryAttributes,
         Mender::daemon, "/tmp"},
        {"a link for a subdirectory", [](S s) { replaceByLink(s.data + "/Library", "/"); }, wrongShape, person,
         "/Library"},
        {"a link for a container", [](S s) { replaceByLink(s.data, "/"); }, wrongShape, person},
        {"a FIFO among containers", [](S s) { replaceByFifo(s.sibling("pipe")); }, wrongShape, boot, "/pipe"},
        {"a link for a class directory", [](S s) { replaceByLink(s.classDirectory(), s.data); }, wrongShape, person,
         "/Data/Application"},
        {"a file for all of a user's containers",
         [](S s) {
             files::remove_all(s.world.path("private/var/second/Containers"));
             s.world.write("private/var/second/Containers", "x");
         },
         wrongShape, person, "private/var/second/Containers"},
        {"a link for staging",
         [](S s) { replaceByLink(s.world.path(std::string(test::cachesPath) + "/Staging"), "/"); }, wrongShape, person,
         "/Staging"},
        {"a class that is not recorded", [](S s) { s.setProtectionClass("/Documents"); }, protectionDiffers, person,
         "/Documents"},
        {"a mapping to nothing", [](S s) { s.map(s.world.path("gone"), "org.data"); }, mappingDangling, launch,
         mapping + "org.data"},
        {"half a mapping", [](S s) { s.map(s.data, ".new-0"); }, writeLeftover, launch, mapping + ".new-0"},
        {"staging", [](S s) { s.leave(std::string("Staging/") + uuid); }, stagingLeftover, launch, uuid},
        {"aside",
         [](S s) {
             const std::string outer = s.world.path(fs::deathRowOuter);
             files::create_directories(outer + "/" + fs::asideInner + "/" + uuid);
             for (const std::string& closed : {outer, outer + "/" + fs::asideInner})
                 ::chmod(closed.c_str(), 0700);
         },
         asideLeftover, launch, uuid},
        {"a copy among containers", [](S s) { files::create_directory(s.sibling(".zorvaned-copy-abcdef")); },
         copyLeftover, boot, "/.zorvaned-copy-abcdef"},
        {"a copy beside the old location of bundles",
         [](S s) { s.world.makeDirectories(std::string(test::mobileContainers) + "/.zorvaned-copy-abcdef"); },
         copyLeftover, boot, "mobile/Containers/.zorvaned-copy-abcdef"},
        {"death row", [](S s) { s.leave("Dead/temp.abcdef"); }, deathRowItem, Mender::daemon, "/temp.abcdef"},
        {"no journal", [](S s) { s.write("Replace/" + std::string(uuid) + ".plist"); }, journalLeftover, launch,
         ".plist"},
        {"half a journal", [](S s) { s.write("Replace/.A.plist.new-abcdef"); }, writeLeftover, launch, ".new-abcdef"},
        {"half an entitlement file", [](S s) { s.write(".zor_entitlements.plist.new-abcdef"); }, writeLeftover,
         nextWrite, ".new-abcdef"},
        {"half a metadata file", [](S s) { std::ofstream(s.data + "/." + names::metadataFile + ".new-abcdef") << "x"; },
         writeLeftover, nextWrite, ".new-abcdef"},
        {"half a subdirectory", [](S s) { files::create_directory(s.data + "/tmp.abcdef"); }, directoryLeftover, person,
         "/tmp.abcdef"},
        {"half a class directory", [](S s) { files::create_directory(s.classDirectory() + ".abcdef"); },
         directoryLeftover, person, "/Application.abcdef"},
        {"nobody's system container",
         [](S s) {
             s.write(names::entitlementFile,
                     test::binary(plist::Dictionary{{"org.other", entitlements("group.a", "systemgroup.a")}}));
         },
         systemUnentitled, boot},
        {"nobody's group", [](S s) { s.create("group.b", ContainerClass::sharedAppGroup, 502); }, groupUnreferenced,
         boot},
        {"entitlements", [](S s) { s.write(names::entitlementFile); }, entitlementsUnreadable, launch,
         "/zor_entitlements.plist"},
        {"lost entitlements", [](S s) { s.write(names::unreadableEntitlementFile); }, entitlementsAside, person,
         ".unreadable"},
        {"a home that cannot be looked at",
         [](S s) {
             std::ofstream(s.world.path("etc/passwd"), std::ios::app)
                 << "third:x:504:504::/private/var/" + std::string(300, 'n') + ":/bin/sh\n";
         },
         unexamined, person, "nnn"},
        {"half a table of names", [](S s) { s.world.write("etc/zorvane/wellknown.plist", "x"); }, unexamined, person,
         "wellknown.plist"},
        {"somebody's boot marker", [](S s) { s.world.bootMarker.state = {.present = false, .foreign = true}; },
         bootMarkerForeign, launch, "sem.marker"},
        {"nowhere for transient bundles", [](S s) { files::remove_all(s.world.path("private/var/brevad")); },
         rootIncomplete, person, "/brevad"},
        {"an account with the installer's number",
         [](S s) {
             std::ofstream(s.world.path("etc/passwd"), std::ios::app) << "www:x:33:33::/private/var/www:/bin/sh\n";
         },
         userNumberTaken, person, "/zorvaned.conf"},
    };
    if (::geteuid() != 0)
        return rows;
    // The daemon gives nothing of another's away.
    rows.insert(rows.end(), {{"another's subdirectory", [](S s) { giveAway(s.data + "/tmp", 502); },
                              subdirectoryAttributes, person, "/tmp"},
                             {"root's container", [](S s) { giveAway(s.group, 0); }, containerAttributes, person},
                             invalid("a user's metadata", [](S s) { giveAway(s.metadata(), 501); })});
    return rows;
}

// Locked content is no damage: one finding says so of what hides it, and nothing of the content is mended or missed.
TEST(StoreCheckTest, WhatIsLockedIsNotDamaged) {
    Store store;
    support::EncryptedDisk disk(store.world.path("private/var/encrypted"));
    if (!disk.missing().empty())
        GTEST_SKIP() << "skipped: " << disk.missing();
    const std::string below = disk.directory().substr(store.world.path().size());
    store.world.write("etc/passwd", "mobile:x:501:501::/private/var/mobile:/bin/sh\n"
                                    "third:x:503:503::" +
                                        below + ":/bin/sh\n");
    EXPECT_EQ(::chown(disk.directory().c_str(), 503, 503), 0);
    const std::string container = store.create("org.locked", ContainerClass::dataApplication, 503);
    store.map(container, "org.locked");
    EXPECT_EQ(textOf(store.check()), "");
    store.world.restart(); // whatever it holds open keeps the key there
    ASSERT_TRUE(disk.takeKeyAway());
    const auto findings = store.check();
    ASSERT_EQ(findings.size(), 1U) << textOf(findings);
    EXPECT_EQ(findings[0].code, FindingCode::unexamined);
    EXPECT_EQ("/" + findings[0].path, below);
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

// Goal: what is as it should be is no finding. Method: a reference without a container, a mapping that leads to one, a
// pending change, a container under a well-known name, a missing marker without and with a daemon.
TEST(StoreCheckTest, KnowsWhatIsNoFault) {
    Store store;
    store.registerOwner("com.veltra.settingsd",
                        {{std::string(entitlementKeys::applicationGroups), plist::Array{plist::Value("group.new")}}});
    store.create("com.veltra.settingsd", ContainerClass::dataSystem, 499);
    ASSERT_FALSE(store.world.sandbox.setMapping(501, platform::SandboxItemType::dataContainer, "org.data", store.data));
    store.setProtectionClass("/tmp");
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
    support::inThreads(3, [&](unsigned thread) {
        for (int round = 0; thread == 0 && round < 5; ++round)
            EXPECT_EQ(textOf(store.check({.daemonServes = true})), "");
        stop = stop || thread == 0;
        const std::string identifier = "org.busy" + std::to_string(thread);
        while (!stop) {
            store.create(identifier, ContainerClass::dataApplication, 501);
            (void)store.world.daemonsClient().deleteDataContainerContentForUser(501, &identifier,
                                                                                ContainerClass::dataApplication);
            store.create(identifier, ContainerClass::dataApplication, 501, true);
        }
    });
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
    store.leave("Dead/temp.abcdef");
    store.leave("Dead/temp.abcdeg");
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
    }
    const files::directory_iterator aside(store.world.path(names::rootHome));
    EXPECT_EQ(std::ranges::count_if(aside, [](const auto& entry) { return entry.is_symlink(); }), 4);
}

} // namespace
} // namespace zor::check
