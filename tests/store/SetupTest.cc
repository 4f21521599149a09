// SPDX-License-Identifier: Apache-2.0
// The setup of a launch and of a boot: what counts as orphaned, what is swept, who is skipped; and the sandbox
// mappings.
#include "daemon/Daemon.h"
#include "world/World.h"

#include <algorithm>
#include <filesystem>
#include <gtest/gtest.h>
#include <new>
#include <set>
#include <unistd.h>

namespace zor::test {
namespace {

const std::string shared = sharedPath;
constexpr const char* goodUuid = "11111111-0000-4000-8000-000000000000";
constexpr const char* lowerUuid = "abcdef00-0000-4000-8000-00000000000a";
constexpr const char* bareUuid = "22222222-0000-4000-8000-000000000000";
constexpr const char* cleanup = "_cleanupOrphanedDataForUser";

// Goal: an entry is kept or goes by its name and metadata file alone. Method: a table judged after one boot.
TEST(Setup, Orphans) {
    World world;
    world.write(
        "etc/zorvane/wellknown.plist",
        binary(plist::Dictionary{{"System", plist::Dictionary{{"com.veltra.settingsd", "com.veltra.settingsd"},
                                                              {"com.veltra.other", "short-name"}}},
                                 {"SystemGroup", plist::Dictionary{{"systemgroup.com.veltra.fonts", "fonts"}}}}));
    enum class File { good, invalid, missing };
    struct Row {
        std::string directory;
        const char* name;
        File file;
        bool stays;
    };
    const std::string system = shared + "/Data/System";
    const std::string group = shared + "/Shared/SystemGroup";
    const std::string secondsGroups = "private/var/second/Containers/Shared/AppGroup";
    const Row rows[] = {
        {applications, goodUuid, File::good, true},
        {applications, lowerUuid, File::good, true},
        {applications, "33333333-0000-4000-8000-000000000000", File::invalid, true},
        {applications, bareUuid, File::missing, false},
        {applications, "Junk", File::good, false},
        {applications, "com.veltra.settingsd", File::good, false},
        {secondsGroups, bareUuid, File::missing, false},
        {shared + "/Bundle/Framework", goodUuid, File::good, true},
        {shared + "/Bundle/Framework", "fonts", File::good, false},
        {system, "com.veltra.settingsd", File::good, true},
        {system, "short-name", File::good, true},
        {system, "com.veltra.other", File::good, true}, // an identifier of the table
        {system, "fonts", File::good, false},
        {system, "com.veltra.Settingsd", File::good, false},
        {group, "fonts", File::good, true},
        {group, "systemgroup.com.veltra.fonts", File::good, true},
        {group, "short-name", File::good, false},
        {group, "com.veltra.settingsd", File::missing, false},
    };
    for (const Row& row : rows) {
        const std::string path = row.directory + "/" + row.name;
        world.makeDirectories(path);
        if (row.file != File::missing)
            world.write(path + "/" + names::metadataFile,
                        row.file == File::good ? binary(metadataOf(2, mobile, "a")) : "");
    }
    const char* const fileNamed = "44444444-0000-4000-8000-000000000000";
    world.write(applications + "/" + fileNamed, "a file with a good name");
    for (const std::string& path : {system + "/short-name-without-file", applications + "/.hidden"})
        world.makeDirectories(path);
    // What moves across file systems hide lies beside what is moved, and beside where it goes.
    const std::string parents[] = {applications,
                                   shared,
                                   shared + "/Bundle",
                                   mobileContainers,
                                   mobileCaches,
                                   cachesPath,
                                   "private/var/brevad/Library/Caches"};
    for (const std::string& parent : parents)
        world.makeDirectories(parent + "/.zorvaned-copy-abcdef");
    world.daemonsClient().rebootContainerManagerSetup();
    std::multiset<std::string> gone = {"short-name-without-file", "Temp", "Temp", "Temp", "com.veltra.zorvaned"};
    for (const std::string& parent : parents) {
        EXPECT_FALSE(world.exists(parent + "/.zorvaned-copy-abcdef")) << parent;
        gone.insert(".zorvaned-copy-abcdef");
    }
    for (const Row& row : rows) {
        EXPECT_EQ(world.exists(row.directory + "/" + row.name), row.stays) << row.directory << "/" << row.name;
        if (!row.stays)
            gone.insert(row.name);
    }
    EXPECT_TRUE(world.exists(applications + "/.hidden"));
    EXPECT_TRUE(world.exists(applications + "/" + fileNamed));
    const auto dying = world.deathRow();
    EXPECT_EQ(std::multiset<std::string>(dying.begin(), dying.end()), gone);
    EXPECT_EQ(world.complaints(cleanup).size(), 2U);
}

// Goal: a table of well-known names that cannot be read whole costs no container, and moves none; one that says less
// than it did does. Method: bad files, a boot over a name that only the file can give; a boot with a good one.
TEST(Setup, ATableThatCannotBeReadDeletesNothing) {
    const std::string system = shared + "/Data/System";
    const std::string other = "com.veltra.other";
    const std::string settings = "com.veltra.settingsd";
    const auto naming = [](plist::Value names) { return binary(plist::Dictionary{{"System", std::move(names)}}); };
    const std::tuple<const char*, std::string, mode_t> rows[] = {
        {"nonsense", "x", 0644},
        {"writable by others", naming(plist::Dictionary{{other, "short-name"}}), 0664},
        {"a row", naming(plist::Dictionary{{other, "short/name"}}), 0644},
        {"no dictionary", naming(plist::Array{other}), 0644},
    };
    for (const auto& [name, bytes, mode] : rows) {
        SCOPED_TRACE(name);
        World world;
        const plist::Dictionary entitled{{std::string(entitlementKeys::systemContainer), true}};
        ASSERT_TRUE(
            world.services().entitlements()._setEntitlementDictionaryValues({entitled, entitled}, {other, settings}));
        world.putContainer(system + "/short-name", metadataOf(12, 499, other, bareUuid));
        world.putContainer(system + "/" + goodUuid, metadataOf(12, 499, settings, goodUuid));
        const auto boot = [&](const std::string& table, mode_t tableMode) {
            world.write("etc/zorvane/wellknown.plist", table, tableMode);
            world.restart();
            world.daemonsClient().rebootContainerManagerSetup();
        };
        boot(bytes, mode);
        EXPECT_EQ(world.names(system), (std::vector<std::string>{goodUuid, "short-name"}));
        EXPECT_EQ(world.complaints(cleanup).size(), 1U);
        boot(naming(plist::Dictionary{{settings, "settings"}}), 0644);
        EXPECT_EQ(world.names(system), std::vector<std::string>{"settings"});
    }
}

// Goal: a boot throws transient containers away, a launch empties staging and death row and forgets what it found.
// Method: containers of every kind before, a boot, a launch.
TEST(Setup, BootAndLaunch) {
    World world;
    const std::string identifier = "com.example";
    const plist::Dictionary groups{{std::string(entitlementKeys::applicationGroups), plist::Array{identifier}},
                                   {std::string(entitlementKeys::systemContainer), true}};
    ASSERT_EQ(world.services().store().entitlementChange.processEntitlements(&groups, &identifier, nullptr),
              ErrorCode::success);
    std::vector<std::string> live;
    std::vector<std::string> transient;
    for (const auto& [userId, containerClass] :
         {std::pair(mobile, application), std::pair(second, ContainerClass::sharedAppGroup),
          std::pair(33U, ContainerClass::bundleApplication), std::pair(499U, ContainerClass::dataSystem)}) {
        live.push_back(world.make(identifier, containerClass, false, userId).path);
        transient.push_back(world.make(identifier, containerClass, asTransient, userId).path);
    }
    world.restart();
    world.makeDirectories(staging + "/half-made");
    world.makeDirectories(dead + "/temp.abcdef/old");
    world.load();
    (void)world.daemonsClient().containersForUser(mobile, application, false);
    EXPECT_EQ(world.services().cache().counts().classCaches, 1U);
    world.daemonsClient().rebootContainerManagerSetup();
    EXPECT_EQ(world.names(dead).size(), 5U); // no pass was started
    EXPECT_TRUE(world.exists(staging + "/half-made"));
    world.launch();
    EXPECT_TRUE(world.names(staging).empty());
    EXPECT_TRUE(world.names(dead).empty());
    EXPECT_EQ(world.services().cache().counts().classCaches, 0U);
    EXPECT_TRUE(std::ranges::all_of(live, isThere));
    EXPECT_TRUE(std::ranges::none_of(transient, isThere));
    EXPECT_TRUE(world.daemonsClient().containersForUser(mobile, application, asTransient)->empty());
    EXPECT_FALSE(world.exists("private/var/nowhere"));
}

// Goal: a pass that fails ends alone, and a daemon that is to end stops between items and leaves the rest, and the
// boot, to the next. Method: memory runs out once; a stop wanted after each number of looks.
TEST(Setup, EndsWithOnePassOrWhenItIsToldTo) {
    World world;
    bool thrown = false;
    world.load();
    world.makeDirectories(applications + "/Junk");
    world.disk().arm({.filter = [&](const support::DiskCallInfo& call) -> bool {
        if (thrown || call.call != support::DiskCall::rename)
            return false;
        thrown = true;
        throw std::bad_alloc();
    }});
    world.boot();
    world.disk().disarm();
    EXPECT_TRUE(thrown);
    const auto& passes = world.services().store().setup.passes();
    EXPECT_EQ(std::ranges::count_if(passes, [](const auto& pass) { return pass.failed; }), 1);
    EXPECT_FALSE(world.exists(applications + "/Junk"));
    int looks = 0;
    for (int allowed = 0; !world.bootMarker.state.present; ++allowed) {
        ASSERT_LT(allowed, 200);
        world.restart();
        for (const char* junk : {"/Junk1", "/Junk2"})
            world.makeDirectories(applications + junk);
        int progress = 0;
        looks = 0;
        Daemon(world.services(), {.settingUp = [&] { ++progress; }, .stopWanted = [&] { return looks++ == allowed; }})
            .setUp();
        EXPECT_EQ(progress, 1);
        EXPECT_EQ(world.services().store().setup.stopped(), looks > allowed);
    }
    EXPECT_GT(looks, 10);
}

// Goal: no failure stops a setup, and no link is followed. Method: a disk on which no move succeeds; somebody's links
// in the places of two directories.
TEST(Setup, GoesOnAfterFailures) {
    World world;
    world.makeDirectories(staging + "/half-made");
    world.load();
    world.services().configuration().getPerUserConfigurationForUserId(mobile)->transientDirectory();
    world.refuse(support::DiskCall::rename, EROFS, support::FaultSpan::fromThenOn);
    world.boot();
    world.disk().disarm();
    const auto said = world.complaints("rebootContainerManagerSetup");
    ASSERT_GE(said.size(), 5U);
    EXPECT_TRUE(said.back().starts_with("Failed to delete per-user transient URL")) << said.back(); // the last pass
    EXPECT_TRUE(world.exists(staging + "/half-made"));
    world.makeDirectories("elsewhere/kept");
    for (const std::string& place : {journals, applications}) {
        std::filesystem::remove_all(world.path(place));
        ASSERT_EQ(::symlink(world.path("elsewhere").c_str(), world.path(place).c_str()), 0);
    }
    world.boot();
    EXPECT_TRUE(world.exists("elsewhere/kept"));
}

// Goal: a mapping leads to the live container or is gone, and one that leads to nothing, or out of the root, goes with
// the next launch. Method: each class that has mappings; then links as a stop, or somebody else, leaves them.
TEST(SandboxMapping, LeadsToTheContainer) {
    World world;
    const std::string identifier = "com.example/odd";
    const FileURL url = world.url("private/var/mobile");
    const auto map = [&](ContainerClass containerClass, const std::optional<FileURL>& to) {
        return world.daemonsClient()._setSandboxContainerMappingForUser(mobile, identifier, containerClass, to);
    };
    EXPECT_FALSE(map(ContainerClass::dataSystem, url));
    for (const auto& [containerClass, type] :
         {std::pair(application, "1"), std::pair(ContainerClass::sharedAppGroup, "2")}) {
        const std::string directory = std::string("run/zorvane/sandbox/501/") + type;
        ASSERT_TRUE(map(containerClass, url));
        const auto there = world.names(directory);
        ASSERT_EQ(there.size(), 1U);
        EXPECT_EQ(std::filesystem::read_symlink(world.path(directory + "/" + there[0])).string(), url.path());
        for (int i = 0; i < 2; ++i)
            EXPECT_TRUE(map(containerClass, std::nullopt));
        EXPECT_TRUE(world.names(directory).empty());
        for (int* error : {&world.sandbox.removeError, &world.sandbox.setError}) {
            *error = EIO;
            EXPECT_FALSE(map(containerClass, url));
            *error = 0;
        }
    }
    ASSERT_TRUE(map(application, world.url("private/var/mobile/gone")));
    ASSERT_TRUE(map(ContainerClass::sharedAppGroup, url));
    // The home that is there may be no more than the place where the real one is mounted.
    world.daemonsClient().containerManagerSetup();
    EXPECT_EQ(world.names("run/zorvane/sandbox/501/1").size(), 1U);
    world.makeDirectories(mobileContainers, mobile);
    ASSERT_EQ(::symlink("/etc", world.path("run/zorvane/sandbox/501/1/outside").c_str()), 0);
    world.daemonsClient().containerManagerSetup();
    EXPECT_TRUE(world.names("run/zorvane/sandbox/501/1").empty());
    EXPECT_EQ(world.names("run/zorvane/sandbox/501/2").size(), 1U);
}

} // namespace
} // namespace zor::test
