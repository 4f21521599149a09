// SPDX-License-Identifier: Apache-2.0
// Taking containers out of the store: what a batch stages and says, what goes with each class, disks that refuse, and
// owners who swap what is to be deleted.
#include "store/ZOREntitlementMapping.h"
#include "world/World.h"

#include <atomic>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

namespace zor::test {
namespace {

using plist::Dictionary;
using support::DiskCall;
using support::DiskCallInfo;
using Batch = ZORClientConnection::DeletionBatch;

constexpr const char* stage = "stageForDeleteContainersWithUsers";

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
    static Batch one(const FoundContainer& container) {
        return Batch::of(container.record->uid(), container.uuid, container.record->identifier(),
                         container.record->containerClass());
    }
    Result<void> stageBatch(const Batch& batch) {
        return world.daemonsClient().stageForDeleteContainersWithUsers(batch, UseLocking::yes);
    }
    /// A container's move to death row, whichever name it gets there.
    static bool isMoveOf(const FoundContainer& container, const DiskCallInfo& call) {
        return call.call == DiskCall::rename && call.subject.starts_with(nameOf(container.path) + " -> ");
    }
    static bool isRemoval(const DiskCallInfo& call) {
        return call.call == DiskCall::unlinkFile || call.call == DiskCall::removeDirectory;
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
    for (const std::uint64_t number : {std::uint64_t{0}, std::uint64_t{14}, ~std::uint64_t{0}})
        add(batch, mobile, kept.uuid, "kept", number);
    // And these not.
    add(batch, mobile, UUID::random(), "kept", 2);
    add(batch, second, kept.uuid, "kept", 2);
    add(batch, mobile, kept.uuid, "first", 2);
    add(batch, mobile, kept.uuid, "kept", 7);
    add(batch, mobile, first.uuid, "first", 2); // gone by now
    add(batch, mobile, thrownAway.uuid, "kept", 2);
    add(batch, mobile, last.uuid, "last", 7);
    EXPECT_TRUE(stageBatch(batch));
    EXPECT_EQ(world.complaints(stage).size(), 6U);
    EXPECT_TRUE(isThere(kept.path));
    for (const FoundContainer& gone : {first, last, thrownAway}) {
        EXPECT_FALSE(isThere(gone.path));
        EXPECT_TRUE(world.exists(dead + "/" + nameOf(gone.path)));
    }
    EXPECT_EQ(world.names(dead).size(), 3U);
    EXPECT_TRUE(world.make("kept").existed);
    EXPECT_FALSE(world.make("first").existed);
}

// Goal: mappings go with per-user classes, entitlements and children with bundles, and nothing with a transient one.
// Method: every class with both; first its transient container, then its live one.
TEST_F(Deletion, WhatGoesWithEachClass) {
    const std::string own = "own";
    const std::string child = "child";
    const Dictionary entitlements{{"k", 1}};
    const Dictionary isChild{{std::string(ipc::keys::parentBundleIdOption), own}};
    ZOREntitlementMapping& mapping = world.services().entitlements();
    for (std::uint64_t number = 1; number <= 13; ++number) {
        SCOPED_TRACE(number);
        const auto containerClass = static_cast<ContainerClass>(number);
        const bool perUser = isPerUserClass(containerClass);
        (void)world.services().store().entitlementChange.processEntitlements(&entitlements, &own, nullptr);
        (void)world.services().store().entitlementChange.processEntitlements(&entitlements, &child, &isChild);
        ASSERT_EQ(mapping.entryCount(), 3U); // two identifiers, one map of children
        const FoundContainer container = world.make(own, containerClass);
        for (const std::string& identifier : {own, std::string("other")})
            ASSERT_TRUE(world.daemonsClient()._setSandboxContainerMappingForUser(
                mobile, identifier, perUser ? containerClass : application, world.url("private/var/mobile")));
        const FoundContainer transient = world.make(own, containerClass, asTransient);
        ASSERT_TRUE(stageBatch(one(transient)));
        EXPECT_FALSE(isThere(transient.path));
        EXPECT_EQ(mapping.entryCount(), 3U);
        EXPECT_EQ(world.names(number == 7 ? "run/zorvane/sandbox/501/2" : "run/zorvane/sandbox/501/1").size(), 2U);
        ASSERT_TRUE(stageBatch(one(container)));
        EXPECT_FALSE(isThere(container.path));
        EXPECT_EQ(mapping.entryCount(), isBundleClass(containerClass) ? 0U : 3U);
        EXPECT_EQ(world.names(number == 7 ? "run/zorvane/sandbox/501/2" : "run/zorvane/sandbox/501/1").size(),
                  perUser ? 1U : 2U);
    }
    // A mapping that stays keeps no container.
    world.sandbox.removeError = EIO;
    const FoundContainer last = world.make("last");
    EXPECT_TRUE(stageBatch(one(last)));
    EXPECT_FALSE(isThere(last.path));
}

// Goal: what the disk refuses is made good or stays whole, and stops no batch. Method: refused calls over a batch of
// two.
TEST_F(Deletion, DisksThatRefuse) {
    enum class Refused { nothing, move, moveAndRemoval, nameTaken, sync };
    for (const Refused refused :
         {Refused::nothing, Refused::move, Refused::moveAndRemoval, Refused::nameTaken, Refused::sync}) {
        SCOPED_TRACE(static_cast<int>(refused));
        const bool moveFails = refused == Refused::move || refused == Refused::moveAndRemoval;
        const bool stays = refused == Refused::moveAndRemoval;
        const bool syncFails = refused == Refused::sync;
        const FoundContainer container = world.make("container");
        const FoundContainer other = world.make("other");
        const std::string name = nameOf(container.path);
        Batch batch = one(container);
        add(batch, mobile, other.uuid, "other", 2);
        if (refused == Refused::nameTaken)
            world.write(dead + "/" + name + "/earlier", "");
        world.log.take();
        world.disk().arm({.error = syncFails ? EIO : EACCES,
                          .span = support::FaultSpan::fromThenOn,
                          .filter = [&](const DiskCallInfo& call) {
                              return (moveFails && isMoveOf(container, call)) || (stays && isRemoval(call)) ||
                                     (syncFails &&
                                      (call.call == DiskCall::sync || call.call == DiskCall::syncFileSystem));
                          }});
        EXPECT_EQ(codeOf(stageBatch(batch)), syncFails ? ErrorCode::listForDeletionFailed : ErrorCode::success);
        world.disk().disarm();
        EXPECT_FALSE(isThere(other.path));
        EXPECT_EQ(isThere(container.path), stays);
        EXPECT_EQ(world.exists(dead + "/" + name), !moveFails);
        EXPECT_EQ(std::ranges::count(world.deathRow(), name), refused == Refused::nameTaken ? 1 : 0); // beside it
        EXPECT_EQ(world.make("container").existed, stays);
        ASSERT_EQ(world.pass(), ErrorCode::success);
        ASSERT_TRUE(stageBatch(one(world.make("container"))));
    }
}

enum class Swap { link, file, fifo, aboveIsLink };

/// Takes the place away to `aside` and puts something else there.
void swapOut(Swap swap, const std::string& place, const std::string& aside, const std::string& outside) {
    EXPECT_EQ(::rename(place.c_str(), aside.c_str()), 0);
    EXPECT_EQ(swap == Swap::file   ? ::mknod(place.c_str(), S_IFREG | 0600, 0)
              : swap == Swap::fifo ? ::mkfifo(place.c_str(), 0600)
                                   : ::symlink(outside.c_str(), place.c_str()),
              0);
}

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
                                  if (!swapped && (inPlace ? isRemoval(call) : isMove)) {
                                      swapped = true;
                                      swapOut(swap, place, world.path("aside"),
                                              world.path(swapsAbove ? "outside" : outside));
                                  }
                                  return isMove && inPlace;
                              }});
            (void)stageBatch(one(container));
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

// Goal: what its owner puts in a deleted container's place is left alone. Method: a tree that waits for the place.
TEST_F(Deletion, TheOwnersNextTreeIsLeftAlone) {
    int taken = 0;
    for (int round = 0; round < 60 || (taken == 0 && round < 1000); ++round) {
        const FoundContainer container = world.make("raced");
        const std::string tree = container.path + "-next";
        ASSERT_EQ(::mkdir(tree.c_str(), 0755), 0);
        std::atomic<bool> waiting = false;
        bool moved = false;
        std::jthread owner([&](const std::stop_token& stop) {
            for (; !moved && !stop.stop_requested(); waiting = true)
                moved = ::rename(tree.c_str(), container.path.c_str()) == 0;
        });
        while (!waiting)
            std::this_thread::yield();
        EXPECT_TRUE(stageBatch(one(container)));
        owner.request_stop();
        owner.join();
        EXPECT_EQ(::rmdir((moved ? container.path : tree).c_str()), 0);
        taken += moved ? 1 : 0;
    }
    EXPECT_GT(taken, 0);
}

} // namespace
} // namespace zor::test
