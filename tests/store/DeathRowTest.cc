// SPDX-License-Identifier: Apache-2.0
// Death row: what gets there, what a pass does with it, and the races between the two.
#include "world/World.h"

#include <atomic>
#include <future>
#include <gtest/gtest.h>
#include <thread>
#include <unistd.h>

namespace zor::test {
namespace {

using support::DiskCall;
using support::DiskCallInfo;
using support::hasLine;

const std::string dead = std::string(cachesPath) + "/Dead";

class DeathRow : public testing::Test {
protected:
    DeathRow() { world.load(); }
    World world;

    Result<void> condemn(std::string_view relative, StartDeletionThread start = StartDeletionThread::no) {
        return world.daemonsClient()._moveItemAtURLToDeathRow(world.url(relative), start);
    }
    /// The code of one pass.
    ErrorCode pass() {
        auto code = std::make_shared<std::promise<ErrorCode>>();
        world.daemonsClient().deleteContainersOnDeathRowWithCompletion([code](ErrorCode c) { code->set_value(c); });
        return code->get_future().get();
    }
    static bool isMove(const DiskCallInfo& call) { return call.call == DiskCall::rename; }
};

TEST_F(DeathRow, EqualNamesDoNotCollideAndMissingItemsAreNoFailure) {
    world.makeDirectories("a/X");
    world.makeDirectories("b/X");
    world.write("c/X", "a file");
    ASSERT_TRUE(condemn("a/X"));
    ASSERT_TRUE(condemn("b/X"));
    ASSERT_TRUE(condemn("c/X"));
    ASSERT_TRUE(condemn("d/X"));
    ASSERT_TRUE(condemn("a/X"));
    EXPECT_EQ(world.deathRow(), (std::vector<std::string>{"X", "X", "X"}));
    EXPECT_EQ(world.names(dead).size(), 5U); // two of them empty
    EXPECT_TRUE(world.log.take(3, "_moveItemAtURLToDeathRow").empty());
    EXPECT_EQ(pass(), ErrorCode::success);
    EXPECT_TRUE(world.names(dead).empty());
    EXPECT_EQ(pass(), ErrorCode::success);
}

// Goal: a pass that takes the fresh unique directory for rubbish costs nothing: the item gets there all the same, and
// its move is not mistaken for that of a missing item. Method: the unique directories go just before the move, once,
// and always.
TEST_F(DeathRow, APassRacesAMove) {
    for (const bool always : {false, true}) {
        world.makeDirectories("item");
        int times = 0;
        world.disk().arm({.filter = [&](const DiskCallInfo& call) {
            if (isMove(call) && (always || times == 0)) {
                ++times;
                for (const std::string& unique : world.names(dead))
                    ::rmdir(world.path(dead + "/" + unique).c_str());
            }
            return false;
        }});
        const auto moved = condemn("item");
        world.disk().disarm();
        EXPECT_EQ(moved.has_value(), !always);
        EXPECT_EQ(world.exists("item"), always);
        if (always) {
            EXPECT_TRUE(moved.error().is(ErrorCode::moveToDeathRowFailed));
            EXPECT_GT(times, 10);
        } else {
            EXPECT_EQ(world.deathRow(), (std::vector<std::string>{"item"}));
            EXPECT_EQ(pass(), ErrorCode::success);
        }
    }
}

// Goal: moves and passes at once lose nothing and leave nothing. Method: threads that condemn, with passes of their
// own.
TEST_F(DeathRow, ManyMovesAndPasses) {
    constexpr int itemsOfEach = 40;
    std::vector<std::thread> threads;
    std::atomic<int> failures{0};
    for (int t = 0; t < 3; ++t)
        threads.emplace_back([&, t] {
            for (int i = 0; i < itemsOfEach; ++i) {
                const std::string item = "items" + std::to_string(t) + "/" + std::to_string(i);
                world.makeDirectories(item);
                failures += !condemn(item, StartDeletionThread::yes);
                failures += world.exists(item);
            }
        });
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_EQ(failures, 0);
    EXPECT_EQ(pass(), ErrorCode::success);
    EXPECT_TRUE(world.names(dead).empty());
    EXPECT_TRUE(world.names("tmp").empty());
}

TEST_F(DeathRow, FailingMovesAreError41) {
    world.makeDirectories("item");
    world.services().configuration().deathrowDirectory();
    world.disk().arm({.error = EROFS, .filter = isMove});
    const auto moved = condemn("item", StartDeletionThread::yes);
    ASSERT_FALSE(moved);
    EXPECT_TRUE(moved.error().is(ErrorCode::moveToDeathRowFailed));
    EXPECT_TRUE(moved.error().description()->starts_with("Failed to move item at: " + world.path("item") +
                                                         " to: " + world.path(dead) + "/temp."));
    world.disk().arm({.error = ENOSPC, .filter = [](const DiskCallInfo& call) {
                          return call.call == DiskCall::makeDirectory && call.subject.starts_with("temp.");
                      }});
    const auto unique = condemn("item");
    world.disk().disarm();
    ASSERT_FALSE(unique);
    EXPECT_TRUE(unique.error().is(ErrorCode::moveToDeathRowFailed));
    EXPECT_EQ(unique.error().description(), "Failed to create unique directory at: " + world.path("item"));
    EXPECT_TRUE(world.exists("item"));
}

// Goal: what cannot be removed goes to the directory for temporary files; what cannot go there stays, is said, and is
// tried again; other items go meanwhile. Method: removal fails for one file, then the move too.
TEST_F(DeathRow, WhatCannotBeRemoved) {
    world.log.setLevel(logLevelDebug);
    const auto stuck = [](const DiskCallInfo& call) {
        return (call.call == DiskCall::unlinkFile && call.subject == "stuck") ||
               (call.call == DiskCall::removeDirectory && call.subject.starts_with("temp.x"));
    };
    world.write(dead + "/temp.xxxxxx/bundle/stuck", "");
    world.makeDirectories(dead + "/temp.yyyyyy/other");
    world.disk().arm({.error = EACCES, .span = support::FaultSpan::fromThenOn, .filter = [&](const DiskCallInfo& call) {
                          return stuck(call) || (isMove(call) && call.subject.starts_with("temp."));
                      }});
    EXPECT_EQ(pass(), ErrorCode::deathRowItemNotDestroyed);
    world.disk().disarm();
    EXPECT_EQ(world.names(dead), (std::vector<std::string>{"temp.xxxxxx"}));
    const auto said = world.log.take();
    const std::string item = world.path(dead + "/temp.xxxxxx");
    const std::string temporary = world.path("tmp");
    const std::string noMove = "Failed to move dir: " + item + " to: " + temporary + " (POSIX 13 \"rename of " + item +
                               " to " + temporary + "/temp.xxxxxx failed: Permission denied\")";
    EXPECT_TRUE(hasLine(said, 3, "_removeItemOrMoveToTempAtURL", noMove));
    EXPECT_TRUE(hasLine(said, 3, "deleteContainersOnDeathRowWithCompletion",
                        "Failed to destroy item at: " + item + " (ZORErrorDomain 4 \"Failed to move dir: " + item +
                            " to: " + temporary + "\")"));
    EXPECT_TRUE(hasLine(said, 7, "_removeItemOrMoveToTempAtURL",
                        "Couldn't remove, so moving item to /tmp: " + item + " : POSIX 13 \"prunetree of " + item +
                            " failed: Permission denied\""));

    world.disk().arm({.error = EACCES, .span = support::FaultSpan::fromThenOn, .filter = stuck});
    EXPECT_EQ(pass(), ErrorCode::success);
    world.disk().disarm();
    EXPECT_TRUE(world.names(dead).empty());
    EXPECT_EQ(world.names("tmp"), (std::vector<std::string>{"temp.xxxxxx"}));
    EXPECT_TRUE(world.exists("tmp/temp.xxxxxx/bundle/stuck"));
}

TEST_F(DeathRow, ADeathRowThatIsNoDirectory) {
    ASSERT_TRUE(world.services().defaultManager().removeItemAtURL(world.url(dead)));
    world.write(dead, "a file");
    EXPECT_EQ(pass(), ErrorCode::listForDeletionFailed);
    EXPECT_EQ(world.read(dead), "a file");
    ASSERT_EQ(::unlink(world.path(dead).c_str()), 0);
    EXPECT_EQ(pass(), ErrorCode::success);
    EXPECT_TRUE(world.item(dead).starts_with("directory"));
}

// Goal: the daemon counts as busy from the call until the pass has run, so a stop waits. Method: the queue stands
// still.
TEST_F(DeathRow, APassKeepsTheDaemonBusy) {
    platform::Platform roles = world.linux().roles();
    roles.deathRowQueue.suspend();
    for (const char* item : {"a", "b", "c"}) {
        world.makeDirectories(item);
        ASSERT_TRUE(condemn(item, StartDeletionThread::yes));
    }
    EXPECT_EQ(roles.transactions.count(), 3U);
    EXPECT_EQ(world.deathRow(), (std::vector<std::string>{"a", "b", "c"}));
    roles.deathRowQueue.resume();
    EXPECT_EQ(pass(), ErrorCode::success);
    world.drainDeathRow();
    EXPECT_EQ(roles.transactions.count(), 0U);
    EXPECT_TRUE(world.names(dead).empty());
}

} // namespace
} // namespace zor::test
