// SPDX-License-Identifier: Apache-2.0
// The daemon's life: its log, the work of a boot, the lock state, what a failed service does to it.
#include "daemon/Daemon.h"
#include "world/World.h"

#include <gtest/gtest.h>
#include <unistd.h>

namespace zor::test {
namespace {

// Goal: a boot's work runs once, again without a marker of the daemon's own; a launch's each time. Method: launches
// over one disk.
TEST(DaemonLife, TheWorkOfABootRunsOnce) {
    struct Row {
        platform::BootMarker::State marker;
        int makeError;
        bool boots;
    };
    World world;
    const std::string temporary = std::string(cachesPath) + "/Temp/Data/System/x";
    for (const auto& [marker, makeError, boots] :
         {Row{{}, 0, true}, Row{{.present = true}, 0, false}, Row{{}, EACCES, true},
          Row{{.present = false, .foreign = true}, 0, true}}) {
        SCOPED_TRACE(std::to_string(marker.present) + std::to_string(marker.foreign) + std::to_string(makeError));
        world.bootMarker.state = marker;
        world.bootMarker.makeError = makeError;
        world.makeDirectories(temporary);
        world.makeDirectories(staging + "/x");
        world.restart();
        (void)world.find("app");
        EXPECT_EQ(world.services().cache().counts().classCaches, 1U);
        world.log.take();
        Daemon(world.services(), {}).setUp();
        world.drainDeathRow();
        EXPECT_EQ(world.services().cache().counts().classCaches, 0U); // what a setup found is not kept
        EXPECT_EQ(world.exists(temporary), !boots);
        EXPECT_TRUE(world.names(staging).empty() && world.names(dead).empty());
        EXPECT_EQ(world.complaints("main").size(), marker.foreign ? 1U : 0U);
        EXPECT_EQ(world.bootMarker.state.present, makeError == 0);
    }
}

// Goal: nobody else reads what is staged or deleted. Method: the home of the daemon's directories missing, open,
// closed, and another's, which stays so and is said, before a launch.
TEST(DaemonLife, ClosesItsHome) {
    struct Row {
        std::uint32_t owner;
        mode_t before;
        mode_t after;
        int said; // the level; 0: nothing
    };
    const std::string home = "private/var/root";
    for (const auto& [owner, before, after, said] :
         {Row{0, 0, 0700, 0}, Row{0, 0755, 0700, 5}, Row{0, 0710, 0700, 5}, Row{0, 0700, 0700, 0},
          Row{second, 0755, 0755, 3}, Row{second, 0700, 0700, 0}}) {
        if (owner != 0 && ::geteuid() != 0)
            continue; // another's cannot be made
        SCOPED_TRACE(before);
        World world;
        std::filesystem::remove_all(world.path(home));
        if (before != 0)
            world.makeDirectories(home, owner, before);
        world.bootMarker.state.present = true;
        world.services().configuration().logDirectory();
        world.log.take();
        Daemon(world.services(), {}).setUp();
        EXPECT_EQ(world.item(home), directoryOf(owner, after));
        const auto lines = world.log.take();
        const auto line = std::ranges::find(lines, "main", &support::LogLine::function);
        EXPECT_EQ(line == lines.end() ? 0 : line->level, said);
    }
}

// Goal: suspensions and resumptions pair, whatever is reported. Method: sequences of states with the calls they make.
TEST(DaemonLife, FollowsTheLockState) {
    World world;
    Daemon daemon(world.services(), {});
    daemon.followLockState();
    ASSERT_TRUE(world.lockState.notify);
    struct Row {
        int state;
        int suspended;
        int resumed;
    };
    for (const auto& [state, suspended, resumed] :
         {Row{0, 0, 0}, Row{2, 0, 0}, Row{1, 1, 0}, Row{1, 1, 0}, Row{3, 1, 0}, Row{-1, 1, 0}, Row{0, 1, 1},
          Row{0, 1, 1}, Row{1, 2, 1}, Row{0, 2, 2}}) {
        world.lockState.state = state;
        world.lockState.notify();
        EXPECT_EQ(world.lockStateQueue.suspended, suspended) << state;
        EXPECT_EQ(world.lockStateQueue.resumed, resumed) << state;
    }
}

// Goal: a launch serves when it says that it is ready, is busy until then, and ends when told; without the listener it
// goes on and never says so, without the upcall port or a queue it does not, and without a queue it touches nothing.
// Method: whole runs, with something in the place of a socket, and with a queue that gets no thread.
TEST(DaemonLife, RunsUntilToldToStop) {
    enum class Blocked { nothing, listener, upcall, queue };
    for (const Blocked blocked : {Blocked::nothing, Blocked::listener, Blocked::upcall, Blocked::queue}) {
        World world;
        if (blocked == Blocked::listener)
            world.makeDirectories("run/zorvane/com.veltra.zorvaned/occupied");
        if (blocked == Blocked::upcall)
            world.makeDirectories("run/zorvane/com.veltra.zorvaned.upcall/occupied");
        world.lockStateQueue.canStart = blocked != Blocked::queue;
        const bool serves = blocked == Blocked::nothing || blocked == Blocked::listener;
        world.lockState.state = 1;
        bool ready = false;
        platform::Platform roles = world.linux().roles();
        Daemon daemon(world.services(), {.ready = [&] {
                          ready = true;
                          world.drainDeathRow();
                          EXPECT_EQ(roles.transactions.count(), 0U);
                          EXPECT_EQ(world.lockStateQueue.suspended, 1);
                          roles.runLoop.stop();
                      }});
        if (blocked == Blocked::listener)
            roles.runLoop.stop();
        EXPECT_EQ(daemon.run(), serves ? 0 : -1);
        EXPECT_EQ(ready, blocked == Blocked::nothing);
        EXPECT_EQ(world.complaints("main").size(), blocked == Blocked::nothing ? 0U : 1U);
        EXPECT_EQ(world.bootMarker.state.present, blocked != Blocked::queue);
    }
}

} // namespace
} // namespace zor::test
