// SPDX-License-Identifier: Apache-2.0
// Taking containers out of the store: what a batch stages and says, what goes with each class, disks that refuse, and
// owners who swap what is to be deleted.
#include "entitlements/ZOREntitlementMapping.h"
#include "world/World.h"

#include <algorithm>
#include <atomic>
#include <future>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

namespace zor::test {
namespace {

using plist::Dictionary;
using support::DiskCall;
using support::DiskCallInfo;
using support::hasLine;
using Batch = ZORClientConnection::DeletionBatch;

constexpr const char* stage = "stageForDeleteContainersWithUsers";
const std::string dead = std::string(cachesPath) + "/Dead";

std::string nameOf(const std::string& path) {
    return path.substr(path.rfind('/') + 1);
}

std::uint32_t ownerOf(ContainerClass containerClass) {
    return isBundleClass(containerClass) ? 33 : isSystemClass(containerClass) ? 499 : mobile;
}

class Deletion : public testing::Test {
protected:
    Deletion() { world.load(); }
    FoundContainer make(const std::string& identifier, ContainerClass containerClass = ContainerClass::dataApplication,
                        bool transient = false) {
        return world.daemonsClient()
            .createOrLookupContainerForUser(ownerOf(containerClass), &identifier, containerClass,
                                            {.createIfNecessary = true, .transient = transient})
            .value();
    }
    static Batch one(const FoundContainer& container) {
        return Batch::of(container.record->uid(), container.uuid, container.record->identifier(),
                         container.record->containerClass());
    }
    Result<void> stageBatch(const Batch& batch) {
        return world.daemonsClient().stageForDeleteContainersWithUsers(batch, UseLocking::yes);
    }
    static bool isThere(const FoundContainer& container) { return ::access(container.path.c_str(), F_OK) == 0; }
    /// A container's move to death row, whichever name it gets there.
    static bool isMoveOf(const FoundContainer& container, const DiskCallInfo& call) {
        return call.call == DiskCall::rename && call.subject.starts_with(nameOf(container.path) + " -> ");
    }
    ErrorCode pass() {
        std::promise<ErrorCode> code;
        world.daemonsClient().deleteContainersOnDeathRowWithCompletion([&](ErrorCode c) { code.set_value(c); });
        return code.get_future().get();
    }

    World world;
};

// Goal: bad elements are said and skipped, missing containers skipped silently, good ones go. Method: one batch of
// every kind, judged by its lines and by what is left.
TEST_F(Deletion, AMixedBatch) {
    const FoundContainer first = make("first");
    const FoundContainer kept = make("kept");
    const FoundContainer last = make("last", ContainerClass::sharedAppGroup);
    const FoundContainer thrownAway = make("kept", ContainerClass::dataApplication, true);
    const UUID unknown = UUID::random();
    const std::string keptId = "UUID: " + kept.uuid.string() + ", ID: kept, Class: ";
    const std::string bad = "Can't act on an invalid object: ";
    struct Row {
        std::uint32_t user;
        std::optional<UUID> uuid;
        std::optional<std::string> identifier;
        std::expected<std::uint64_t, std::string> containerClass;
        std::string said;
    };
    const Row rows[] = {
        {mobile, first.uuid, "first", 2, ""},
        {mobile, kept.uuid, "kept", std::unexpected("\"2\""), bad + "class: \"2\""},
        {mobile, std::nullopt, "kept", 2, bad + "userId: 501, UUID: (null), ID: kept, Class: 2"},
        {mobile, kept.uuid, std::nullopt, 2,
         bad + "userId: 501, UUID: " + kept.uuid.string() + ", ID: (null), Class: 2"},
        {mobile, kept.uuid, "kept", 0, bad + "userId: 501, " + keptId + "0"},
        {mobile, kept.uuid, "kept", 14, bad + "userId: 501, " + keptId + "14"},
        {mobile, kept.uuid, "kept", ~std::uint64_t{0}, bad + "userId: 501, " + keptId + "-1"},
        {mobile, unknown, "kept", 2, ""},
        {second, kept.uuid, "kept", 2, ""},
        {mobile, kept.uuid, "first", 2, ""},
        {mobile, kept.uuid, "kept", 7, ""},
        {mobile, first.uuid, "first", 2, ""}, // gone by now
        {mobile, thrownAway.uuid, "kept", 2, ""},
        {mobile, last.uuid, "last", 7, ""},
    };
    Batch batch;
    std::vector<std::string> expected;
    for (const Row& row : rows) {
        batch.users.push_back(row.user);
        batch.uuids.push_back(row.uuid);
        batch.identifiers.push_back(row.identifier);
        batch.classes.push_back(row.containerClass);
        if (!row.said.empty())
            expected.push_back(row.said);
    }
    world.log.take();
    EXPECT_TRUE(stageBatch(batch));
    std::vector<std::string> said;
    for (const std::string& message : world.log.take(3, stage))
        said.push_back(support::withoutSourceLine(message));
    EXPECT_EQ(said, expected);
    EXPECT_TRUE(isThere(kept));
    for (const FoundContainer& gone : {first, last, thrownAway}) {
        EXPECT_FALSE(isThere(gone));
        EXPECT_TRUE(world.exists(dead + "/" + nameOf(gone.path)));
    }
    EXPECT_EQ(world.names(dead).size(), 3U);
    EXPECT_TRUE(make("kept").existed);
    EXPECT_FALSE(make("first").existed);
}

// Goal: lists that do not agree are refused before any lock, an absent user ends the batch with 40 and frees the lock,
// nothing is staged for nothing. Method: the test holds the lock meanwhile.
TEST_F(Deletion, ListsOfDifferentLength) {
    const FoundContainer a = make("a");
    const FoundContainer b = make("b");
    {
        const AllIdentifiersLock held(world.services().locks(), LockMode::writing);
        for (const auto shorten :
             {+[](Batch& batch) { batch.uuids.clear(); }, +[](Batch& batch) { batch.classes.clear(); },
              +[](Batch& batch) { batch.identifiers.clear(); }}) {
            Batch batch = one(a);
            shorten(batch);
            auto answer = std::async(std::launch::async, [&] { return stageBatch(batch); });
            ASSERT_EQ(answer.wait_for(std::chrono::seconds(20)), std::future_status::ready);
            const auto staged = answer.get();
            ASSERT_FALSE(staged);
            EXPECT_TRUE(staged.error().is(ErrorCode::invalidObject));
            EXPECT_EQ(staged.error().description(),
                      "Can't act on an invalid input: UUIDString count: " + std::to_string(batch.uuids.size()) +
                          ", class count: " + std::to_string(batch.classes.size()) +
                          ", ID count: " + std::to_string(batch.identifiers.size()));
        }
    }
    EXPECT_TRUE(stageBatch({}));
    EXPECT_TRUE(isThere(a));
    Batch batch = one(a);
    for (const auto& uuid : {b.uuid, UUID::random()}) {
        batch.uuids.emplace_back(uuid);
        batch.identifiers.emplace_back("b");
        batch.classes.emplace_back(2);
    }
    const auto staged = stageBatch(batch);
    ASSERT_FALSE(staged);
    EXPECT_TRUE(staged.error().is(ErrorCode::exceptionCaught));
    EXPECT_FALSE(isThere(a));
    EXPECT_TRUE(isThere(b));
    EXPECT_TRUE(make("b").existed); // no lock is left behind
}

// Goal: what goes with a container is decided by its class: a mapping with per-user classes, entitlements of the
// identifier and its children with bundles. Method: every class, with both in place.
TEST_F(Deletion, WhatGoesWithEachClass) {
    const std::string own = "own";
    const std::string child = "child";
    const Dictionary entitlements{{"k", 1}};
    const Dictionary isChild{{std::string(ipc::keys::parentBundleIdOption), own}};
    ZOREntitlementMapping& mapping = world.services().entitlements();
    for (std::uint64_t number = 1; number <= 13; ++number) {
        SCOPED_TRACE(number);
        const auto containerClass = static_cast<ContainerClass>(number);
        const std::string mappings = number == 7 ? "run/zorvane/sandbox/501/2" : "run/zorvane/sandbox/501/1";
        (void)mapping.processEntitlements(&entitlements, &own, nullptr);
        (void)mapping.processEntitlements(&entitlements, &child, &isChild);
        ASSERT_EQ(mapping.entryCount(), 3U); // two identifiers, one map of children
        const FoundContainer container = make(own, containerClass);
        for (const auto& [identifier, mapped] :
             {std::pair(own, isPerUserClass(containerClass) ? containerClass : ContainerClass::dataApplication),
              std::pair(std::string("other"),
                        isPerUserClass(containerClass) ? containerClass : ContainerClass::dataApplication)})
            ASSERT_TRUE(world.daemonsClient()._setSandboxContainerMappingForUser(mobile, identifier, mapped,
                                                                                 world.url("private/var/mobile")));
        ASSERT_TRUE(stageBatch(one(container)));
        EXPECT_FALSE(isThere(container));
        EXPECT_EQ(mapping.entryCount(), isBundleClass(containerClass) ? 0U : 3U);
        EXPECT_EQ(world.names(mappings).size(), isPerUserClass(containerClass) ? 1U : 2U);
    }
    // A mapping that stays is said and no more.
    world.log.take();
    world.sandbox.removeError = EIO;
    const FoundContainer last = make("last");
    EXPECT_TRUE(stageBatch(one(last)));
    EXPECT_FALSE(isThere(last));
    EXPECT_TRUE(hasLine(world.log.take(), 3, stage, "Failed to remove container mapping in delete operation"));
}

// Goal: what the disk refuses is made good or said, step by step, and never stops the rest of a batch. Method: a table
// of refused calls over a batch of two.
TEST_F(Deletion, DisksThatRefuse) {
    enum class After { deathRow, besideOnDeathRow, nowhere, inPlace };
    struct Row {
        const char* name;
        bool nameTaken;
        bool moveFails;
        bool removalFails;
        int syncError;
        After after;
    };
    const Row rows[] = {
        {"nothing", false, false, false, 0, After::deathRow},
        {"the move", false, true, false, 0, After::nowhere},
        {"the move and the removal", false, true, true, 0, After::inPlace},
        {"the name is taken", true, false, false, 0, After::besideOnDeathRow},
        {"the sync", false, false, false, EIO, After::deathRow},
    };
    world.log.setLevel(logLevelDebug);
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        const FoundContainer container = make("container");
        const FoundContainer other = make("other");
        const std::string name = nameOf(container.path);
        Batch batch = one(container);
        batch.users.push_back(mobile);
        batch.uuids.emplace_back(other.uuid);
        batch.identifiers.emplace_back("other");
        batch.classes.emplace_back(2);
        if (row.nameTaken)
            world.write(dead + "/" + name + "/earlier", "");
        world.log.take();
        world.disk().arm({.error = row.syncError ? row.syncError : EACCES,
                          .span = support::FaultSpan::fromThenOn,
                          .filter = [&](const DiskCallInfo& call) {
                              return (row.moveFails && isMoveOf(container, call)) ||
                                     (row.removalFails &&
                                      (call.call == DiskCall::unlinkFile || call.call == DiskCall::removeDirectory)) ||
                                     (row.syncError &&
                                      (call.call == DiskCall::sync || call.call == DiskCall::syncFileSystem));
                          }});
        const auto staged = stageBatch(batch);
        world.disk().disarm();
        EXPECT_EQ(staged ? ErrorCode::success : staged.error().replyCode(),
                  row.syncError ? ErrorCode::listForDeletionFailed : ErrorCode::success);
        EXPECT_FALSE(isThere(other));
        EXPECT_EQ(isThere(container), row.after == After::inPlace);
        EXPECT_EQ(world.exists(dead + "/" + name), row.after == After::deathRow || row.nameTaken);
        const auto dying = world.deathRow();
        EXPECT_EQ(std::ranges::count(dying, name), row.after == After::besideOnDeathRow ? 1 : 0);
        const auto lines = world.log.take();
        const auto saysStart = [&](int level, const std::string& start) {
            return std::ranges::any_of(lines, [&](const support::LogLine& line) {
                return line.level == level && support::withoutSourceLine(line.message).starts_with(start);
            });
        };
        EXPECT_EQ(saysStart(7, "Couldn't stage for deletion from " + container.path + " to " + world.path(dead) + "/" +
                                   name + ": POSIX "),
                  row.moveFails || row.nameTaken);
        EXPECT_EQ(saysStart(3, "Failed to delete container at " + container.path + ": POSIX 13"), row.removalFails);
        EXPECT_EQ(make("container").existed, row.after == After::inPlace);
        ASSERT_EQ(pass(), ErrorCode::success);
        ASSERT_TRUE(stageBatch(one(make("container"))));
    }
}

// Goal: the deletion of an identifier's container, with the lookup's own codes. Method: requests in a row.
TEST_F(Deletion, OfAnIdentifier) {
    const std::string a = "a";
    const auto deletion = [&](const std::string* identifier, std::uint64_t number, bool transient = false) {
        const auto deleted = world.daemonsClient().deleteContainerForUser(
            mobile, identifier, static_cast<ContainerClass>(number), transient);
        return deleted ? 1U : static_cast<unsigned>(deleted.error().replyCode());
    };
    const FoundContainer live = make(a);
    const FoundContainer transient = make(a, ContainerClass::dataApplication, true);
    world.log.take();
    EXPECT_EQ(deletion(nullptr, 2), 11U);
    EXPECT_TRUE(hasLine(world.log.take(), 3, "deleteContainerForUser",
                        "Failed to lookup existing container to delete-identifier: (null), class: 2, transient: 0"));
    EXPECT_EQ(deletion(&a, 14), 11U);
    EXPECT_EQ(deletion(&a, 12), 11U); // of another owner
    EXPECT_EQ(deletion(&a, 7), 21U);
    EXPECT_TRUE(isThere(live) && isThere(transient));
    // The lookup itself throws a transient one away.
    EXPECT_EQ(deletion(&a, 2, true), 21U);
    EXPECT_FALSE(isThere(transient));
    EXPECT_EQ(deletion(&a, 2), 1U);
    EXPECT_FALSE(isThere(live));
    EXPECT_EQ(deletion(&a, 2), 21U);
}

enum class Swap { link, file, fifo, aboveIsLink };

/// Takes the place away to `aside` and puts something else there.
void swapOut(Swap swap, const std::string& place, const std::string& aside, const std::string& outside) {
    bool done = ::rename(place.c_str(), aside.c_str()) == 0;
    if (swap == Swap::file)
        done = done && ::mknod(place.c_str(), S_IFREG | 0600, 0) == 0;
    else if (swap == Swap::fifo)
        done = done && ::mkfifo(place.c_str(), 0600) == 0;
    else
        done = done && ::symlink(outside.c_str(), place.c_str()) == 0;
    EXPECT_TRUE(done);
}

// Goal: whatever an owner puts in the place of a container, or of the directory above it, just before a step of its
// deletion, nothing outside the place is touched. Method: the swap happens before the move, or before the first removal
// in place; outside lies a tree that looks like a container.
TEST_F(Deletion, OwnersWhoSwapContainers) {
    for (const Swap swap : {Swap::link, Swap::file, Swap::fifo, Swap::aboveIsLink})
        for (const bool inPlace : {false, true}) {
            SCOPED_TRACE(std::to_string(static_cast<int>(swap)) + (inPlace ? " in place" : " by move"));
            const FoundContainer container = make("victim");
            const std::string name = nameOf(container.path);
            const std::string above = container.path.substr(0, container.path.rfind('/'));
            const bool swapsAbove = swap == Swap::aboveIsLink;
            world.write("outside/" + name + "/precious", "kept");
            bool swapped = false;
            world.disk().arm({.error = EACCES, .filter = [&](const DiskCallInfo& call) {
                                  const bool isMove = isMoveOf(container, call);
                                  const bool isRemoval =
                                      call.call == DiskCall::unlinkFile || call.call == DiskCall::removeDirectory;
                                  if (!swapped && (inPlace ? isRemoval : isMove)) {
                                      swapped = true;
                                      swapOut(swap, swapsAbove ? above : container.path, world.path("aside"),
                                              world.path(swapsAbove ? "outside" : "outside/" + name));
                                  }
                                  return isMove && inPlace;
                              }});
            (void)stageBatch(one(container));
            world.disk().disarm();
            EXPECT_TRUE(swapped);
            // Moved is gone, whatever lies there now.
            const std::string victim = "victim";
            const auto known =
                world.services().cache().containerForUser(mobile, ContainerClass::dataApplication, &victim, false);
            EXPECT_TRUE(inPlace || (!known && known.error().is(ErrorCode::notFound)));
            EXPECT_EQ(pass(), ErrorCode::success);
            EXPECT_EQ(world.read("outside/" + name + "/precious"), "kept");
            // As it was.
            for (const std::string& left : {swapsAbove ? above : container.path, world.path("aside")})
                ASSERT_TRUE(world.services().defaultManager().removeItemAtURL(FileURL::directory(left)));
            world.restart();
            world.load();
        }
}

// Goal: what its owner puts in the place of a container that has just gone is none of the deletion's business. Method:
// a tree of the owner's waits to take the place the moment it is free.
TEST_F(Deletion, TheOwnersNextTreeIsLeftAlone) {
    int taken = 0;
    for (int round = 0; round < 200; ++round) {
        const FoundContainer container = make("raced");
        const std::string tree = container.path + "-next";
        ASSERT_EQ(::mkdir(tree.c_str(), 0755), 0);
        std::atomic<bool> moved = false;
        std::atomic<bool> done = false;
        std::thread owner([&] {
            while (!done && !moved)
                moved = ::rename(tree.c_str(), container.path.c_str()) == 0;
        });
        const auto staged = stageBatch(one(container));
        done = true;
        owner.join();
        EXPECT_TRUE(staged);
        EXPECT_EQ(::rmdir((moved ? container.path : tree).c_str()), 0);
        taken += moved ? 1 : 0;
    }
    EXPECT_GT(taken, 0);
}

} // namespace
} // namespace zor::test
