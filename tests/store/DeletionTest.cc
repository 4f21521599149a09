// SPDX-License-Identifier: Apache-2.0
// Taking containers out of the store: what a batch stages and says, what goes with each class, disks that refuse, and
// owners who swap what is to be deleted.
#include "store/ZOREntitlementMapping.h"
#include "world/World.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

namespace zor::test {
namespace {

using plist::Dictionary;
using support::DiskCall;
using support::DiskCallInfo;
using Batch = ZORClientConnection::DeletionBatch;

class Deletion : public testing::Test {
protected:
    Deletion() { world.load(); }
    static void add(Batch& batch, std::uint32_t user, std::optional<UUID> uuid, std::optional<std::string> identifier,
                    std::expected<std::uint64_t, std::string> containerClass) {
        batch.users.push_back(user);
        batch.uuids.push_back(uuid);
        batch.identifiers.push_back(std::move(identifier));
        batch.classes.push_back(std::move(containerClass));
    }
    /// A container's move to death row, whichever name it gets there.
    static bool isMoveOf(const FoundContainer& container, const DiskCallInfo& call) {
        return call.call == DiskCall::rename && call.subject.starts_with(nameOf(container.path) + " -> ");
    }

    World world;
};

// Goal: bad elements are said and skipped, missing ones skipped, good ones go. Method: one batch of every kind.
TEST_F(Deletion, AMixedBatch) {
    const FoundContainer first = world.make("first");
    const FoundContainer kept = world.make("kept");
    const FoundContainer last = world.make("last", ContainerClass::sharedAppGroup);
    const FoundContainer thrownAway = world.make("kept", application, asTransient);
    Batch batch;
    add(batch, mobile, first.uuid, "first", 2);
    // These are said.
    add(batch, mobile, kept.uuid, "kept", std::unexpected("\"2\""));
    add(batch, mobile, std::nullopt, "kept", 2);
    add(batch, mobile, kept.uuid, std::nullopt, 2);
    add(batch, mobile, kept.uuid, "kept", ~std::uint64_t{0});
    // And these not.
    add(batch, second, kept.uuid, "kept", 2);
    add(batch, mobile, kept.uuid, "first", 2);
    add(batch, mobile, kept.uuid, "kept", 7);
    add(batch, mobile, first.uuid, "first", 2); // gone by now
    add(batch, mobile, thrownAway.uuid, "kept", 2);
    add(batch, mobile, last.uuid, "last", 7);
    EXPECT_TRUE(world.daemonsClient().stageForDeleteContainersWithUsers(batch, UseLocking::yes));
    EXPECT_EQ(world.complaints("stageForDeleteContainersWithUsers").size(), 4U);
    for (const FoundContainer& gone : {first, last, thrownAway})
        EXPECT_TRUE(!isThere(gone.path) && world.exists(dead + "/" + nameOf(gone.path)));
    EXPECT_EQ(world.names(dead).size(), 3U);
    EXPECT_TRUE(world.make("kept").existed && !world.make("first").existed);
}

// Goal: what waits on death row is in nobody's way. Method: containers of one well-known name, deleted in a row.
TEST_F(Deletion, EqualNamesDoNotCollide) {
    for (std::size_t deleted = 1; deleted < 4; ++deleted) {
        EXPECT_EQ(world.stage(world.make("com.veltra.settingsd", ContainerClass::dataSystem)), ErrorCode::success);
        EXPECT_EQ(world.names(dead).size(), deleted);
    }
    EXPECT_EQ(world.pass(), ErrorCode::success);
    EXPECT_TRUE(world.names(dead).empty());
}

// Goal: mappings go with per-user classes, entitlements and children with bundles, and nothing with a transient one.
// Method: every class with both; first its transient container, then its live one.
TEST_F(Deletion, WhatGoesWithEachClass) {
    const Dictionary isChild{{std::string(ipc::keys::parentBundleIdOption), "own"}};
    ZOREntitlementMapping& mapping = world.services().entitlements();
    for (std::uint64_t number = 1; number <= 13; ++number) {
        SCOPED_TRACE(number);
        const auto containerClass = static_cast<ContainerClass>(number);
        const bool perUser = isPerUserClass(containerClass);
        const std::string mappings = number == 7 ? "run/zorvane/sandbox/501/2" : "run/zorvane/sandbox/501/1";
        (void)world.entitle("own", Dictionary{{"k", 1}});
        (void)world.entitle("child", Dictionary{{"k", 1}}, isChild);
        const FoundContainer container = world.make("own", containerClass);
        for (const char* identifier : {"own", "other"})
            ASSERT_TRUE(world.daemonsClient()._setSandboxContainerMappingForUser(
                mobile, identifier, perUser ? containerClass : application, world.url("private/var/mobile")));
        const FoundContainer transient = world.make("own", containerClass, asTransient);
        for (const FoundContainer& goes : {transient, container}) {
            EXPECT_EQ(mapping.entryCount(), 3U); // two identifiers, one map of children
            EXPECT_EQ(world.names(mappings).size(), 2U);
            ASSERT_EQ(world.stage(goes), ErrorCode::success);
            EXPECT_FALSE(isThere(goes.path));
        }
        EXPECT_EQ(mapping.entryCount(), isBundleClass(containerClass) ? 0U : 3U);
        EXPECT_EQ(world.names(mappings).size(), perUser ? 1U : 2U);
    }
    // One that a power cut may bring back is no success.
    const FoundContainer unsynced = world.make("unsynced");
    world.disk().arm({.span = support::FaultSpan::fromThenOn, .filter = [](const DiskCallInfo& call) {
                          return call.call == DiskCall::sync || call.call == DiskCall::syncFileSystem;
                      }});
    EXPECT_EQ(world.stage(unsynced), ErrorCode::listForDeletionFailed);
    world.disk().disarm();
    // A mapping that stays keeps no container.
    world.sandbox.removeError = EIO;
    const FoundContainer last = world.make("last");
    EXPECT_EQ(world.stage(last), ErrorCode::success);
    EXPECT_FALSE(isThere(last.path));
}

enum class Swap { link, file, fifo, aboveIsLink };

// Goal: whatever an owner swaps in just before a step of a deletion, nothing outside is touched.
// Method: a swap before the move, or before the first removal in place; outside lies a look-alike.
TEST_F(Deletion, OwnersWhoSwapContainers) {
    for (const Swap swap : {Swap::link, Swap::file, Swap::fifo, Swap::aboveIsLink})
        for (const bool inPlace : {false, true}) {
            SCOPED_TRACE(std::to_string(static_cast<int>(swap)) + (inPlace ? " in place" : " by move"));
            const FoundContainer container = world.make("victim");
            const std::string outside = "outside/" + nameOf(container.path);
            const bool swapsAbove = swap == Swap::aboveIsLink;
            const std::string place = swapsAbove ? parentOf(container.path) : container.path;
            world.write(outside + "/precious", "kept");
            bool swapped = false;
            world.disk().arm({.error = EACCES, .filter = [&](const DiskCallInfo& call) {
                                  const bool isMove = isMoveOf(container, call);
                                  const bool isRemoval =
                                      call.call == DiskCall::unlinkFile || call.call == DiskCall::removeDirectory;
                                  if (!swapped && (inPlace ? isRemoval : isMove)) {
                                      swapped = true;
                                      world.move(place, "aside");
                                      const mode_t kind = swap == Swap::file ? S_IFREG : S_IFIFO;
                                      if (swap == Swap::link || swapsAbove)
                                          world.link(world.path(swapsAbove ? "outside" : outside), place);
                                      else
                                          EXPECT_EQ(::mknod(place.c_str(), kind | 0600, 0), 0);
                                  }
                                  return isMove && inPlace;
                              }});
            (void)world.stage(container);
            world.disk().disarm();
            EXPECT_TRUE(swapped);
            // Moved is gone, whatever lies there now.
            const std::string victim = "victim";
            const auto known = world.services().cache().containerForUser(mobile, application, &victim, false);
            EXPECT_TRUE(inPlace || codeOf(known) == ErrorCode::notFound);
            EXPECT_EQ(world.pass(), ErrorCode::success);
            EXPECT_EQ(world.read(outside + "/precious"), "kept");
            // As it was.
            for (const std::string& left : {place, world.path("aside")})
                ASSERT_TRUE(world.services().defaultManager().removeItemAtURL(FileURL::directory(left)));
            world.restart();
            world.load();
        }
}

// Goal: what its owner puts in a deleted container's place is left alone. Method: a directory made there as soon as the
// container has moved.
TEST_F(Deletion, TheOwnersNextTreeIsLeftAlone) {
    const FoundContainer container = world.make("raced");
    bool moved = false;
    bool put = false;
    world.disk().arm({.filter = [&](const DiskCallInfo& call) {
        put = put || (moved && ::mkdir(container.path.c_str(), 0755) == 0);
        moved = moved || isMoveOf(container, call);
        return false;
    }});
    EXPECT_EQ(world.stage(container), ErrorCode::success);
    world.disk().disarm();
    EXPECT_EQ(world.pass(), ErrorCode::success);
    EXPECT_TRUE(put && isThere(container.path));
}

} // namespace
} // namespace zor::test
