// SPDX-License-Identifier: Apache-2.0
// The first launch of a boot over an older system: its bundles, well-known containers and group identifiers.
#include "daemon/Daemon.h"
#include "world/World.h"

#include <atomic>
#include <gtest/gtest.h>
#include <stdexcept>
#include <unistd.h>

namespace zor::test {
namespace {

using plist::Array;
using plist::Dictionary;
using support::DiskCall;
using support::FaultSpan;

const std::string former = std::string(mobileContainers) + "/Bundle";
const std::string bundles = std::string(sharedPath) + "/Bundle";
const std::string system = std::string(sharedPath) + "/Data/System/";
const std::string bundleMarker = std::string(libraryPath) + "/zor_bundle_migration_complete.plist";
const std::string groupMarker = std::string(libraryPath) + "/zor_group_id_migration_complete.plist";
const std::string firstUuid = "11111111-0000-4000-8000-000000000000";
const std::string secondUuid = "22222222-0000-4000-8000-000000000000";
const std::string thirdUuid = "33333333-0000-4000-8000-000000000000";

std::string metadataIn(const std::string& container) {
    return container + "/" + names::metadataFile;
}

/// A bundle as an older system left it: all of it the mobile user's.
void putFormerBundle(const World& world, const std::string& directory, const std::string& identifier,
                     std::uint64_t containerClass = 1) {
    world.makeDirectories(directory, mobile);
    world.write(directory + "/program", "code", 0755);
    world.write(metadataIn(directory), binary(metadataOf(containerClass, mobile, identifier)));
    for (const std::string& file : {directory + "/program", metadataIn(directory)})
        if (::geteuid() == 0 && ::chown(world.path(file).c_str(), mobile, mobile) != 0)
            throw std::runtime_error("cannot give away " + file);
}

ZORContainerMigrator::Outcome migrateBundles(World& world) {
    world.load();
    world.log.take();
    return world.services().store().migrator.performMigrationWithError();
}

// Goal: a stop during a first boot ends it at the next item, wherever it comes, and loses nothing. Method: bundles with
// many files, on the system's file system or on another one; a stop at each look at whether there is one, each launch
// going on where the one before it was stopped; changes of the disk behind the stop are counted.
TEST(Migration, StopsAtTheNextItem) {
    for (const bool mounted : {false, true}) {
        SCOPED_TRACE(mounted);
        if (mounted && !MountedHome::canBe())
            GTEST_SKIP() << "only root may mount a home";
        World world;
        std::optional<MountedHome> home;
        if (mounted)
            home.emplace(world.path());
        for (const std::string& uuid : {firstUuid, secondUuid, thirdUuid}) {
            putFormerBundle(world, former + "/Application/" + uuid, "app" + uuid);
            for (int i = 0; i < 10; ++i)
                world.write(former + "/Application/" + uuid + "/" + std::to_string(i), "x");
        }
        int stops = 0;
        for (int allowed = 0; !world.bootMarker.state.present; ++allowed) {
            std::atomic<int> looks{0}; // the death row's thread asks the disk, too
            std::atomic<int> behind{0};
            world.restart();
            world.disk().arm({.filter = [&](const support::DiskCallInfo&) {
                behind += looks > allowed ? 1 : 0;
                return false;
            }});
            Daemon(world.services(), {.stopWanted = [&] { return looks++ >= allowed; }}).setUp();
            EXPECT_EQ(world.services().store().setup.stopped(), looks > allowed);
            world.disk().disarm();
            world.drainDeathRow();
            ASSERT_LT(behind, 12) << "after look " << allowed;
            stops += looks > allowed ? 1 : 0;
            ASSERT_LT(stops, 1000);
        }
        EXPECT_GT(stops, mounted ? 60 : 30);
        for (const std::string& uuid : {firstUuid, secondUuid, thirdUuid})
            for (int i = 0; i < 10; ++i)
                EXPECT_EQ(world.read(bundles + "/Application/" + uuid + "/" + std::to_string(i)), "x");
        EXPECT_TRUE(world.exists(bundleMarker));
    }
}

// Goal: an older system's bundles become the installer's, once; what cannot be read stays and is counted.
// Method: containers of each kind, the migration twice, a lookup after a restart.
TEST(Migration, BundlesMoveOnce) {
    World world;
    putFormerBundle(world, former + "/Application/" + firstUuid, "com.example.app");
    putFormerBundle(world, former + "/Framework/" + secondUuid, "wrong class");
    const auto outcome = migrateBundles(world);
    EXPECT_TRUE(outcome.succeeded && outcome.migrated == 1);
    EXPECT_TRUE(outcome.error && outcome.error->is(ErrorCode::metadataInvalid));
    EXPECT_FALSE(world.exists(former));
    const std::string moved = bundles + "/Application/" + firstUuid;
    for (const std::string& directory : {moved, bundles + "/Framework/" + secondUuid}) // re-owned all the same
        EXPECT_EQ(world.item(directory), directoryOf(33));
    EXPECT_EQ(world.read(moved + "/program"), "code");
    EXPECT_EQ(world.item(metadataIn(moved)), "file 0644 0:0");
    EXPECT_NE(world.read(bundleMarker).find("ZORMigrationTime"), std::string::npos);
    putFormerBundle(world, former + "/Application/" + secondUuid, "com.example.b");
    world.restart();
    const auto again = migrateBundles(world);
    EXPECT_TRUE(again.succeeded && !again.error && world.exists(former + "/Application/" + secondUuid));
    EXPECT_EQ(world.find("com.example.app", ContainerClass::bundleApplication)->path, world.path(moved));
}

// Goal: a well-known container that finds its name taken stays where it is. Method: something of that name.
TEST(Migration, ATakenName) {
    World world;
    world.putContainer(system + firstUuid, metadataOf(12, 499, "com.veltra.settingsd"));
    world.write(system + "com.veltra.settingsd/something", "x");
    EXPECT_FALSE(world.services().store().migrator.performWhitelistMigrationWithError().succeeded);
    EXPECT_TRUE(world.exists(system + firstUuid) && world.exists(system + "com.veltra.settingsd/something"));
}

// Goal: the old place's owner reaches nothing else by it, nor keeps the migration from ending. Method: a link, to a
// tree that must stay, or a file in each place, while the new location is empty and while it is not; then the next
// boot.
TEST(Migration, BundlesOfAHostileOwner) {
    enum class Put { link, file };
    struct Row {
        std::string place;
        Put put;
        bool besideOthers;
    };
    const std::string plugins = former + "/VPNPlugin";
    const Row rows[] = {
        {former, Put::link, false},
        {mobileContainers, Put::link, false},
        {former + "/Application", Put::link, false},
        {former + "/Application/" + firstUuid, Put::link, false},
        {former, Put::link, true},
        {plugins, Put::link, true},
        {plugins, Put::file, true},
        {former, Put::file, true},
    };
    for (const auto& [place, put, besideOthers] : rows) {
        SCOPED_TRACE(place + (put == Put::file ? ", a file" : "") + (besideOthers ? ", beside others" : ""));
        const bool succeeds = place != former || besideOthers;
        World world;
        const std::string container = "etc/elsewhere/Application/" + firstUuid;
        putFormerBundle(world, container, "a");
        const std::string before = world.item(container + "/program");
        if (besideOthers)
            putFormerBundle(world, bundles + "/Application/" + secondUuid, "b");
        world.makeDirectories(parentOf(place), mobile);
        if (put == Put::file)
            world.write(place, "x");
        else
            world.link(world.path("etc/elsewhere"), place);
        const auto outcome = migrateBundles(world);
        EXPECT_EQ(outcome.succeeded, succeeds);
        EXPECT_EQ(outcome.migrated, besideOthers ? 1U : 0U);
        EXPECT_EQ(world.exists(bundleMarker), succeeds);
        // A class directory can be had afterwards.
        EXPECT_TRUE(world.create("com.example.new", ContainerClass::bundleApplication));
        world.restart();
        EXPECT_TRUE(migrateBundles(world).succeeded);
        EXPECT_TRUE(world.exists(bundleMarker));
        EXPECT_EQ(world.item(container + "/program"), before);
    }
}

// Goal: what lies in the old place and is neither the old owner's nor the installer's stays whose and how it is, keeps
// nothing else from moving, and is said. Method: a closed directory, of root's and of another user's, by each name.
TEST(Migration, WhatBelongsToOthersStaysTheirs) {
    if (::geteuid() != 0)
        GTEST_SKIP() << "skipped: needs root for directories of several users";
    struct Row {
        std::string place;
        bool othersMove;
        std::string after; // where it is then
    };
    const std::string inside = "/Application/" + firstUuid + "/private";
    const Row rows[] = {
        {former, false, former},
        {former + "/Application", false, former + "/Application"},
        {former + "/Framework", true, former + "/Framework"},
        {former + "/Application/" + secondUuid, true, former + "/Application/" + secondUuid},
        {former + inside, true, bundles + inside},
    };
    for (const Row& row : rows)
        for (const std::uint32_t owner : {0U, second}) {
            SCOPED_TRACE(row.place);
            World world;
            if (row.othersMove)
                putFormerBundle(world, former + "/Application/" + firstUuid, "a");
            world.makeDirectories(row.place, owner, 0700);
            world.write(row.place + "/" + secondUuid + "/secret", "s", 0600);
            const std::string before = support::readTree(world.path(row.place)).describe();
            const auto outcome = migrateBundles(world);
            EXPECT_TRUE(outcome.succeeded && !outcome.error);
            EXPECT_EQ(outcome.migrated, row.othersMove ? 1U : 0U);
            EXPECT_TRUE(world.exists(bundleMarker));
            EXPECT_EQ(world.item(row.after), directoryOf(owner, 0700));
            EXPECT_EQ(support::readTree(world.path(row.after)).describe(), before);
            EXPECT_TRUE(std::ranges::any_of(world.log.take(), [](const support::LogLine& line) {
                return line.message.find(" belongs to ") != std::string::npos;
            }));
            EXPECT_TRUE(world.create("com.example.new", ContainerClass::bundleApplication));
        }
}

// Goal: a marker that cannot be examined brings no second migration, which would believe the mobile user's metadata.
// Method: a link in the place of its directory.
TEST(Migration, AMarkerThatCannotBeExamined) {
    World world;
    world.makeDirectories("elsewhere");
    world.makeDirectories(parentOf(libraryPath));
    world.link(world.path("elsewhere"), libraryPath);
    putFormerBundle(world, former + "/Application/" + firstUuid, "a");
    EXPECT_EQ(migrateBundles(world).migrated, 0U);
    EXPECT_TRUE(world.exists(former + "/Application/" + firstUuid));
}

/// A container that keeps its group itself, as an older system left it.
void putWithGroup(const World& world, const std::string& directory, std::uint64_t containerClass,
                  const std::string& identifier, const std::string& uuid) {
    Dictionary metadata = metadataOf(containerClass, mobile, identifier, uuid);
    metadata.set("ZORMetadataInfo",
                 Dictionary{{"com.veltra.Brevance.GroupContainerIDs", Array{"group." + identifier}}, {"kept", true}});
    world.putContainer(directory + "/" + uuid, metadata);
}

// Goal: until the migration has ended no application group goes because the map does not mention it; then each goes
// that nobody refers to, also where the migration's user does not exist. Method: a link in the place of one list, a
// boot, a release after a restart; a boot without the link; a device without the user.
TEST(Migration, GroupsStayUntilTheirIdentifiersAreMigrated) {
    const std::string groups = "private/var/second/Containers/Shared/AppGroup";
    const std::string plugins = std::string(mobileContainers) + "/Data/VPNPlugin";
    World world;
    putWithGroup(world, applications, 2, "a", firstUuid);
    world.putContainer(groups + "/" + firstUuid, metadataOf(7, second, "group.a", firstUuid));
    world.putContainer(groups + "/" + secondUuid, metadataOf(7, second, "unreferenced", secondUuid));
    world.link("/", plugins);
    world.reboot();
    world.restart();
    const Dictionary entitled{{std::string(entitlementKeys::applicationGroups), Array{"group.a"}}};
    for (const auto& entitlements : {std::optional(entitled), std::optional<Dictionary>()})
        ASSERT_EQ(world.entitle("com.example.b", entitlements), ErrorCode::success);
    EXPECT_EQ(world.names(groups).size(), 2U);
    std::filesystem::remove(world.path(plugins));
    world.reboot();
    EXPECT_EQ(world.names(groups), std::vector<std::string>{firstUuid});

    World without;
    without.write("etc/passwd", "second:x:502:502::/private/var/second:/bin/sh\n");
    without.putContainer(groups + "/" + secondUuid, metadataOf(7, second, "unreferenced", secondUuid));
    without.reboot();
    EXPECT_TRUE(without.names(groups).empty());
}

} // namespace
} // namespace zor::test
