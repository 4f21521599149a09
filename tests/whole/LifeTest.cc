// SPDX-License-Identifier: Apache-2.0
// The daemon's life as its users see it: killed at any moment, started twice, told to stop, asked by its tool.
#include "os/FileDescriptor.h"
#include "process/DaemonProcess.h"
#include "process/Relay.h"
#include "support/LongRun.h"

#include <atomic>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <future>
#include <gtest/gtest.h>
#include <poll.h>
#include <random>
#include <sched.h>
#include <set>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

namespace zor::whole {

// Goal: one daemon a root, an end on request, and start-up errors that say what to do.
TEST(Life, SecondDaemonAndSigtermAndBrokenCommandLines) {
    DaemonProcess daemon;
    std::filesystem::create_directories(daemon.path("run/zorvane/zorvaned.status/occupied"));
    daemon.start();
    EXPECT_NE(daemon.log().find("No status socket: "), std::string::npos); // a help, not a service
    const auto second = runProgram({programPath("zorvaned"), "--root", daemon.root()});
    EXPECT_EQ(second.exitStatus, 1);
    EXPECT_NE(second.output.find("zorvaned: "), std::string::npos) << second.output;
    EXPECT_EQ(daemon.terminate(), 0);
    const std::pair<std::vector<std::string>, int> rows[] = {{{"--root"}, 2},
                                                             {{"--log-level", "x"}, 2},
                                                             {{"--nothing"}, 2},
                                                             {{"stray"}, 2},
                                                             {{"--containers-per-user", "1x"}, 2},
                                                             {{"--help"}, 0},
                                                             {{"--version"}, 0},
                                                             {{"--root", "/nowhere"}, 1}};
    for (const auto& [arguments, status] : rows) {
        std::vector<std::string> words = {programPath("zorvaned")};
        words.insert(words.end(), arguments.begin(), arguments.end());
        EXPECT_EQ(runProgram(words).exitStatus, status) << arguments[0];
    }
}

// Goal: a daemon that would take its clients for other processes does not start, and says why. Method: the /proc of
// outside in a pid namespace of its own.
TEST(Life, TheProcOfAnotherPidNamespace) {
    constexpr int cannot = 99;
    const DaemonProcess place;
    Program daemon({programPath("zorvaned"), "--root", place.root()}, [] {
        const pid_t inner = ::unshare(CLONE_NEWPID) == 0 ? ::fork() : -1;
        int status = 0;
        if (inner != 0)
            ::_exit(::waitpid(inner, &status, 0) == inner ? WEXITSTATUS(status) : cannot);
        ::alarm(10);
        return true;
    });
    if (daemon.wait() == cannot)
        GTEST_SKIP() << "needs root and pid namespaces";
    EXPECT_NE(daemon.said().find("zorvaned: /proc is not mounted or belongs to another pid namespace"),
              std::string::npos)
        << daemon.said();
}

// Goal: where there are few descriptors, users that hold all the connections that they get shut out neither root, nor
// the upcall, nor the status. Method: three users connect as often as the daemon has descriptors.
TEST(Life, FewDescriptorsAreShared) {
    constexpr rlim_t descriptors = 512;
    if (::geteuid() != 0)
        GTEST_SKIP() << "needs root: it connects under other uids";
    const rlimit few{.rlim_cur = descriptors, .rlim_max = descriptors};
    DaemonProcess daemon;
    daemon.start({}, [&] { return ::setrlimit(RLIMIT_NOFILE, &few) == 0; });
    const auto connect = [&](uid_t uid, int type, const std::string& name) {
        sockaddr_un address{.sun_family = AF_UNIX, .sun_path = {}};
        daemon.path("run/zorvane/" + name).copy(address.sun_path, sizeof address.sun_path - 1);
        platform::FileDescriptor socket(::socket(AF_UNIX, type | SOCK_CLOEXEC, 0));
        (void)::syscall(SYS_setresuid, -1, uid, -1);
        const int failed = ::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address);
        (void)::syscall(SYS_setresuid, -1, 0, -1);
        EXPECT_EQ(failed, 0) << errno;
        return socket;
    };
    std::vector<platform::FileDescriptor> idle;
    for (const uid_t uid : {501U, 502U, 100'000U})
        for (rlim_t i = 0; i < descriptors; ++i)
            idle.push_back(connect(uid, SOCK_STREAM, "com.veltra.zorvaned"));
    zorvane::Client client = daemon.client();
    EXPECT_TRUE(client.createOrLookup(dataContainer("a")));
    EXPECT_GT(daemon.counter("Connections"), 3 * 16);
    const platform::FileDescriptor agent = connect(0, SOCK_SEQPACKET, "com.veltra.zorvaned.upcall");
    pollfd refused{.fd = agent.get(), .events = POLLIN, .revents = 0};
    EXPECT_EQ(::poll(&refused, 1, 100), 0) << "the upcall's connection was closed";
}

// Goal: a file that may not grow any further is an error that is told, by the daemon and by the tool, and no end.
TEST(Life, FilesThatMayNotGrow) {
    constexpr rlim_t bytes = 16'384;
    const rlimit small{.rlim_cur = bytes, .rlim_max = RLIM_INFINITY};
    DaemonProcess daemon;
    daemon.start();
    zorvane::Client client = daemon.client();
    const auto made = client.createOrLookup(dataContainer("a"));
    ASSERT_TRUE(made);
    ASSERT_EQ(::prlimit(daemon.pid(), RLIMIT_FSIZE, &small, nullptr), 0);
    const auto set = client.setInfoValue({dataApplication, mobile, "a", made->uuid}, "k", {{std::string(bytes, 'x')}});
    ASSERT_FALSE(set);
    EXPECT_EQ(set.error().code, 34U);
    EXPECT_NE(daemon.log().find(std::strerror(EFBIG)), std::string::npos);
    EXPECT_TRUE(client.createOrLookup(dataContainer("b")));
    std::filesystem::create_directory(daemon.path("tmp/source"));
    writeFile(daemon.path("tmp/source/large"), std::string(2 * bytes, 'x'));
    Program tool(daemon.toolWords({"install", "--class", "2", "c", daemon.path("tmp/source")}),
                 [&] { return ::setrlimit(RLIMIT_FSIZE, &small) == 0; });
    EXPECT_LT(tool.wait(), 128);
    EXPECT_NE(tool.said().find(std::strerror(EFBIG)), std::string::npos) << tool.said();
}

// Goal: transient containers end with the boot, others stay; a root that "reboots" does the boot's work once.
TEST(Life, RebootClearsTransientContainersAndOrphans) {
    DaemonProcess daemon;
    daemon.start();
    ASSERT_TRUE(daemon.client().createOrLookup(dataContainer("kept")));
    const std::string transient = daemon.client().createOrLookup(dataContainer("passing", true)).value().path;
    daemon.kill();
    const std::string classDirectory = daemon.path("private/var/mobile/Containers/Data/Application/");
    const std::string orphans[] = {classDirectory + "Junk", classDirectory + "6F9619FF-8B86-D011-B42D-00C04FC964FF"};
    for (const std::string& orphan : orphans)
        std::filesystem::create_directory(orphan);
    daemon.start();
    EXPECT_TRUE(std::filesystem::exists(transient)) << "an ordinary restart is no boot";
    EXPECT_TRUE(std::filesystem::exists(orphans[0]));
    daemon.kill();
    daemon.start({"--forget-boot"});
    for (const std::string& gone : {transient, orphans[0], orphans[1]})
        EXPECT_FALSE(std::filesystem::exists(gone)) << gone;
    EXPECT_TRUE(daemon.client().createOrLookup(dataContainer("kept")).value().existed);
}

struct ToolCall {
    std::vector<std::string> arguments;
    int exitStatus;
    const char* inOutput;
};
void expectCall(const DaemonProcess& daemon, const ToolCall& row) {
    std::vector<std::string> words = daemon.toolWords(row.arguments);
    if (!row.arguments.empty() && row.arguments[0] == "--root") // another than the daemon's
        words.erase(words.begin() + 1, words.begin() + 3);
    const auto outcome = runProgram(words);
    EXPECT_EQ(outcome.exitStatus, row.exitStatus) << ::testing::PrintToString(row.arguments) << outcome.output;
    EXPECT_NE(outcome.output.find(row.inOutput), std::string::npos)
        << ::testing::PrintToString(row.arguments) << outcome.output;
}

// Goal: the tool's exit codes and outputs are what scripts rely on. Method: a table of calls on a real daemon.
TEST(Tool, ExitCodesAndOutput) {
    DaemonProcess daemon;
    daemon.start();
    const std::string controls = "\302\23331m"; // would colour a terminal
    const std::vector<ToolCall> rows = {
        {{"create", "a.b", "--class", "data-app", "--user", "501"}, 0, "a.b created"},
        {{"lookup", "a.b", "--class", "2"}, 0, "a.b exists"},
        {{"--json", "lookup", "a.b", "--class", "Data/Application"}, 0, "\"existed\": true"},
        {{"lookup", "nobody", "--class", "2"}, 1, "code 21"},
        {{"--json", "lookup", "nobody", "--class", "2"}, 1, "\"code\": 21"},
        {{"create", "a.b", "--class", "2", "--user", "99"}, 1, "code 38"},
        {{"list", "--class", "data-app"}, 0, "a.b"},
        {{"--json", "list", "--class", "bundle-app"}, 0, "[]"},
        {{"create", "tool", "--class", "bundle-app"}, 0, "tool created"},
        {{"delete", "a.b", "x.y", "--class", "data-app", "--yes"}, 1, "nothing was deleted"},
        {{"metadata", "a.b", "--class", "data-app"}, 0, "transient  no"},
        {{"info", "set", "a.b", "k", "{\"deep\": [1, true]}", "--class", "data-app"}, 0, "a.b set"},
        {{"--json", "info", "get", "a.b", "k", "--class", "data-app"}, 0, "\"deep\""},
        {{"info", "set", "a.b", "k", "null", "--class", "data-app"}, 2, "null"},
        {{"info", "unset", "a.b", "k", "--class", "data-app"}, 0, "a.b unset"},
        {{"info", "get", "a.b", "k", "--class", "data-app"}, 1, "code 24"},
        {{"--json", "info", "list", "a.b", "--class", "data-app"}, 0, "{}"},
        {{"repair", "a.b", "--class", "data-app"}, 0, "a.b repaired"},
        {{"protect", "a.b", "2", "--class", "data-app"}, 1, "code 38"},
        {{"--json", "lock-state", "1"}, 0, "\"locked\": true"},
        {{"protect", "a.b", "1", "--class", "data-app", "--fail-if-locked"}, 1, "code 61"},
        {{"protect", "a.b", "1", "--class", "data-app", "--no-wait"}, 0, "a.b gets class 1"},
        {{"protection", "a.b", "--class", "data-app"}, 0, "1, waiting for the device to be unlocked"},
        {{"--json", "protection", "a.b", "--class", "data-app"}, 0, "\"waitsForUnlock\": true"},
        {{"lock-state", "0"}, 0, "unlocked"},
        {{"protect", "a.b", "9", "--class", "data-app", "--third-party"}, 1, "code 38"},
        {{"--root", "/", "lock-state", "1"}, 2, "the device's to set"},
        {{"explain", "61"}, 0, "What to do"},
        {{"explain", "10000"}, 2, "is no code"},
        {{"regenerate", "a.b", "--class", "data-app"}, 0, "is now at"},
        {{"usage", "--class", "data-app"}, 0, "a.b"},
        {{"--json", "usage", "a.b", "--class", "data-app"}, 0, "\"bytes\""},
        {{"usage", "x.y", "--class", "data-app"}, 1, "code 21"},
        {{"wipe", "a.b", "--class", "data-app"}, 2, "--yes"},
        {{"wipe", "a.b", "--class", "data-app", "--yes"}, 0, "a.b wiped"},
        {{"replace", "a.b", "--class", "data-app", "--yes"}, 1, "no transient container"},
        {{"create", "a.b", "--class", "data-app", "--transient"}, 0, "a.b created"},
        {{"replace", "a.b", "--class", "data-app", "--yes"}, 0, "a.b replaced"},
        {{"delete", "a.b", "--class", "data-app"}, 2, "--yes"},
        {{"delete", "a.b", "--class", "data-app", "--yes"}, 0, "a.b deleted"},
        {{"lookup", "a.b", "--class", "data-app"}, 1, "code 21"},
        {{"empty-death-row"}, 0, "Death row is empty"},
        {{"entitlements", "set", "a.b"}, 2, "no entitlements given"},
        {{"entitlements", "set", "a.b", "--from", "/nowhere"}, 2, "cannot be read"},
        {{"entitlements", "set", "a.b", "--app-group", "group.a", "--system-container"}, 0, "a.b registered"},
        {{"entitlements", "set", "c.d", "--app-group", "group.a", "--parent", "a.b"}, 0, "c.d registered"},
        {{"entitlements", "show", "a.b"}, 0, "child: c.d"},
        {{"--json", "entitlements", "show", "nobody"}, 0, "\"registered\": false"},
        {{"groups", "a.b"}, 0, "group.a"},
        {{"--json", "groups", "nobody"}, 0, "\"application\": {}"},
        {{"system-path", "a.b"}, 0, "/Data/System/"},
        {{"system-group-path", "systemgroup.com.veltra.fonts"}, 0, "/systemgroup.com.veltra.fonts"},
        {{"system-group-path", "systemgroup.other"}, 1, "code 55"},
        {{"why", "a.b"}, 0, "2 references, by a.b c.d"},
        {{"--json", "why", "a.b"}, 0, "\"systemContainerGoesWithIdentifier\": true"},
        {{"entitlements", "clear", "a.b"}, 0, "a.b cleared"},
        {{"--json", "list", "--class", "data-system"}, 0, "[]"},
        {{"why", "c.d"}, 0, "of application group group.a"},
        {{"delete", "--class", "data-app"}, 2, "required"},
        {{"status"}, 0, "MessagesServed"},
        {{"--json", "status"}, 0, "\"Counters\""},
        {{"lookup", "a.b"}, 2, "--class"},
        {{"lookup", "a.b", "--class", "shared"}, 2, "no class"},
        {{}, 2, "subcommand"},
        {{"--help"}, 0, "Examples"},
        {{"--root", "/nowhere", "status"}, 3, "cannot reach zorvaned"},
        {{"--root", "/nowhere", "--json", "list", "--class", "2"}, 3, "\"unreachable\""},
        {{"create", controls, "--class", "2"}, 0, "\\xc2\\x9b31m created"},
        {{"--json", "list", "--class", "2"}, 0, "\"\\u009b31m\""},
        // With --json, what the tool itself refuses is JSON too.
        {{"--json", "wipe", controls, "--class", "2"}, 2, "{\n  \"error\""},
        {{"--json", "info", "set", "a.b", "k", "null", "--class", "2"}, 2, "{\n  \"error\""},
        {{"--json", "entitlements", "set", "a.b"}, 2, "{\n  \"error\""},
        {{"--json", "entitlements", "set", "a.b", "--from", "/nowhere"}, 2, "{\n  \"error\""},
        {{"--json", "explain", "10000"}, 2, "{\n  \"error\""},
        {{"--root", "/", "--json", "lock-state", "1"}, 2, "{\n  \"error\""},
        {{"lookup", "--class", "--json"}, 2, "{\n  \"error\""},
    };
    for (const ToolCall& row : rows)
        expectCall(daemon, row);
}

// Goal: a change of protection class that waits for an unlock ends with the daemon: its client hears so, nothing of it
// is recorded or on disk, and asking again works. Method: a locked device, SIGKILL once the change is said to wait.
TEST(Life, KilledWhileAChangeOfProtectionWaits) {
    DaemonProcess daemon;
    daemon.start();
    const std::vector<std::string> show = {"--json", "protection", "a.b", "--class", "2"};
    expectCall(daemon, {{"create", "a.b", "--class", "2"}, 0, "created"});
    expectCall(daemon, {{"protect", "a.b", "3", "--class", "2", "--third-party"}, 0, "has class 3"});
    expectCall(daemon, {{"lock-state", "1"}, 0, "locked"});
    auto waiting = std::async(std::launch::async, [&daemon] {
        return daemon.client().setDataProtection({.containerClass = dataApplication,
                                                  .user = mobile,
                                                  .identifier = "a.b",
                                                  .protectionClass = 1,
                                                  .thirdParty = true,
                                                  .retryIfLocked = true});
    });
    bool waits = false;
    for (int tries = 0; tries < 200 && !waits; ++tries)
        waits = daemon.tool(show).output.find("\"waitsForUnlock\": true") != std::string::npos;
    ASSERT_TRUE(waits);
    daemon.kill();
    const auto answer = waiting.get();
    ASSERT_FALSE(answer);
    EXPECT_EQ(answer.error().kind, zorvane::Error::Kind::refused) << answer.error().message;
    daemon.start();
    expectCall(daemon, {show, 0, "\"pending\": null"});
    expectCall(daemon, {show, 0, "\"recorded\": 3"});
    expectCall(daemon, {{"lock-state", "0"}, 0, "unlocked"});
    expectCall(daemon, {show, 0, "\"recorded\": 3"});
    expectCall(daemon, {{"protect", "a.b", "1", "--class", "2", "--third-party"}, 0, "has class 1"});
    expectCall(daemon, {show, 0, "\"recorded\": 1"});
}

// Goal: a size that cannot be told is not told as none, and its question costs no other. Method: no answer to it.
TEST(Tool, SaysWhatItCouldNotMeasure) {
    DaemonProcess daemon;
    daemon.start();
    const Relay relay(daemon, [](ipc::Command command) {
        return command == ipc::Command::getDiskUsage ? Relay::Fate::unanswered : Relay::Fate::passedOn;
    });
    const std::string root = relay.root();
    expectCall(daemon, {{"--root", root, "create", "a.b", "--class", "2"}, 0, "created"});
    expectCall(daemon,
               {{"--root", root, "--timeout", "1000", "wipe", "a.b", "--class", "2"}, 2, "an unknown number of bytes"});
    expectCall(daemon, {{"--root", root, "--timeout", "1000", "--json", "delete", "a.b", "--class", "2", "--yes"},
                        0,
                        "\"bytes\": null"});
}

// Goal: damage is found, told and mended as promised, with a daemon and without one. Method: a table of calls over a
// store whose container lost a directory, then over one whose daemon was killed.
TEST(Tool, ChecksAndRepairs) {
    DaemonProcess daemon;
    daemon.start();
    expectCall(daemon, {{"create", "a.b", "--class", "data-app", "--user", "501"}, 0, "created"});
    expectCall(daemon, {{"--json", "check"}, 0, "\"findings\": []"});
    const std::string documents = daemon.client().createOrLookup(dataContainer("a.b")).value().path + "/Documents";
    std::filesystem::remove(documents);
    expectCall(daemon, {{"check"}, 4, "subdirectory-missing"});
    expectCall(daemon, {{"--json", "check"}, 4, "\"code\": \"subdirectory-missing\""});
    expectCall(daemon, {{"check", "--repair", "--dry-run"}, 4, "of a.b in Data/Application are made again"});
    EXPECT_FALSE(std::filesystem::exists(documents));
    expectCall(daemon, {{"check", "--repair"}, 0, "of a.b in Data/Application are made again"});
    EXPECT_TRUE(std::filesystem::exists(documents));
    expectCall(daemon, {{"explain", "subdirectory-missing"}, 0, "Consequence"});
    expectCall(daemon, {{"check", "--dry-run"}, 2, "--repair"});
    expectCall(daemon, {{"--root", "/nowhere", "--json", "check"}, 5, "\"local\""});
    // Beside a copy, in whichever order the directory lists them, the one that is served stays.
    const std::string live = std::filesystem::path(documents).parent_path();
    const std::string copy = live.substr(0, live.rfind('/')) + "/01234567-89AB-4DEF-8123-456789ABCDEF";
    for (const bool copyIsNewer : {false, true}) {
        std::filesystem::rename(live, copy);
        ASSERT_EQ(runProgram({"/bin/cp", "-a", copy, live}).exitStatus, 0);
        if (copyIsNewer) {
            std::filesystem::rename(copy, copy + "x");
            ASSERT_EQ(runProgram({"/bin/cp", "-a", copy + "x", copy}).exitStatus, 0);
            std::filesystem::remove_all(copy + "x");
        }
        const auto checked = daemon.tool({"check"});
        EXPECT_NE(checked.output.find("which clients are given"), std::string::npos) << checked.output;
        const std::size_t command = checked.output.find("(cd -P");
        ASSERT_NE(command, std::string::npos) << checked.output;
        EXPECT_EQ(std::system(checked.output.substr(command, checked.output.find('\n', command) - command).c_str()), 0);
        EXPECT_TRUE(std::filesystem::exists(live));
        EXPECT_EQ(daemon.client().createOrLookup(dataContainer("a.b")).value().path, live);
    }
    daemon.kill();
    expectCall(daemon, {{"check"}, 0, "The store is whole"});
    std::filesystem::remove(documents);
    expectCall(daemon, {{"check", "--repair"}, 3, "cannot reach"});
}

} // namespace zor::whole
