// SPDX-License-Identifier: Apache-2.0
// The setup of a launch and of a boot: what counts as orphaned, what is swept, who is skipped; and the sandbox
// mappings.
#include "world/World.h"

#include <filesystem>
#include <gtest/gtest.h>
#include <set>
#include <unistd.h>

namespace zor::test {
namespace {

using support::hasLine;
using support::LogLine;

const std::string applications = std::string(mobileContainers) + "/Data/Application";
const std::string shared = sharedPath;
constexpr const char* goodUuid = "11111111-0000-4000-8000-000000000000";
constexpr const char* lowerUuid = "abcdef00-0000-4000-8000-00000000000a";
constexpr const char* bareUuid = "22222222-0000-4000-8000-000000000000";
constexpr const char* cleanup = "_cleanupOrphanedDataForUser";

// Goal: each entry of a class directory is kept or goes by its name and its metadata file alone. Method: a table over
// names, files and classes, judged after one boot.
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
    const Row rows[] = {
        {applications, goodUuid, File::good, true},
        {applications, lowerUuid, File::good, true},
        {applications, "33333333-0000-4000-8000-000000000000", File::invalid, true},
        {applications, bareUuid, File::missing, false},
        {applications, "Junk", File::good, false},
        {applications, "com.veltra.settingsd", File::good, false},
        {"private/var/second/Containers/Shared/AppGroup", bareUuid, File::missing, false},
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
    world.makeDirectories(system + "/short-name-without-file");
    world.makeDirectories(applications + "/.hidden");
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
    world.write(applications + "/" + "44444444-0000-4000-8000-000000000000", "a file with a good name");
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
    EXPECT_TRUE(world.exists(applications + "/44444444-0000-4000-8000-000000000000"));
    const auto dead = world.deathRow();
    EXPECT_EQ(std::multiset<std::string>(dead.begin(), dead.end()), gone);
    std::set<std::string> said;
    for (const std::string& message : world.log.take(3, cleanup))
        said.insert(message);
    EXPECT_EQ(said,
              (std::set<std::string>{
                  "Deleting orphaned data missing a metadata file at: " + world.path(applications + "/" + bareUuid),
                  "Deleting orphaned data missing a metadata file at: " +
                      world.path(std::string("private/var/second/Containers/Shared/AppGroup/") + bareUuid)}));
}

// Goal: a table of well-known names that cannot be read whole costs no container, and moves none; one that says less
// than it did does. Method: what may be wrong with the file, a boot over a name that only the administrator's table can
// give, then one with a good table that gives it no more.
TEST(Setup, ATableThatCannotBeReadDeletesNothing) {
    const std::string table = "etc/zorvane/wellknown.plist";
    const std::string system = shared + "/Data/System/";
    const auto naming = [](plist::Value names) { return binary(plist::Dictionary{{"System", std::move(names)}}); };
    struct Row {
        const char* name;
        std::string bytes;
        mode_t mode;
    };
    const Row rows[] = {
        {"nonsense", "x", 0644},
        {"writable by others", naming(plist::Dictionary{{"com.veltra.other", "short-name"}}), 0664},
        {"a row", naming(plist::Dictionary{{"com.veltra.other", "short/name"}}), 0644},
        {"no dictionary", naming(plist::Array{"com.veltra.other"}), 0644},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        World world;
        const plist::Dictionary entitled{{std::string(entitlementKeys::systemContainer), true}};
        ASSERT_TRUE(world.services().entitlements()._setEntitlementDictionaryValues(
            {entitled, entitled}, {"com.veltra.other", "com.veltra.settingsd"}));
        world.putContainer(system + "short-name", metadataOf(12, 499, "com.veltra.other", bareUuid));
        world.putContainer(system + goodUuid, metadataOf(12, 499, "com.veltra.settingsd", goodUuid));
        const auto boot = [&](const std::string& bytes, mode_t mode) {
            world.write(table, bytes, mode);
            world.restart();
            world.daemonsClient().rebootContainerManagerSetup();
        };
        boot(row.bytes, row.mode);
        EXPECT_EQ(world.names(shared + "/Data/System"), (std::vector<std::string>{goodUuid, "short-name"}));
        EXPECT_EQ(world.log.take(3, cleanup),
                  std::vector<std::string>{"Leaving " + world.path(system + "short-name") +
                                           ": the table of well-known containers, which may name it, could not be "
                                           "read"});
        boot(naming(plist::Dictionary{{"com.veltra.settingsd", "settings"}}), 0644);
        EXPECT_EQ(world.names(shared + "/Data/System"), std::vector<std::string>{"settings"});
    }
}

TEST(Setup, AnInternalBuildShowsWhatItDeletes) {
    World world;
    world.internalBuild.internal = true;
    world.write(applications + "/Junk/file", "x");
    world.load();
    world.log.take();
    world.daemonsClient()._cleanupOrphanedDataForUser(mobile, ContainerClass::dataApplication);
    const std::string junk = world.path(applications + "/Junk");
    const auto said = world.log.take();
    ASSERT_EQ(said.size(), 6U);
    EXPECT_EQ(said[1], (LogLine{3, cleanup,
                                "***INTERNAL BUILD REQUEST: If you see this, file a Tracklet in \"Zorvane | all\" with "
                                "the following data:"}));
    EXPECT_EQ(said[2], (LogLine{3, cleanup,
                                "\tSomeone is writing invalid data to a container, which has now been orphaned. Here "
                                "are the invalid files:"}));
    EXPECT_EQ(said[3], (LogLine{3, "printDirectoryStructureAtURL", "\tOrphaned File: " + junk}));
    EXPECT_EQ(said[4], (LogLine{3, "printDirectoryStructureAtURL", "\tOrphaned File: " + junk + "/file"}));
    EXPECT_EQ(said[5], (LogLine{3, cleanup, "***END INTERNAL BUILD REQUEST"}));
    EXPECT_FALSE(world.exists(applications + "/Junk"));
}

// Goal: a boot throws all transient containers away and touches no user without a home; the launch empties staging and
// death row, and what it found out while setting up is forgotten. Method: containers of every kind before, a boot, a
// launch.
TEST(Setup, BootAndLaunch) {
    World world;
    const std::string identifier = "com.example";
    const plist::Dictionary groups{{std::string(entitlementKeys::applicationGroups), plist::Array{identifier}},
                                   {std::string(entitlementKeys::systemContainer), true}};
    ASSERT_EQ(world.services().entitlements().processEntitlements(&groups, &identifier, nullptr), ErrorCode::success);
    const auto make = [&](std::uint32_t userId, ContainerClass containerClass, bool transient) {
        return world.daemonsClient()
            .createOrLookupContainerForUser(userId, &identifier, containerClass,
                                            {.createIfNecessary = true, .transient = transient})
            .value();
    };
    std::vector<FoundContainer> live;
    std::vector<FoundContainer> transient;
    for (const auto& [userId, containerClass] :
         {std::pair(mobile, ContainerClass::dataApplication), std::pair(second, ContainerClass::sharedAppGroup),
          std::pair(33U, ContainerClass::bundleApplication), std::pair(499U, ContainerClass::dataSystem)}) {
        live.push_back(make(userId, containerClass, false));
        transient.push_back(make(userId, containerClass, true));
    }
    world.restart();
    world.makeDirectories(std::string(cachesPath) + "/Staging/half-made");
    world.makeDirectories(std::string(cachesPath) + "/Dead/temp.abcdef/old");
    world.load();
    (void)world.daemonsClient().containersForUser(mobile, ContainerClass::dataApplication, false);
    EXPECT_EQ(world.services().cache().counts().classCaches, 1U);
    world.daemonsClient().rebootContainerManagerSetup();
    EXPECT_EQ(world.names(std::string(cachesPath) + "/Dead").size(), 5U); // no pass was started
    EXPECT_TRUE(world.exists(std::string(cachesPath) + "/Staging/half-made"));
    world.daemonsClient().containerManagerSetup();
    world.drainDeathRow();
    EXPECT_TRUE(world.names(std::string(cachesPath) + "/Staging").empty());
    EXPECT_TRUE(world.names(std::string(cachesPath) + "/Dead").empty());
    EXPECT_EQ(world.services().cache().counts().classCaches, 0U);
    for (const FoundContainer& container : live)
        EXPECT_EQ(::access(container.path.c_str(), F_OK), 0) << container.path;
    for (const FoundContainer& container : transient)
        EXPECT_NE(::access(container.path.c_str(), F_OK), 0) << container.path;
    const auto again = world.daemonsClient().containersForUser(mobile, ContainerClass::dataApplication, true);
    ASSERT_TRUE(again);
    EXPECT_TRUE(again->empty());
    EXPECT_FALSE(world.exists("private/var/nowhere"));
    for (const LogLine& line : world.log.take())
        EXPECT_FALSE(line.message.starts_with("Failed to delete")) << line;
}

// Goal: no failure stops a setup. Method: a disk on which no move succeeds; every step says so and the rest runs.
TEST(Setup, GoesOnAfterFailures) {
    World world;
    world.makeDirectories(std::string(cachesPath) + "/Staging/half-made");
    world.load();
    world.services().configuration().transientDirectory();
    world.services().configuration().transientBundleDirectory();
    world.services().configuration().getPerUserConfigurationForUserId(mobile)->transientDirectory();
    world.services().configuration().deathrowDirectory();
    world.log.take();
    world.disk().arm({.error = EROFS, .span = support::FaultSpan::fromThenOn, .filter = [](const auto& call) {
                          return call.call == support::DiskCall::rename;
                      }});
    world.daemonsClient().rebootContainerManagerSetup();
    world.daemonsClient().containerManagerSetup();
    world.drainDeathRow();
    world.disk().disarm();
    std::vector<std::string> starts;
    for (const std::string& message : world.log.take(3, "rebootContainerManagerSetup"))
        starts.push_back(message.substr(0, message.find(" : ")));
    EXPECT_EQ(starts, (std::vector<std::string>{
                          "Failed to migrate bundle containers to system location",
                          "Failed to migrate whitelisted bundle containers",
                          "Failed to delete shared transient URL " + world.path(cachesPath) + "/Temp",
                          "Failed to delete shared transient bundle URL " +
                              world.path("private/var/brevad/Library/Caches/com.veltra.zorvaned"),
                          "Failed to delete per-user transient URL " + world.path(mobileCaches) + "/Temp",
                          "Failed to delete per-user transient URL " +
                              world.path("private/var/second/Containers/Library/Caches/com.veltra.zorvaned/Temp"),
                      }));
    EXPECT_TRUE(world.exists(std::string(cachesPath) + "/Staging/half-made"));
    // Somebody's link in the place of a directory is neither followed nor emptied.
    world.makeDirectories("elsewhere/kept");
    for (const std::string& place : {std::string(libraryPath) + "/Replace", applications}) {
        std::filesystem::remove_all(world.path(place));
        ASSERT_EQ(::symlink(world.path("elsewhere").c_str(), world.path(place).c_str()), 0);
    }
    world.daemonsClient().rebootContainerManagerSetup();
    world.daemonsClient().containerManagerSetup();
    world.drainDeathRow();
    EXPECT_TRUE(world.exists("elsewhere/kept"));
    std::set<std::string> unread;
    for (const LogLine& line : world.log.take())
        if (line.message.starts_with("Failed to get items at "))
            unread.insert(line.function);
    EXPECT_EQ(unread, (std::set<std::string>{cleanup, "_recoverFromReplaceOperationsWithError"}));
}

// Goal: a mapping is removed, then set; either failure is said and is the answer. Method: a table over class and
// failure.
TEST(SandboxMapping, RemovesThenSets) {
    World world;
    world.load();
    world.log.take();
    const std::string identifier = "com.example/odd";
    const FileURL url = world.url("private/var/mobile");
    const auto map = [&](ContainerClass containerClass, const std::optional<FileURL>& to) {
        return world.daemonsClient()._setSandboxContainerMappingForUser(mobile, identifier, containerClass, to);
    };
    for (const ContainerClass unsupported : {ContainerClass::bundleApplication, ContainerClass::dataSystem,
                                             ContainerClass::sharedSystemGroup, ContainerClass::undefined}) {
        EXPECT_FALSE(map(unsupported, url));
        EXPECT_EQ(world.log.take(), (std::vector<LogLine>{{3, "_setSandboxContainerMappingForUser",
                                                           "Unsupported class for setting sandbox container mapping: " +
                                                               std::to_string(static_cast<int>(unsupported))}}));
    }
    struct Row {
        ContainerClass containerClass;
        const char* type;
    };
    for (const Row& row : {Row{ContainerClass::dataApplication, "1"}, Row{ContainerClass::sharedAppGroup, "2"}}) {
        const std::string directory = std::string("run/zorvane/sandbox/501/") + row.type;
        ASSERT_TRUE(map(row.containerClass, url));
        const auto there = world.names(directory);
        ASSERT_EQ(there.size(), 1U);
        char target[4096] = "";
        ASSERT_GT(::readlink(world.path(directory + "/" + there[0]).c_str(), target, sizeof target - 1), 0);
        EXPECT_EQ(target, url.path());
        EXPECT_TRUE(map(row.containerClass, std::nullopt));
        EXPECT_TRUE(map(row.containerClass, std::nullopt));
        EXPECT_TRUE(world.names(directory).empty());
        const std::string tail = std::string("class: ") + (row.type[0] == '1' ? "2" : "7") + ", path: ";
        world.sandbox.removeError = EIO;
        EXPECT_FALSE(map(row.containerClass, url));
        world.sandbox.removeError = 0;
        world.sandbox.setError = ENOSPC;
        EXPECT_FALSE(map(row.containerClass, url));
        world.sandbox.setError = 0;
        EXPECT_EQ(
            world.log.take(3, "_setSandboxContainerMappingForUser"),
            (std::vector<std::string>{"Failed to remove mapping for user: 501, itemType: " + std::string(row.type) +
                                          ", identifier: com.example/odd, " + tail + "(null) : 5",
                                      "Failed to set mapping for user: 501, itemType: " + std::string(row.type) +
                                          ", identifier com.example/odd, " + tail + url.path() + " : 28"}));
    }
    // A stop between the move of a container and its mapping leaves one that points to nothing; the launch removes it.
    ASSERT_TRUE(map(ContainerClass::dataApplication, world.url("private/var/mobile/gone")));
    ASSERT_TRUE(map(ContainerClass::sharedAppGroup, url));
    world.daemonsClient().containerManagerSetup();
    EXPECT_TRUE(world.names("run/zorvane/sandbox/501/1").empty());
    EXPECT_EQ(world.names("run/zorvane/sandbox/501/2").size(), 1U);
    EXPECT_TRUE(
        hasLine(world.log.take(), 5, "containerManagerSetup", "Removed 1 sandbox mappings whose container is gone"));
}

} // namespace
} // namespace zor::test
