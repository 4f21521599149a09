// SPDX-License-Identifier: Apache-2.0
// The daemon's life: its log, the work of a boot, the lock state, what a failed service does to it; the command line.
#include "daemon/Daemon.h"
#include "daemon/Options.h"
#include "world/World.h"

#include <algorithm>
#include <filesystem>
#include <future>
#include <gtest/gtest.h>
#include <unistd.h>

namespace zor::test {
namespace {

using support::LogLine;

// Goal: a boot's work runs once, again without a marker of the daemon's own; a launch's each time. Method: launches
// over one disk.
TEST(DaemonLife, TheWorkOfABootRunsOnce) {
    struct Row {
        const char* name;
        platform::BootMarker::State marker;
        int makeError;
        bool boots;
    };
    const Row rows[] = {
        {"first", {}, 0, true},
        {"second", {.present = true}, 0, false},
        {"marker cannot be made", {}, EACCES, true},
        {"foreign", {.present = false, .foreign = true}, 0, true},
    };
    World world;
    const std::string temporary = std::string(cachesPath) + "/Temp/Data/System/x";
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        world.bootMarker.state = row.marker;
        world.bootMarker.makeError = row.makeError;
        world.makeDirectories(temporary);
        world.makeDirectories(staging + "/x");
        world.restart();
        world.log.take();
        Daemon(world.services(), {}).setUp();
        world.drainDeathRow();
        EXPECT_EQ(world.exists(temporary), !row.boots);
        EXPECT_FALSE(world.exists(staging + "/x"));
        EXPECT_TRUE(world.names(dead).empty());
        EXPECT_EQ(world.complaints("main").size(), row.marker.foreign ? 1U : 0U);
        EXPECT_EQ(world.bootMarker.state.present, row.makeError == 0);
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
        if (before == 0)
            std::filesystem::remove_all(world.path(home));
        else
            world.makeDirectories(home, owner, before);
        world.bootMarker.state.present = true;
        world.services().configuration().logDirectory();
        world.log.take();
        Daemon(world.services(), {}).setUp();
        EXPECT_EQ(world.item(home), directoryOf(owner, after));
        const auto lines = world.log.take();
        const auto line = std::ranges::find_if(lines, [](const LogLine& one) { return one.function == "main"; });
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
    // What is queued while locked runs after the unlock.
    world.lockState.state = 1;
    daemon.evaluateLockState();
    std::promise<void> ran;
    auto future = ran.get_future();
    world.lockStateQueue.async([&] { ran.set_value(); });
    EXPECT_EQ(future.wait_for(std::chrono::milliseconds(30)), std::future_status::timeout);
    world.lockState.state = 0;
    daemon.evaluateLockState();
    EXPECT_EQ(future.wait_for(std::chrono::seconds(10)), std::future_status::ready);

    World failing;
    failing.lockState.registrationStatus = 28;
    Daemon(failing.services(), {}).followLockState();
    EXPECT_EQ(failing.log.take(), (std::vector<LogLine>{{3, "main", "register failed for lockstate: 28"}}));
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

// Goal: every command line ends in options or in a text with its exit status. Method: a table.
TEST(Options, CommandLine) {
    const auto parse = [](std::vector<std::string> texts) {
        texts.insert(texts.begin(), "zorvaned");
        std::vector<char*> arguments;
        for (std::string& text : texts)
            arguments.push_back(text.data());
        arguments.push_back(nullptr);
        return parseDaemonOptions(static_cast<int>(texts.size()), arguments.data());
    };
    struct Row {
        std::vector<std::string> arguments;
        int status;
        const char* text;
    };
    const Row rows[] = {
        {{"--root"}, 2, "option '--root' needs a value"},
        {{"--log-level", "8"}, 2, "log level '8' is not a number from 0 to 7"},
        {{"--log-level", ""}, 2, "log level '' is not"},
        {{"--nonsense"}, 2, "unknown option '--nonsense'"},
        {{"--", "start"}, 2, "unexpected argument 'start'"},
        {{"--help", "--nonsense"}, 0, "Usage: zorvaned"},
        {{"--version"}, 0, "zorvaned "},
    };
    for (const Row& row : rows) {
        const auto options = parse(row.arguments);
        ASSERT_FALSE(options) << row.text;
        EXPECT_EQ(options.error().exitStatus, row.status) << row.text;
        EXPECT_NE(options.error().text.find(row.text), std::string::npos) << options.error().text;
    }
    const auto shown = [&](const std::vector<std::string>& arguments) {
        const auto options = parse(arguments).value();
        return options.rootDirectory + " " + std::to_string(options.logLevel) +
               (options.foreground ? " foreground" : "") + (options.forgetBoot ? " forget" : "");
    };
    EXPECT_EQ(shown({}), "/ 5");
    EXPECT_EQ(shown({"--root", "/tmp/x", "--log-level", "7"}), "/tmp/x 7");
    EXPECT_EQ(shown({"--root=/tmp/x", "--log-level=0"}), "/tmp/x 0");
    EXPECT_EQ(shown({"--foreground", "--forget-boot"}), "/ 5 foreground forget");
}

} // namespace
} // namespace zor::test
