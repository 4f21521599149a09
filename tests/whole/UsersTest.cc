// SPDX-License-Identifier: Apache-2.0
// A root from nothing to its first containers, and one whose users have numbers of its own: what daemon, tool, library
// and check make of it.
#include "device/DeviceQueries.h"
#include "os/SystemRoot.h"
#include "process/DaemonProcess.h"
#include "support/FileTree.h"

#include <csignal>
#include <filesystem>
#include <gtest/gtest.h>
#include <unistd.h>

namespace zor::whole {
namespace {

uid_t ownerOf(const std::string& path) {
    struct stat status{};
    return ::stat(path.c_str(), &status) == 0 ? status.st_uid : UINT32_MAX;
}

/// The path in a tool's answer.
std::string pathIn(const Outcome& outcome, const std::string& root) {
    const auto begin = outcome.output.find(root + "/");
    return begin == std::string::npos
               ? ""
               : outcome.output.substr(begin, outcome.output.find_first_of("\"\n ", begin) - begin);
}

// Goal: init makes a root that works, and a second one changes nothing. Method: the next command is create.
TEST(Users, InitMakesARootThatWorks) {
    const support::TemporaryDirectory above("/dev/shm");
    const std::string root = above.path() + "/root";
    const auto init = [&] { return runProgram(toolWords(root, {"init", "--user", "ann"})); };
    const auto first = init();
    ASSERT_EQ(first.exitStatus, 0) << first.output;
    EXPECT_NE(init().output.find("all was there already"), std::string::npos);
    Program daemon({programPath("zorvaned"), "--root", root, "--forget-boot"});
    Outcome made;
    for (int tries = 0; tries < 500 && (tries == 0 || made.exitStatus != 0); ++tries, ::usleep(20'000))
        made = runProgram(toolWords(root, {"create", "org.example.a", "--class", "data-app", "--user", "501"}));
    EXPECT_EQ(made.exitStatus, 0) << made.output << daemon.said();
    EXPECT_TRUE(std::filesystem::is_directory(pathIn(made, root) + "/Documents")) << made.output;
    const auto checked = runProgram(toolWords(root, {"check"}));
    EXPECT_EQ(checked.exitStatus, 0) << checked.output;
    daemon.signal(SIGTERM);
    EXPECT_EQ(daemon.wait(), 0);
    // The marker of this root is a semaphore that would outlive it.
    platform::SemaphoreBootMarker(*platform::SystemRoot::open(root)).forget();
}

// Goal: configured users own what the usual ones do elsewhere, and a stranger's number is nobody's. Method: a root with
// numbers of its own, seen by the tool, the library and the check.
TEST(Users, ConfiguredNumbersHoldEverywhere) {
    if (::geteuid() != 0)
        GTEST_SKIP() << "needs root: containers are given to other users";
    DaemonProcess daemon;
    writeFile(daemon.path("etc/passwd"), "root:x:0:0::/private/var/root:/bin/sh\nann:x:1000:1000::/home/ann:/bin/sh\n"
                                         "boxes:x:700:700::/:/bin/sh\n");
    writeFile(daemon.path("etc/zorvane/zorvaned.conf"),
              "[users]\ninstaller=boxes\nsystem=701\nfirst=1000\nlast=1001\n");
    std::filesystem::create_directories(daemon.path("home/ann"));
    ASSERT_EQ(::chown(daemon.path("home/ann").c_str(), 1000, 1000), 0);
    ASSERT_EQ(::chown(daemon.path("private/var/brevad").c_str(), 700, 700), 0);
    daemon.start();
    const auto owners = zorvane::containerOwners(daemon.root());
    EXPECT_EQ(owners.installer + owners.system + owners.first + owners.last, 700U + 701 + 1000 + 1001);
    const struct {
        std::vector<std::string> words;
        uid_t owner; // of the container; UINT32_MAX: refused
    } rows[] = {
        {{"create", "org.example.a", "--class", "bundle-app"}, 700},
        {{"create", "org.example.a", "--class", "bundle-app", "--transient"}, 700},
        {{"create", "org.example.a", "--class", "Data/System"}, 0},
        {{"create", "org.example.a", "--class", "data-app", "--user", "1000"}, 1000},
        {{"create", "org.example.a", "--class", "bundle-app", "--user", "33"}, UINT32_MAX},
        {{"create", "org.example.a", "--class", "data-app", "--user", "501"}, UINT32_MAX},
    };
    for (const auto& row : rows) {
        const auto outcome = daemon.tool(row.words);
        EXPECT_EQ(outcome.exitStatus == 0, row.owner != UINT32_MAX) << outcome.output;
        EXPECT_EQ(ownerOf(pathIn(outcome, daemon.root())), row.owner) << outcome.output;
    }
    EXPECT_EQ(daemon.terminate(), 0);
}

} // namespace
} // namespace zor::whole
