// SPDX-License-Identifier: Apache-2.0
// Taking containers out of the store: what a batch stages and says, what goes with each class, owners who swap what is
// to be deleted; and death row: what gets there, on which file system, what a pass does with it, and the races of the
// two.
#include "fs/Names.h"
#include "store/ZOREntitlementMapping.h"
#include "world/World.h"

#include <gtest/gtest.h>
#include <unistd.h>

namespace zor::test {
namespace {

using plist::Dictionary;
using support::DiskCall;
using support::DiskCallInfo;
using support::FaultSpan;
using Batch = ZORClientConnection::DeletionBatch;
using Names = std::vector<std::string>;

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
// Method: a swap before the move, or before the first removal where it was hidden; outside lies a look-alike.
TEST_F(Deletion, OwnersWhoSwapContainers) {
    for (const Swap swap : {Swap::link, Swap::file, Swap::fifo, Swap::aboveIsLink})
        for (const bool inPlace : {false, true}) {
            SCOPED_TRACE(std::to_string(static_cast<int>(swap)) + (inPlace ? " in place" : " by move"));
            const FoundContainer container = world.make("victim");
            const std::string outside = "outside/" + nameOf(container.path);
            const bool swapsAbove = swap == Swap::aboveIsLink;
            std::string place = swapsAbove ? parentOf(container.path) : container.path;
            world.write(outside + "/precious", "kept");
            bool swapped = false;
            world.disk().arm({.error = EACCES, .filter = [&](const DiskCallInfo& call) {
                                  const bool isHiding = call.subject.starts_with(nameOf(container.path) + " -> .");
                                  const bool isMove = isMoveOf(container, call) && !isHiding;
                                  if (isHiding && !swapsAbove)
                                      place = parentOf(place) + "/" + call.subject.substr(call.subject.find("-> ") + 3);
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
            world.drainDeathRow();
            world.disk().disarm();
            EXPECT_TRUE(swapped);
            // Moved is gone, whatever lies there now.
            const std::string victim = "victim";
            const auto known = world.services().cache().containerForUser(mobile, application, &victim, false);
            EXPECT_EQ(codeOf(known), ErrorCode::notFound);
            (void)world.pass();
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

class DeathRow : public testing::Test {
protected:
    DeathRow() { world.load(); }
    World world;

    Names left() { return world.services().store().deathRow.left().paths; }
};

// Goal: a pass that takes the fresh unique directory for rubbish costs no item. Method: it goes before the move.
TEST_F(DeathRow, APassRacesAMove) {
    for (const bool always : {false, true}) {
        world.makeDirectories("item");
        int times = 0;
        world.disk().arm({.filter = [&](const DiskCallInfo& call) {
            if (call.call == DiskCall::rename && (always || times == 0)) {
                ++times;
                for (const std::string& unique : world.names(dead))
                    ::rmdir(world.path(dead + "/" + unique).c_str());
            }
            return false;
        }});
        const auto moved = world.daemonsClient()._moveItemAtURLToDeathRow(world.url("item"), StartDeletionThread::no);
        world.disk().disarm();
        EXPECT_EQ(codeOf(moved), always ? ErrorCode::moveToDeathRowFailed : ErrorCode::success);
        EXPECT_EQ(world.exists("item"), always);
        EXPECT_EQ(times > 10, always);
        EXPECT_EQ(world.deathRow(), always ? Names() : Names{"item"});
        EXPECT_EQ(world.pass(), ErrorCode::success);
    }
}

// Goal: what cannot be removed goes to /tmp, closed, or stays, and is shown and tried again; others go. Method: removal
// and move fail.
TEST_F(DeathRow, WhatCannotBeRemoved) {
    bool movesFail = true;
    const support::Fault stuck{
        .error = EACCES, .span = FaultSpan::fromThenOn, .filter = [&](const DiskCallInfo& call) {
            return (call.call == DiskCall::unlinkFile && call.subject == "stuck") ||
                   (call.call == DiskCall::removeDirectory && call.subject.starts_with("temp.x")) ||
                   (movesFail && call.call == DiskCall::rename && call.subject.starts_with("temp."));
        }};
    world.write(dead + "/temp.xxxxxx/bundle/stuck", "");
    world.makeDirectories(dead + "/temp.yyyyyy/other");
    world.disk().arm(stuck);
    EXPECT_EQ(world.pass(), ErrorCode::deathRowItemNotDestroyed);
    EXPECT_EQ(world.names(dead), (Names{"temp.xxxxxx"}));
    EXPECT_EQ(left(), (Names{world.path(dead + "/temp.xxxxxx")}));
    movesFail = false;
    world.disk().arm(stuck);
    // Another's directory there is not ours.
    world.makeDirectories("tmp/temp.zzzzzz/precious", 0, 0700);
    for (const bool restarts : {false, false, true}) {
        if (restarts)
            world.restart();
        EXPECT_EQ(world.pass(), ErrorCode::success);
        EXPECT_TRUE(world.names(dead).empty() && world.exists("tmp/temp.xxxxxx/bundle/stuck"));
        EXPECT_EQ(world.item("tmp/temp.xxxxxx"), directoryOf(0, 0700));
        EXPECT_EQ(left(), (Names{world.path("tmp/temp.xxxxxx")}));
    }
    world.disk().disarm();
    EXPECT_EQ(world.pass(), ErrorCode::success);
    EXPECT_EQ(world.names("tmp"), (Names{"temp.zzzzzz"}));
    EXPECT_TRUE(world.exists("tmp/temp.zzzzzz/precious"));
    EXPECT_TRUE(left().empty());
}

// Goal: what ends the removal of one item ends neither the pass nor the daemon. Method: memory runs out for one.
TEST_F(DeathRow, WantOfMemoryKeepsOneItem) {
    for (const char* item : {"temp.aaaaaa", "temp.short1", "temp.zzzzzz"})
        world.makeDirectories(dead + "/" + item);
    world.disk().arm({.filter = [](const DiskCallInfo& call) -> bool {
        return call.subject == "temp.short1" ? throw std::bad_alloc() : false;
    }});
    EXPECT_EQ(world.pass(), ErrorCode::deathRowItemNotDestroyed);
    world.disk().disarm();
    EXPECT_EQ(world.names(dead), (Names{"temp.short1"}));
    EXPECT_EQ(world.pass(), ErrorCode::success);
}

/// In a container's class directory, with what is hidden.
std::ptrdiff_t entriesBeside(const FoundContainer& container) {
    return std::distance(std::filesystem::directory_iterator(parentOf(container.path)), {});
}

const std::string rowOuter = std::string("private/var/mobile/") + fs::deathRowOuter;

// Goal: a container on another file system goes by a rename, whatever is in it, and is found again after a stop.
// Method: transient, live and all transient ones at a boot, each with what no copy can make; calls are counted.
TEST(DeathRowElsewhere, ContainersGoByARename) {
    if (!MountedHome::canBe())
        GTEST_SKIP() << "skipped: needs root to mount";
    World world;
    const MountedHome home(world.path());
    ASSERT_TRUE(home.mounted());
    world.load();
    enum class Way { askedAgain, deleted, boot };
    for (const Way way : {Way::askedAgain, Way::deleted, Way::boot}) {
        SCOPED_TRACE(static_cast<int>(way));
        const FoundContainer container = world.make("app", application, way != Way::deleted);
        for (int i = 0; i < 300; ++i)
            ASSERT_EQ(::mkdir((container.path + "/tmp/" + std::to_string(i)).c_str(), 0755), 0);
        ASSERT_EQ(::mknod((container.path + "/whiteout").c_str(), S_IFCHR, 0), 0);
        int calls = 0;
        // A pass may run beside it.
        world.disk().arm({.filter = [&, here = std::this_thread::get_id()](const DiskCallInfo&) {
            return std::this_thread::get_id() == here && ++calls == 0;
        }});
        if (way == Way::askedAgain)
            EXPECT_EQ(codeOf(world.find("app", application, true)), ErrorCode::notFound);
        else if (way == Way::deleted)
            EXPECT_EQ(world.stage(container), ErrorCode::success);
        else
            world.daemonsClient().rebootContainerManagerSetup();
        world.disk().disarm();
        EXPECT_LT(calls, 200);
        EXPECT_FALSE(isThere(container.path));
        if (way == Way::askedAgain)
            world.drainDeathRow();
        else
            EXPECT_EQ(world.item(rowOuter), directoryOf(0, 0700));
        world.restart();
        EXPECT_EQ(world.pass(), ErrorCode::success);
        EXPECT_FALSE(world.exists(rowOuter));
        EXPECT_TRUE(world.names(dead).empty());
    }
}

// Goal: whatever lies under the row's name, only what the daemon put in is removed, and a container goes all the same.
// Method: a user's and root's things.
TEST(DeathRowElsewhere, WhoseNameIsTaken) {
    if (!MountedHome::canBe())
        GTEST_SKIP() << "skipped: needs root to mount";
    World world;
    const MountedHome home(world.path());
    ASSERT_TRUE(home.mounted());
    world.load();
    const std::pair<std::uint32_t, mode_t> rows[] = {{mobile, 0700}, {0, 0755}, {0, 0700}};
    for (const auto& [owner, mode] : rows) {
        SCOPED_TRACE(std::to_string(owner) + " " + std::to_string(mode));
        const std::string app = "app" + std::to_string(owner + mode);
        (void)world.make(app, application, true);
        world.makeDirectories(rowOuter + "/precious", 0, 0700);
        ASSERT_EQ(::chown(world.path(rowOuter).c_str(), owner, owner) | ::chmod(world.path(rowOuter).c_str(), mode), 0);
        const auto again = world.create(app, application, true);
        ASSERT_TRUE(again);
        EXPECT_EQ(world.pass(), ErrorCode::success);
        EXPECT_EQ(entriesBeside(*again), 1);
        EXPECT_EQ(world.stage(*again), ErrorCode::success);
        EXPECT_EQ(world.pass(), ErrorCode::success);
        EXPECT_EQ(world.names(rowOuter), Names{"precious"});
        EXPECT_EQ(world.item(rowOuter), directoryOf(owner, mode));
        std::filesystem::remove_all(world.path(rowOuter));
    }
}

// Goal: a container that was hidden beside itself goes in the end, and nothing that its owner puts in its place does.
// Method: the row's name is taken, the first pass fails; then a pass, a boot, or another's directory under the name.
TEST(DeathRowElsewhere, HiddenBesideItself) {
    if (!MountedHome::canBe())
        GTEST_SKIP() << "skipped: needs root to mount";
    enum class Then { pass, boot, swap, bootAfterSwap };
    for (const Then then : {Then::pass, Then::boot, Then::swap, Then::bootAfterSwap}) {
        SCOPED_TRACE(static_cast<int>(then));
        World world;
        const MountedHome home(world.path());
        ASSERT_TRUE(home.mounted());
        world.load();
        world.makeDirectories(rowOuter, mobile);
        const FoundContainer container = world.make("app");
        const FoundContainer kept = world.make("kept");
        world.disk().arm({.error = EIO, .span = FaultSpan::fromThenOn, .filter = [](const DiskCallInfo& call) {
                              return call.call == DiskCall::unlinkFile || call.subject.starts_with(fs::copyPrefix);
                          }});
        EXPECT_EQ(world.stage(container), ErrorCode::success);
        world.drainDeathRow();
        world.disk().disarm();
        EXPECT_EQ(entriesBeside(kept), 2);
        std::string hidden;
        for (const auto& entry : std::filesystem::directory_iterator(parentOf(kept.path)))
            if (entry.path().filename().string().starts_with(fs::copyPrefix))
                hidden = entry.path();
        const bool swaps = then == Then::swap || then == Then::bootAfterSwap;
        if (swaps) {
            world.makeDirectories("private/var/mobile/precious", 0, 0700);
            world.makeDirectories("private/var/mobile/precious/inner");
            world.move(hidden, "private/var/mobile/aside");
            world.move("private/var/mobile/precious", hidden);
        }
        if (then == Then::boot || then == Then::bootAfterSwap)
            world.reboot();
        EXPECT_EQ(world.pass(), then == Then::swap ? ErrorCode::deathRowItemNotDestroyed : ErrorCode::success);
        EXPECT_EQ(entriesBeside(kept), swaps ? 2 : 1);
        EXPECT_EQ(isThere(hidden + "/inner"), swaps);
    }
}

// Goal: another user's directory in a container's place is not taken for it. Method: it lies there before, or is put
// there just before the move; then the container is asked for or deleted.
TEST_F(DeathRow, AnothersDirectoryInAContainersPlace) {
    if (::geteuid() != 0)
        GTEST_SKIP() << "skipped: only root can give directories away";
    for (const bool asksAgain : {true, false})
        for (const bool meanwhile : {false, true}) {
            SCOPED_TRACE(std::string(asksAgain ? "asked again" : "deleted") + (meanwhile ? " meanwhile" : " before"));
            const FoundContainer container = world.make("app", application, asksAgain);
            const std::string& place = container.path;
            world.makeDirectories("precious", 0, 0700);
            world.makeDirectories("precious/file");
            const std::string metadata = std::string("/") + names::metadataFile;
            world.write("precious" + metadata, world.read(world.relative(place) + metadata)); // it may be taken for it
            bool swapped = false;
            const auto swap = [&](const DiskCallInfo& call) {
                if (!swapped && call.call == DiskCall::rename && call.subject.starts_with(nameOf(place))) {
                    swapped = true;
                    world.move(place, "aside");
                    world.move("precious", place);
                }
                return false;
            };
            // A pass waits for the judgement of what comes to death row.
            world.disk().before = [&](const DiskCallInfo& call) {
                // One that lies there before is not moved at all: a stop then would leave it to a pass.
                EXPECT_TRUE(meanwhile || call.call != DiskCall::rename || !call.subject.starts_with(nameOf(place)));
                if (!meanwhile || call.call != DiskCall::rename || !call.subject.ends_with(" -> " + nameOf(place)))
                    return;
                world.daemonsClient().deleteContainersOnDeathRowWithCompletion(nullptr);
                std::this_thread::sleep_for(std::chrono::milliseconds(100));
            };
            if (meanwhile)
                world.disk().arm({.filter = swap});
            else
                swap({.call = DiskCall::rename, .subject = nameOf(place)});
            if (asksAgain)
                (void)world.create("app", application, true);
            else
                (void)world.stage(container);
            world.drainDeathRow();
            world.disk().disarm();
            world.disk().before = nullptr;
            EXPECT_TRUE(swapped);
            EXPECT_EQ(world.pass(), ErrorCode::success);
            EXPECT_TRUE(isThere(place + "/file"));
            EXPECT_EQ(itemAt(place), directoryOf(0, 0700));
            for (const char* left : {"aside", "private/var/mobile/Containers"})
                std::filesystem::remove_all(world.path(left));
            world.restart();
            world.load();
        }
}

} // namespace
} // namespace zor::test
