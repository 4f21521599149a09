// SPDX-License-Identifier: Apache-2.0
// What the first launch of a boot makes of an older system: its bundles, well-known containers, group identifiers, and
// system containers that nobody is entitled to.
#include "plist/Read.h"
#include "world/World.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <stdexcept>
#include <sys/stat.h>
#include <unistd.h>

namespace zor::test {
namespace {

using support::hasLine;

constexpr const char* former = "private/var/mobile/Containers/Bundle";
const std::string bundles = std::string(sharedPath) + "/Bundle";
const std::string library = libraryPath;
const std::string bundleMarker = library + "/zor_bundle_migration_complete.plist";
const std::string groupMarker = library + "/zor_group_id_migration_complete.plist";
constexpr const char* firstUuid = "11111111-0000-4000-8000-000000000000";
constexpr const char* secondUuid = "22222222-0000-4000-8000-000000000000";
constexpr const char* perform = "performMigrationWithError";

std::string metadataIn(const std::string& container) {
    return container + "/" + names::metadataFile;
}

/// A container as an older system left it: all of it the mobile user's.
void putFormerBundle(const World& world, const std::string& directory, const plist::Dictionary& metadata) {
    world.makeDirectories(directory, mobile);
    world.write(directory + "/program", "code", 0755);
    world.write(metadataIn(directory), binary(metadata));
    for (const std::string& file : {directory + "/program", metadataIn(directory)})
        if (::geteuid() == 0 && ::chown(world.path(file).c_str(), mobile, mobile) != 0)
            throw std::runtime_error("cannot give away " + file);
}

ZORContainerMigrator::Outcome migrateBundles(World& world) {
    world.load();
    world.log.take();
    return world.services().store().migrator.performMigrationWithError();
}

// Goal: bundles of an older system end in the system's place, the installer's, found by their identifiers; what cannot
// be read stays and is counted; once the marker lies there nothing is touched. Method: containers of each kind, the
// migration twice, a lookup after a restart.
TEST(Migration, BundlesMoveOnce) {
    World world;
    putFormerBundle(world, std::string(former) + "/Application/" + firstUuid, metadataOf(1, mobile, "com.example.app"));
    putFormerBundle(world, std::string(former) + "/Framework/" + secondUuid, metadataOf(1, mobile, "wrong class"));
    const auto outcome = migrateBundles(world);
    EXPECT_TRUE(outcome.succeeded);
    EXPECT_EQ(outcome.migrated, 1U);
    ASSERT_TRUE(outcome.error);
    EXPECT_TRUE(outcome.error->is(ErrorCode::metadataInvalid));
    EXPECT_FALSE(world.exists(former));
    const std::string moved = bundles + "/Application/" + firstUuid;
    EXPECT_EQ(world.item(moved), directoryOf(33));
    EXPECT_EQ(world.item(bundles + "/Framework/" + secondUuid), directoryOf(33)); // re-owned all the same
    EXPECT_EQ(world.read(moved + "/program"), "code");
    EXPECT_EQ(world.item(metadataIn(moved)), "file 0644 0:0");
    EXPECT_TRUE(
        hasLine(world.log.take(), 5, perform, "Changing ownership of bundle container content. 1 errors so far"));
    const std::string bytes = world.read(bundleMarker);
    const auto marker = plist::readPropertyList({reinterpret_cast<const std::uint8_t*>(bytes.data()), bytes.size()});
    ASSERT_TRUE(marker && marker->asDictionary());
    EXPECT_EQ(*marker->asDictionary()->string("ZORMigrationVersionNumber"), "Unknown");
    EXPECT_EQ(marker->asDictionary()->string("ZORMigrationTime")->size(), 25U);

    putFormerBundle(world, std::string(former) + "/Application/" + secondUuid, metadataOf(1, mobile, "com.example.b"));
    world.restart();
    const auto again = migrateBundles(world);
    EXPECT_TRUE(again.succeeded && !again.error);
    EXPECT_TRUE(world.log.take().empty());
    EXPECT_TRUE(world.exists(std::string(former) + "/Application/" + secondUuid));
    const std::string identifier = "com.example.app";
    const auto found =
        world.daemonsClient().createOrLookupContainerForUser(33, &identifier, ContainerClass::bundleApplication, {});
    ASSERT_TRUE(found);
    EXPECT_EQ(found->path, world.path(moved));
}

// Goal: a migration that was cut short, or comes after new bundles were made, moves what is left container by
// container; a container that lies in both places was copied, and its source goes. Method: both places filled by hand.
TEST(Migration, BundlesJoinThoseThatAreThere) {
    World world;
    const std::string present = bundles + "/Application/" + firstUuid;
    putFormerBundle(world, present, metadataOf(1, mobile, "com.example.copied"));
    putFormerBundle(world, std::string(former) + "/Application/" + firstUuid, metadataOf(1, mobile, "source"));
    putFormerBundle(world, std::string(former) + "/VPNPlugin/" + secondUuid, metadataOf(5, mobile, "com.example.vpn"));
    const auto outcome = migrateBundles(world);
    EXPECT_TRUE(outcome.succeeded && !outcome.error);
    EXPECT_EQ(outcome.migrated, 2U);
    EXPECT_FALSE(world.exists(former));
    EXPECT_NE(world.read(metadataIn(present)).find("com.example.copied"), std::string::npos);
    EXPECT_TRUE(world.exists(bundles + "/VPNPlugin/" + secondUuid + "/program"));
    EXPECT_TRUE(world.exists(bundleMarker));
}

// Goal: the user who owned the old place cannot use the migration to reach anything else, nor keep it from ending.
// Method: links and files in the places of the old location, of what holds it, of a class directory and of a container,
// while the new location is empty and while it is not; links lead to a tree that must not change. Then the next boot.
TEST(Migration, BundlesOfAHostileOwner) {
    struct Row {
        const char* name;
        const char* place;
        bool isLink;
        bool joins;
        bool succeeds;
    };
    const Row rows[] = {
        {"the old location", "/Bundle", true, false, false},
        {"what holds it", "", true, false, true},
        {"a class directory", "/Bundle/Application", true, false, true},
        {"a container", "/Bundle/Application/11111111-0000-4000-8000-000000000000", true, false, true},
        {"the old location, beside others", "/Bundle", true, true, true},
        {"a class directory, beside others", "/Bundle/VPNPlugin", true, true, true},
        {"a file for a class directory, beside others", "/Bundle/VPNPlugin", false, true, true},
        {"a file for the old location, beside others", "/Bundle", false, true, true},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        World world;
        putFormerBundle(world, std::string("etc/elsewhere/Application/") + firstUuid, metadataOf(1, mobile, "a"));
        const std::string file = "etc/elsewhere/Application/" + std::string(firstUuid) + "/program";
        const std::string before = world.item(file);
        if (row.joins)
            putFormerBundle(world, bundles + "/Application/" + secondUuid, metadataOf(1, mobile, "b"));
        const std::string place = mobileContainers + std::string(row.place);
        world.makeDirectories(place.substr(0, place.rfind('/')), mobile);
        if (row.isLink)
            ASSERT_EQ(::symlink(world.path("etc/elsewhere").c_str(), world.path(place).c_str()), 0);
        else
            world.write(place, "x");
        const auto outcome = migrateBundles(world);
        EXPECT_EQ(outcome.succeeded, row.succeeds);
        EXPECT_EQ(outcome.migrated, row.joins ? 1U : 0U);
        EXPECT_EQ(world.exists(bundleMarker), row.succeeds);
        // A class directory can be had afterwards.
        const std::string identifier = "com.example.new";
        EXPECT_EQ(world.daemonsClient()
                      .createOrLookupContainerForUser(33, &identifier, ContainerClass::bundleApplication,
                                                      {.createIfNecessary = true})
                      .has_value(),
                  true);
        world.restart();
        EXPECT_TRUE(migrateBundles(world).succeeded);
        EXPECT_TRUE(world.exists(bundleMarker));
        EXPECT_EQ(world.item(file), before);
    }
}

// Goal: the migration that believes the mobile user's metadata files is not made a second time because its marker
// cannot be examined. Method: a link in the place of the directory that holds the marker.
TEST(Migration, AMarkerThatCannotBeExamined) {
    World world;
    world.makeDirectories("elsewhere");
    world.makeDirectories("private/var/root/Library");
    ASSERT_EQ(::symlink(world.path("elsewhere").c_str(), world.path(library).c_str()), 0);
    putFormerBundle(world, std::string(former) + "/Application/" + firstUuid, metadataOf(1, mobile, "a"));
    EXPECT_EQ(migrateBundles(world).migrated, 0U);
    EXPECT_TRUE(world.exists(std::string(former) + "/Application/" + firstUuid));
}

// Goal: each failure of the bundle migration has its words and its end: no marker where it must come again. Method: a
// disk that fails one kind of call.
TEST(Migration, BundleFailures) {
    using support::DiskCall;
    struct Row {
        const char* name;
        DiskCall call;
        bool succeeds;
        std::optional<ErrorCode> error;
    };
    const Row rows[] = {
        {"no move", DiskCall::rename, false, std::nullopt},
        {"no metadata file", DiskCall::createFile, true, ErrorCode::propertyListNotWritten},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        World world;
        putFormerBundle(world, std::string(former) + "/Application/" + firstUuid, metadataOf(1, mobile, "a"));
        world.services().configuration().bundleDirectory();
        world.services().configuration().libraryDirectory();
        world.load();
        world.log.take();
        world.disk().arm({.error = EROFS, .span = support::FaultSpan::fromThenOn, .filter = [&](const auto& call) {
                              return call.call == row.call;
                          }});
        const auto outcome = world.services().store().migrator.performMigrationWithError();
        world.disk().disarm();
        EXPECT_EQ(outcome.succeeded, row.succeeds);
        ASSERT_TRUE(outcome.error);
        if (row.error)
            EXPECT_TRUE(outcome.error->is(*row.error));
        else
            EXPECT_TRUE(outcome.error->isPosix(EROFS));
        EXPECT_FALSE(world.exists(bundleMarker));
        world.restart();
        EXPECT_TRUE(migrateBundles(world).succeeded); // the next boot
        EXPECT_TRUE(world.exists(bundleMarker));
    }
}

// Goal: a well-known container under a UUID moves to its name, others stay, and a second boot finds nothing to do; a
// name that is taken stops the pass. Method: containers of both classes, the migration twice.
TEST(Migration, WellknownContainers) {
    World world;
    const std::string system = std::string(sharedPath) + "/Data/System/";
    const std::string group = std::string(sharedPath) + "/Shared/SystemGroup/";
    world.putContainer(system + firstUuid, metadataOf(12, 499, "com.veltra.settingsd"));
    world.putContainer(system + secondUuid, metadataOf(12, 499, "com.example.other"));
    world.putContainer(group + firstUuid, metadataOf(13, 499, "systemgroup.com.veltra.fonts"));
    world.load();
    world.log.take();
    auto& migrator = world.services().store().migrator;
    EXPECT_EQ(migrator.performWhitelistMigrationWithError().migrated, 2U);
    EXPECT_TRUE(world.exists(system + "com.veltra.settingsd"));
    EXPECT_TRUE(world.exists(system + secondUuid));
    EXPECT_TRUE(world.exists(group + "systemgroup.com.veltra.fonts"));
    EXPECT_TRUE(hasLine(world.log.take(), 3, "performWhitelistMigrationWithError",
                        "Migrating well-known container com.veltra.settingsd"));
    const std::string identifier = "com.veltra.settingsd";
    const auto found = world.services().cache().containerForUser(499, ContainerClass::dataSystem, &identifier, false);
    ASSERT_TRUE(found);
    EXPECT_EQ((*found)->url().path(), world.path(system + identifier));
    EXPECT_EQ(migrator.performWhitelistMigrationWithError().migrated, 0U);
    EXPECT_TRUE(world.log.take().empty());

    World taken;
    taken.putContainer(system + firstUuid, metadataOf(12, 499, identifier));
    taken.write(system + identifier + "/something", "x");
    taken.load();
    taken.log.take();
    const auto failed = taken.services().store().migrator.performWhitelistMigrationWithError();
    EXPECT_FALSE(failed.succeeded);
    EXPECT_TRUE(taken.exists(system + firstUuid));
    const auto said = taken.log.take(3, "performWhitelistMigrationWithError");
    ASSERT_EQ(said.size(), 2U);
    EXPECT_TRUE(
        said[1].starts_with("-[ZORContainerMigrator performWhitelistMigrationWithError:]: Failed to move system "
                            "container com.veltra.settingsd from "));
}

plist::Dictionary metadataWithGroups(std::uint64_t containerClass, const std::string& identifier,
                                     const std::string& uuid) {
    plist::Dictionary metadata = metadataOf(containerClass, mobile, identifier, uuid);
    metadata.set("ZORMetadataInfo",
                 plist::Dictionary{{"com.veltra.Brevance.GroupContainerIDs", plist::Array{"group." + identifier}},
                                   {"kept", true}});
    return metadata;
}

// Goal: groups kept in data containers come into the map and leave the metadata, once; an error keeps the marker away
// and the next boot does the rest. Method: two containers, of which the second cannot be written the first time.
TEST(Migration, GroupIdentifiers) {
    World world({.logLevel = logLevelDebug});
    const std::string data = std::string(mobileContainers) + "/Data/";
    world.putContainer(data + "Application/" + firstUuid, metadataWithGroups(2, "com.example.a", firstUuid));
    world.putContainer(data + "KolvexPlugin/" + secondUuid, metadataWithGroups(4, "com.example.b", secondUuid));
    world.load();
    world.log.take();
    std::size_t metadataFiles = 0;
    world.disk().arm({.error = ENOSPC, .span = support::FaultSpan::fromThenOn, .filter = [&](const auto& call) {
                          // The second file of a container; the map's own files come between.
                          return call.call == support::DiskCall::createFile &&
                                 call.subject.find("metadata") != std::string::npos && ++metadataFiles > 1;
                      }});
    EXPECT_EQ(world.services().entitlements().migrateAppGroupIdsFromDataContainersToFile(), 1U);
    world.disk().disarm();
    EXPECT_FALSE(world.exists(groupMarker));
    constexpr const char* function = "migrateAppGroupIdsFromDataContainersToFile";
    EXPECT_TRUE(hasLine(world.log.take(), 3, function,
                        "Not writing the migration complete file because there we had 1 error(s)"));
    world.restart();
    world.load();
    EXPECT_EQ(world.services().entitlements().migrateAppGroupIdsFromDataContainersToFile(), 1U);
    EXPECT_TRUE(world.exists(groupMarker));
    using Groups = ZOREntitlementMapping::Identifiers;
    for (const char* identifier : {"com.example.a", "com.example.b"})
        EXPECT_EQ(world.services().entitlements().appGroupIdentifiersForIdentifier(identifier),
                  Groups({std::string("group.") + identifier}));
    const std::string first = world.read(metadataIn(data + "Application/" + firstUuid));
    EXPECT_EQ(first.find("GroupContainerIDs"), std::string::npos);
    EXPECT_NE(first.find("kept"), std::string::npos);
    world.log.take();
    EXPECT_EQ(world.services().entitlements().migrateAppGroupIdsFromDataContainersToFile(), 0U);
    EXPECT_TRUE(world.log.take().empty());
}

// Goal: as long as the migration of group identifiers has not ended, no application group goes because the map does not
// mention it, at boots and at releases; then those go that nobody refers to, also where the user whose containers it is
// about does not exist. Method: a link that keeps one list from being fetched, a boot, a release after a restart; a
// boot without the link; a device without the user.
TEST(Migration, GroupsStayUntilTheirIdentifiersAreMigrated) {
    World world;
    const std::string data = std::string(mobileContainers) + "/Data/";
    const std::string groups = "private/var/second/Containers/Shared/AppGroup";
    const std::string plugins = data + "VPNPlugin";
    const std::string app = "com.example.a";
    const std::string other = "com.example.b";
    world.putContainer(data + "Application/" + firstUuid, metadataWithGroups(2, app, firstUuid));
    world.putContainer(groups + "/" + firstUuid, metadataOf(7, second, "group." + app, firstUuid));
    world.putContainer(groups + "/" + secondUuid, metadataOf(7, second, "unreferenced", secondUuid));
    ASSERT_EQ(::symlink("/", world.path(plugins).c_str()), 0);
    const auto boot = [&] {
        world.restart();
        world.daemonsClient().rebootContainerManagerSetup();
    };
    boot();
    EXPECT_EQ(world.names(groups).size(), 2U);
    EXPECT_EQ(world.log.take(3, "reconcileGroupContainersOfType"),
              std::vector<std::string>{"Failed to get reference count information for group type: 0"});
    world.restart();
    ZOREntitlementMapping& mapping = world.services().entitlements();
    const plist::Dictionary entitled{{std::string(entitlementKeys::applicationGroups), plist::Array{"group." + app}}};
    ASSERT_EQ(mapping.processEntitlements(&entitled, &other, nullptr), ErrorCode::success);
    ASSERT_EQ(mapping.processEntitlements(nullptr, &other, nullptr), ErrorCode::success);
    EXPECT_EQ(world.names(groups).size(), 2U);
    ASSERT_EQ(::unlink(world.path(plugins).c_str()), 0);
    boot();
    EXPECT_EQ(world.names(groups), std::vector<std::string>{firstUuid});

    World without;
    without.write("etc/passwd", "second:x:502:502::/private/var/second:/bin/sh\n");
    without.putContainer(groups + "/" + secondUuid, metadataOf(7, second, "unreferenced", secondUuid));
    without.restart();
    without.daemonsClient().rebootContainerManagerSetup();
    EXPECT_TRUE(without.names(groups).empty());
}

// Goal: exactly the system containers that nobody is entitled to go, and none when the entitlements are not known.
// Method: three identifiers; then the same with an entitlement file that cannot be read.
TEST(Migration, UnentitledSystemContainers) {
    World world({.logLevel = logLevelDebug});
    const std::string system = std::string(sharedPath) + "/Data/System/";
    constexpr const char* thirdUuid = "33333333-0000-4000-8000-000000000000";
    world.putContainer(system + firstUuid, metadataOf(12, 499, "entitled", firstUuid));
    world.putContainer(system + secondUuid, metadataOf(12, 499, "not entitled", secondUuid));
    world.putContainer(system + thirdUuid, metadataOf(12, 499, "unknown", thirdUuid));
    const std::string entitlementFile = library + "/zor_entitlements.plist";
    world.write(entitlementFile, "broken");
    world.load();
    world.log.take();
    EXPECT_EQ(world.services().entitlements().reconcileSystemContainers(), 0U);
    EXPECT_EQ(world.log.take(3, "reconcileSystemContainers").size(), 1U);
    ASSERT_EQ(::unlink(world.path(entitlementFile + ".unreadable").c_str()), 0);
    const std::string key(entitlementKeys::systemContainer);
    ASSERT_TRUE(world.services().entitlements()._setEntitlementDictionaryValues(
        {plist::Dictionary{{key, true}}, plist::Dictionary{{key, false}}}, {"entitled", "not entitled"}));
    EXPECT_EQ(world.services().entitlements().reconcileSystemContainers(), 2U);
    EXPECT_EQ(world.names(system.substr(0, system.size() - 1)), std::vector<std::string>{firstUuid});
    EXPECT_EQ(world.log.take(3, "reconcileSystemContainers").size(), 2U);
}

} // namespace
} // namespace zor::test
