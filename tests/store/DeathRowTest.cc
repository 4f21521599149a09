// SPDX-License-Identifier: Apache-2.0
// Death row: what gets there, what a pass does with it, and the races between the two.
#include "world/World.h"

#include <gtest/gtest.h>
#include <unistd.h>

namespace zor::test {
namespace {

using support::DiskCall;
using support::DiskCallInfo;
using support::FaultSpan;
using support::hasLine;
using Names = std::vector<std::string>;

class DeathRow : public testing::Test {
protected:
    DeathRow() { world.load(); }
    World world;

    Result<void> condemn(std::string_view relative, StartDeletionThread start = StartDeletionThread::no) {
        return world.daemonsClient()._moveItemAtURLToDeathRow(world.url(relative), start);
    }
};

TEST_F(DeathRow, EqualNamesDoNotCollideAndMissingItemsAreNoFailure) {
    world.makeDirectories("a/X");
    world.makeDirectories("b/X");
    world.write("c/X", "a file");
    for (const char* item : {"a/X", "b/X", "c/X", "d/X", "a/X"})
        ASSERT_TRUE(condemn(item));
    EXPECT_EQ(world.deathRow(), (Names{"X", "X", "X"}));
    EXPECT_EQ(world.names(dead).size(), 5U); // two of them empty
    EXPECT_TRUE(world.complaints("_moveItemAtURLToDeathRow").empty());
    for (int i = 0; i < 2; ++i)
        EXPECT_EQ(world.pass(), ErrorCode::success);
    EXPECT_TRUE(world.names(dead).empty());
}

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
        const auto moved = condemn("item");
        world.disk().disarm();
        EXPECT_EQ(codeOf(moved), always ? ErrorCode::moveToDeathRowFailed : ErrorCode::success);
        EXPECT_EQ(world.exists("item"), always);
        EXPECT_EQ(times > 10, always);
        EXPECT_EQ(world.deathRow(), always ? Names() : Names{"item"});
        EXPECT_EQ(world.pass(), ErrorCode::success);
    }
}

// Goal: what cannot be removed goes to /tmp, or stays and is said; others go. Method: removal and move fail.
TEST_F(DeathRow, WhatCannotBeRemoved) {
    world.log.setLevel(logLevelDebug);
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
    const auto said = world.log.take();
    const std::string item = world.path(dead + "/temp.xxxxxx");
    const std::string noMove = "Failed to move dir: " + item + " to: " + world.path("tmp");
    EXPECT_TRUE(hasLine(said, 3, "_removeItemOrMoveToTempAtURL",
                        noMove + " (POSIX 13 \"rename of " + item + " to " + world.path("tmp/temp.xxxxxx") +
                            " failed: Permission denied\")"));
    EXPECT_TRUE(hasLine(said, 3, "deleteContainersOnDeathRowWithCompletion",
                        "Failed to destroy item at: " + item + " (ZORErrorDomain 4 \"" + noMove + "\")"));
    EXPECT_TRUE(hasLine(said, 7, "_removeItemOrMoveToTempAtURL",
                        "Couldn't remove, so moving item to /tmp: " + item + " : POSIX 13 \"prunetree of " + item +
                            " failed: Permission denied\""));
    movesFail = false;
    world.disk().arm(stuck);
    EXPECT_EQ(world.pass(), ErrorCode::success);
    EXPECT_TRUE(world.names(dead).empty());
    EXPECT_EQ(world.names("tmp"), (Names{"temp.xxxxxx"}));
    EXPECT_TRUE(world.exists("tmp/temp.xxxxxx/bundle/stuck"));
}

TEST_F(DeathRow, ADeathRowThatIsNoDirectory) {
    ASSERT_TRUE(world.services().defaultManager().removeItemAtURL(world.url(dead)));
    world.write(dead, "a file");
    EXPECT_EQ(world.pass(), ErrorCode::listForDeletionFailed);
    EXPECT_EQ(world.read(dead), "a file");
    ASSERT_EQ(::unlink(world.path(dead).c_str()), 0);
    EXPECT_EQ(world.pass(), ErrorCode::success);
    EXPECT_TRUE(world.item(dead).starts_with("directory"));
}

// Goal: the daemon is busy from the call until the pass has run. Method: the queue stands still.
TEST_F(DeathRow, APassKeepsTheDaemonBusy) {
    platform::Platform roles = world.linux().roles();
    roles.deathRowQueue.suspend();
    for (const char* item : {"a", "b", "c"}) {
        world.makeDirectories(item);
        ASSERT_TRUE(condemn(item, StartDeletionThread::yes));
    }
    EXPECT_EQ(roles.transactions.count(), 1U) << "a pass finds all that is there";
    EXPECT_EQ(world.deathRow(), (Names{"a", "b", "c"}));
    roles.deathRowQueue.resume();
    EXPECT_EQ(world.pass(), ErrorCode::success);
    EXPECT_EQ(roles.transactions.count(), 0U);
    EXPECT_TRUE(world.names(dead).empty());
}

} // namespace
} // namespace zor::test
