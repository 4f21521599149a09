// SPDX-License-Identifier: Apache-2.0
// Conditions that a boot may meet, and what they may not cost: each row is a device, one boot or more over it, and a
// look at what has to be there afterwards.
#include "store/ZOREntitlementMapping.h"
#include "support/EncryptedDisk.h"
#include "world/World.h"

#include <gtest/gtest.h>

namespace zor::test {
namespace {

using plist::Array;
using plist::Dictionary;
using support::DiskCall;

const std::string uuids[] = {"11111111-0000-4000-8000-000000000000", "22222222-0000-4000-8000-000000000000"};
const std::string appGroups(entitlementKeys::applicationGroups);
const std::string groupsOfSecond = "private/var/second/Containers/Shared/AppGroup";
const std::string formerBundle = std::string(mobileContainers) + "/Bundle/Application/" + uuids[0];
const std::string bundleMarker = std::string(libraryPath) + "/zor_bundle_migration_complete.plist";

/// A group's container of the second user.
void putGroup(World& world, const std::string& group, const std::string& uuid) {
    world.putContainer(groupsOfSecond + "/" + uuid, metadataOf(7, second, group, uuid));
}

/// A data container of mobile's that names its groups itself, as an older system left it.
void putWithGroup(World& world, const std::string& identifier, const std::string& group) {
    Dictionary metadata = metadataOf(2, mobile, identifier, uuids[0]);
    metadata.set("ZORMetadataInfo", Dictionary{{"com.veltra.Brevance.GroupContainerIDs", Array{group}}});
    world.putContainer(applications + "/" + uuids[0], metadata);
}

constexpr const char* home = "private/var/mobile";
constexpr const char* away = "private/var/away";

/// Judges what is there of a user whose groups wait in data containers that nobody can see now.
void expectNothingConcluded(World& world, const std::string& otherMarker = bundleMarker) {
    for (const std::string& marker : {std::string(groupMarkerPath), otherMarker})
        EXPECT_FALSE(!marker.empty() && world.exists(marker)) << marker;
    EXPECT_EQ(codeOf(world.find("app")), ErrorCode::cacheNotRebuilt);
    EXPECT_EQ(codeOf(world.create("other")), ErrorCode::cacheNotRebuilt);
    EXPECT_TRUE(world.exists("run/zorvane/sandbox/501/1/app"));
}

/// A data container of mobile's that names a group which the second user has a container of, and its mapping.
void putReferenced(World& world) {
    world.write("etc/passwd", "mobile:x:501:501::/private/var/mobile:/bin/sh\n"
                              "second:x:502:502::/private/var/second:/bin/sh\n");
    putWithGroup(world, "app", "group.old");
    putGroup(world, "group.old", uuids[0]);
    ASSERT_FALSE(world.sandbox.setMapping(mobile, platform::SandboxItemType::dataContainer, "app",
                                          world.path(applications + "/" + uuids[0])));
}

void expectReferenced(World& world) {
    EXPECT_TRUE(world.find("app"));
    EXPECT_EQ(codeOf(world.find("other")), ErrorCode::notFound);
    world.reboot();
    EXPECT_TRUE(world.exists(groupMarkerPath) && world.exists(bundleMarker));
    EXPECT_EQ(world.services().entitlements().appGroupIdentifiersForIdentifier("app"),
              ZOREntitlementMapping::Identifiers({"group.old"}));
}

/// A disk that sees an encryption without its key on one directory, and makes nothing there. The test moves aside what
/// the kernel hides then.
void lock(World& world, const std::string& directory) {
    const auto locked = [path = world.path(directory)](int fd) {
        return std::filesystem::read_symlink("/proc/self/fd/" + std::to_string(fd)) == path;
    };
    world.disk().locked = locked;
    world.disk().arm({.error = ENOKEY,
                      .span = support::FaultSpan::fromThenOn,
                      .filter = [locked](const support::DiskCallInfo& call) {
                          return call.call == DiskCall::makeDirectory && locked(call.fd);
                      }});
}

void unlock(World& world) {
    world.disk().locked = {};
    world.disk().disarm();
}

struct Condition {
    const char* name;
    std::function<void(World&)> meet;
    /// Containers that have to be where they are, relative to the root.
    std::vector<std::string> stays;
    std::function<void(World&)> judge;
};

// Goal: nothing that a boot meets costs what somebody refers to, and what it could not do a later boot does.
// Method: a table of conditions, each met over a real root.
TEST(BootConditions, CostNothing) {
    const Condition conditions[] = {
        {"a group given as one string",
         [](World& world) {
             world.entitle("app", Dictionary{{appGroups, "group.text"}});
             putGroup(world, "group.text", uuids[0]);
             world.reboot();
         },
         {groupsOfSecond + "/" + uuids[0]},
         [](World& world) {
             EXPECT_EQ(world.services().entitlements().appGroupIdentifiersForIdentifier("app"),
                       ZOREntitlementMapping::Identifiers({"group.text"}));
         }},
        {"a registration before the group migration",
         [](World& world) {
             world.entitle("app", Dictionary{{appGroups, Array{"group.new"}}, {"kept", true}});
             putWithGroup(world, "app", "group.old");
             putGroup(world, "group.old", uuids[0]);
             putGroup(world, "group.new", uuids[1]);
             world.reboot();
         },
         {groupsOfSecond + "/" + uuids[0], groupsOfSecond + "/" + uuids[1]},
         [](World& world) {
             EXPECT_EQ(*world.services().entitlements().entitlementMappingDict().dictionary("app"),
                       (Dictionary{{appGroups, Array{"group.new", "group.old"}}, {"kept", true}}));
         }},
        {"a bundle's record that cannot be written once",
         [](World& world) {
             world.putContainer(formerBundle, metadataOf(1, mobile, "bundle", uuids[0]));
             world.restart();
             world.load();
             world.disk().arm({.error = EIO, .filter = [](const auto& call) {
                                   return call.call == DiskCall::createFile &&
                                          call.subject.find("metadata") != std::string::npos;
                               }});
             world.boot();
             world.disk().disarm();
             EXPECT_FALSE(world.exists(bundleMarker));
             EXPECT_FALSE(world.find("bundle", ContainerClass::bundleApplication));
             world.reboot();
         },
         {bundleMarker},
         [](World& world) { EXPECT_TRUE(world.find("bundle", ContainerClass::bundleApplication)); }},
        {"a home that comes after the boot",
         [](World& world) {
             putReferenced(world);
             world.move(home, away);
             world.reboot();
             expectNothingConcluded(world);
             EXPECT_FALSE(world.exists(home));
             world.move(away, home);
         },
         {groupsOfSecond + "/" + uuids[0]},
         expectReferenced},
        {"a home that another one takes the place of, and back",
         [](World& world) {
             putReferenced(world);
             world.reboot();
             ASSERT_TRUE(world.find("app"));
             world.move(home, away);
             EXPECT_EQ(codeOf(world.find("app")), ErrorCode::cacheNotRebuilt);
             EXPECT_EQ(codeOf(world.create("new")), ErrorCode::cacheNotRebuilt);
             EXPECT_FALSE(world.exists(home));
             world.makeDirectories(home, mobile);
             EXPECT_EQ(codeOf(world.find("app")), ErrorCode::notFound);
             world.make("app");
             std::filesystem::remove_all(world.path(home));
             world.move(away, home);
             // Made anew, it would be there twice.
             EXPECT_EQ(world.make("app").path, world.path(applications + "/" + uuids[0]));
         },
         {groupsOfSecond + "/" + uuids[0]},
         expectReferenced},
        {"a user who is added",
         [](World& world) {
             world.boot();
             EXPECT_FALSE(world.create("app", application, false, 505));
             world.makeDirectories("home/added", 505);
             world.write("etc/passwd", "added:x:505:505::/home/added:/bin/sh\n");
             world.make("app", application, false, 505);
         },
         {"home/added/Containers/Data/Application"},
         [](World&) {}},
        {"a home that is locked",
         [](World& world) {
             putReferenced(world);
             world.move(mobileContainers, away);
             lock(world, home);
             world.reboot();
             expectNothingConcluded(world);
             EXPECT_FALSE(world.exists(mobileContainers));
             unlock(world);
             world.move(away, mobileContainers);
         },
         {groupsOfSecond + "/" + uuids[0]},
         expectReferenced},
        {"a container that is locked",
         [](World& world) {
             putReferenced(world);
             world.make("known");
             const std::string file = applications + "/" + uuids[0] + "/" + names::metadataFile;
             world.move(file, away);
             lock(world, applications + "/" + uuids[0]);
             world.reboot();
             expectNothingConcluded(world, "");
             EXPECT_TRUE(world.find("known"));
             world.move(away, file);
             unlock(world);
         },
         {groupsOfSecond + "/" + uuids[0], applications + "/" + uuids[0]},
         expectReferenced},
    };
    for (const Condition& condition : conditions) {
        SCOPED_TRACE(condition.name);
        World world;
        condition.meet(world);
        for (const std::string& path : condition.stays)
            EXPECT_TRUE(world.exists(path)) << path;
        condition.judge(world);
    }
}

// Goal: the same where the kernel itself hides what is there. Method: mobile's home on an encrypted file system; a boot
// while its key is away, requests before, meanwhile and after.
TEST(BootConditions, ALockedFileSystem) {
    World world;
    support::EncryptedDisk disk(world.path("private/var/encrypted"));
    if (!disk.missing().empty())
        GTEST_SKIP() << "skipped: " << disk.missing();
    world.write("etc/passwd", "mobile:x:501:501::" + disk.directory().substr(world.path().size()) + ":/bin/sh\n");
    world.write(bundleMarker, "");
    world.restart();
    const FoundContainer found = world.make("app");
    ASSERT_FALSE(world.sandbox.setMapping(mobile, platform::SandboxItemType::dataContainer, "app", found.path));
    ASSERT_TRUE(disk.takeKeyAway());
    EXPECT_EQ(codeOf(world.find("app")), ErrorCode::cacheNotRebuilt);
    EXPECT_EQ(codeOf(world.daemonsClient().metadataForUser(
                  {.userId = mobile, .uuid = found.uuid, .identifier = "app", .containerClass = application})),
              ErrorCode::cacheNotRebuilt);
    world.reboot();
    expectNothingConcluded(world, "");
    ASSERT_TRUE(disk.giveKey());
    EXPECT_EQ(world.find("app")->path, found.path);
    world.reboot();
    EXPECT_EQ(world.find("app")->path, found.path);
    EXPECT_TRUE(world.exists(groupMarkerPath));
    world.restart();
}

} // namespace
} // namespace zor::test
