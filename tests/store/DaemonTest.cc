// SPDX-License-Identifier: Apache-2.0
// The daemon's life: its log, the work of a boot, the lock state, what a failed service does to it; the command line.
#include "daemon/Daemon.h"
#include "daemon/Options.h"
#include "world/World.h"

#include <future>
#include <gtest/gtest.h>
#include <thread>

namespace zor::test {
namespace {

using support::hasLine;
using support::LogLine;

const std::string logPath = "private/var/root/Library/Logs/Zorvane/zorvaned.log";

// Goal: the log is opened by name, sent to its file, with sizes by the kind of build; without a handle the daemon goes
// on. Method: a table.
TEST(DaemonLife, OpensItsLog) {
    struct Row {
        bool internal;
        int level;
        bool opens;
        const char* sizes;
    };
    for (const Row& row : {Row{false, 5, true, " 1 102400"}, Row{true, 5, true, " 4 262144"},
                           Row{false, 7, true, " 1 102400"}, Row{false, 7, false, " 1 102400"}}) {
        World world({.logLevel = 0});
        world.internalBuild.internal = row.internal;
        if (!row.opens)
            world.log.refuseToOpen();
        Daemon daemon(world.services(), {.logLevel = row.level});
        daemon.openLog();
        EXPECT_EQ(world.log.openedAs(), "com.veltra.zorvaned");
        EXPECT_EQ(world.log.diskLogging(), world.path(logPath) + row.sizes);
        EXPECT_TRUE(world.exists("private/var/root/Library/Logs/Zorvane"));
        const auto said = world.log.take();
        if (!row.opens) {
            EXPECT_EQ(said, (std::vector<LogLine>{
                                {3, "syslog", "Failed to set up rotating logs at path " + world.path(logPath)}}));
        } else if (row.level == 7) {
            ASSERT_FALSE(said.empty());
            EXPECT_EQ(said.back().function, "main");
            EXPECT_TRUE(said.back().message.starts_with("zorvaned built at ") &&
                        said.back().message.ends_with(" started"));
        } else {
            EXPECT_TRUE(said.empty());
        }
    }
}

// Goal: the work of a boot runs once a boot, again when its marker could not be made; the launch's work runs each time.
// Method: launches in a row over one disk; a transient container tells whether the boot's work ran.
TEST(DaemonLife, TheWorkOfABootRunsOnce) {
    struct Row {
        const char* name;
        platform::BootMarker::State marker;
        int makeError;
        bool boots;
        std::vector<LogLine> said;
    };
    const LogLine boot{5, "main", "zorvaned performing first boot initialization"};
    const LogLine foreign{3, "main", "Semaphore marker belongs to somebody else; it counts as absent"};
    const LogLine noMarker{3, "set_first_boot_work_completed", "Failed to create semaphore marker: Permission denied"};
    const Row rows[] = {
        {"first", {}, 0, true, {boot}},
        {"second", {.present = true}, 0, false, {}},
        {"marker cannot be made", {}, EACCES, true, {boot, noMarker}},
        {"and again", {}, EACCES, true, {boot, noMarker}},
        {"foreign", {.present = false, .foreign = true}, 0, true, {foreign, boot}},
    };
    World world;
    const std::string temporary = std::string(cachesPath) + "/Temp/Data/System/x";
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        world.bootMarker.state = row.marker;
        world.bootMarker.makeError = row.makeError;
        world.makeDirectories(temporary);
        world.makeDirectories(std::string(cachesPath) + "/Staging/x");
        world.restart();
        world.load();
        world.log.take();
        Daemon(world.services(), {}).setUp();
        world.drainDeathRow();
        EXPECT_EQ(world.exists(temporary), !row.boots);
        EXPECT_FALSE(world.exists(std::string(cachesPath) + "/Staging/x"));
        EXPECT_TRUE(world.names(std::string(cachesPath) + "/Dead").empty());
        std::vector<LogLine> said;
        for (LogLine& line : world.log.take())
            if (line.function == "main" || line.function == "set_first_boot_work_completed")
                said.push_back(std::move(line));
        EXPECT_EQ(said, row.said);
        EXPECT_EQ(world.bootMarker.state.present, row.makeError == 0);
    }
}

// Goal: suspensions and resumptions pair, whatever is reported. Method: sequences of states with the calls they make.
TEST(DaemonLife, FollowsTheLockState) {
    World world;
    world.log.setLevel(logLevelDebug);
    Daemon daemon(world.services(), {});
    struct Row {
        int state;
        int suspended;
        int resumed;
    };
    daemon.followLockState();
    ASSERT_TRUE(world.lockState.notify);
    for (const Row& row : {Row{0, 0, 0}, Row{2, 0, 0}, Row{1, 1, 0}, Row{1, 1, 0}, Row{3, 1, 0}, Row{-1, 1, 0},
                           Row{0, 1, 1}, Row{0, 1, 1}, Row{1, 2, 1}, Row{0, 2, 2}}) {
        world.lockState.state = row.state;
        world.log.take();
        world.lockState.notify();
        EXPECT_EQ(world.lockStateQueue.suspended, row.suspended) << row.state;
        EXPECT_EQ(world.lockStateQueue.resumed, row.resumed) << row.state;
        EXPECT_EQ(world.log.take(), (std::vector<LogLine>{{7, "ostrandd_notification_callback",
                                                           "LockState=" + std::to_string(row.state)}}));
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
// goes on, without the upcall port it does not. Method: whole runs, with something in the place of a socket.
TEST(DaemonLife, RunsUntilToldToStop) {
    enum class Blocked { nothing, listener, upcall };
    for (const Blocked blocked : {Blocked::nothing, Blocked::listener, Blocked::upcall}) {
        World world;
        if (blocked == Blocked::listener)
            world.makeDirectories("run/zorvane/com.veltra.zorvaned/occupied");
        if (blocked == Blocked::upcall)
            world.makeDirectories("run/zorvane/com.veltra.zorvaned.upcall/occupied");
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
        EXPECT_EQ(daemon.run(), blocked == Blocked::upcall ? -1 : 0);
        EXPECT_EQ(ready, blocked != Blocked::upcall);
        const auto said = world.log.take();
        EXPECT_EQ(hasLine(said, 3, "main", "unable to start ipsi service!"), blocked == Blocked::listener);
        EXPECT_EQ(hasLine(said, 3, "main", "Failed to initialize kernel upcall interface. THIS IS BAD! Exiting."),
                  blocked == Blocked::upcall);
        if (blocked == Blocked::upcall) {
            ASSERT_GE(said.size(), 2U);
            EXPECT_EQ(said[said.size() - 2].function, "ZORKernServerStart");
            EXPECT_TRUE(
                said[said.size() - 2].message.starts_with(std::string(roles.upcallPort.checkInCallName()) + ": "))
                << said[said.size() - 2];
        }
        EXPECT_TRUE(world.bootMarker.state.present);
    }
}

// Goal: every command line ends in options or in a text with its exit status. Method: a table.
TEST(Options, CommandLine) {
    struct Row {
        std::vector<std::string> arguments;
        std::string root; // empty: it does not start
        int levelOrStatus;
        const char* text;
    };
    const Row rows[] = {
        {{}, "/", 5, ""},
        {{"--root", "/tmp/x", "--log-level", "7"}, "/tmp/x", 7, ""},
        {{"--root=/tmp/x", "--log-level=0"}, "/tmp/x", 0, ""},
        {{"--root"}, "", 2, "option '--root' needs a value"},
        {{"--log-level", "8"}, "", 2, "log level '8' is not a number from 0 to 7"},
        {{"--log-level", "07"}, "", 2, "log level '07' is not"},
        {{"--log-level", ""}, "", 2, "log level '' is not"},
        {{"--log-level", "-1"}, "", 2, "log level '-1' is not"},
        {{"--nonsense"}, "", 2, "unknown option '--nonsense'"},
        {{"-xy"}, "", 2, "unknown option '-x'"},
        {{"start"}, "", 2, "unexpected argument 'start'"},
        {{"--", "start"}, "", 2, "unexpected argument 'start'"},
        {{"--help", "--nonsense"}, "", 0, "Usage: zorvaned"},
        {{"--version"}, "", 0, "zorvaned "},
    };
    for (const Row& row : rows) {
        std::vector<std::string> texts = row.arguments;
        texts.insert(texts.begin(), "zorvaned");
        std::vector<char*> arguments;
        for (std::string& text : texts)
            arguments.push_back(text.data());
        arguments.push_back(nullptr);
        const auto options = parseDaemonOptions(static_cast<int>(texts.size()), arguments.data());
        ASSERT_EQ(options.has_value(), !row.root.empty()) << row.text;
        if (options) {
            EXPECT_EQ(options->rootDirectory, row.root);
            EXPECT_EQ(options->logLevel, row.levelOrStatus);
            EXPECT_FALSE(options->foreground || options->forgetBoot);
        } else {
            EXPECT_EQ(options.error().exitStatus, row.levelOrStatus) << row.text;
            EXPECT_NE(options.error().text.find(row.text), std::string::npos) << options.error().text;
        }
    }
    char name[] = "zorvaned";
    char foreground[] = "--foreground";
    char forget[] = "--forget-boot";
    char* both[] = {name, foreground, forget, nullptr};
    const auto options = parseDaemonOptions(3, both);
    ASSERT_TRUE(options);
    EXPECT_TRUE(options->foreground && options->forgetBoot);
}

} // namespace
} // namespace zor::test
