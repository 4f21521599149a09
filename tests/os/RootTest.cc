// SPDX-License-Identifier: Apache-2.0
// A root, the disk below it, and the one daemon on it.
#include "os/DaemonLock.h"
#include "os/Openat2.h"
#include "support/TestRoot.h"

#include <csignal>
#include <fcntl.h>
#include <filesystem>
#include <gtest/gtest.h>
#include <sys/file.h>
#include <sys/wait.h>
#include <unistd.h>

namespace zor::platform {
namespace {

using support::TestRoot;

TEST(SystemRoot, MapsPathsAndRefusesARuntimeDirectoryOfOthers) {
    const TestRoot test;
    const SystemRoot& root = test.root();
    EXPECT_FALSE(root.isDeviceRoot());
    EXPECT_EQ(root.path("/private/var"), test.path("private/var"));
    EXPECT_EQ(root.path("run/zorvane"), test.path("run/zorvane"));
    EXPECT_EQ(root.path("/"), root.canonicalPath());
    const SystemRoot device = SystemRoot::open("/usr/..").value();
    EXPECT_TRUE(device.isDeviceRoot());
    EXPECT_EQ(device.path("/private/var"), "/private/var");
    EXPECT_EQ(device.path("/"), "/");
    EXPECT_EQ(SystemRoot::open(test.path("absent")).error(), ENOENT);
    LinuxDisk disk(Syncs::off);
    ASSERT_EQ(::symlink(test.path().c_str(), test.path("link").c_str()), 0);
    SystemRoot again = SystemRoot::open(test.path("link")).value();
    EXPECT_EQ(again.canonicalPath(), root.canonicalPath());
    EXPECT_EQ(again.makeRuntimeDirectory(disk), 0);
    ::chmod(test.path("run/zorvane").c_str(), 0775);
    EXPECT_EQ(again.makeRuntimeDirectory(disk), EPERM);
    ASSERT_EQ(::rename(test.path("run/zorvane").c_str(), test.path("run/elsewhere").c_str()), 0);
    ASSERT_EQ(::symlink("elsewhere", test.path("run/zorvane").c_str()), 0);
    EXPECT_NE(again.makeRuntimeDirectory(disk), 0);
}

// One daemon on one root, and the lock goes with the process however it ends.
TEST(DaemonLock, HoldsOffASecondDaemon) {
    const TestRoot test;
    const pid_t child = ::fork();
    if (child == 0) {
        const auto held = DaemonLock::take(test.root());
        ::kill(::getpid(), held ? SIGSTOP : SIGTERM);
        ::_exit(0);
    }
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, WUNTRACED), child);
    EXPECT_TRUE(WIFSTOPPED(status));
    EXPECT_TRUE(DaemonLock::isHeld(test.root()));
    const auto second = DaemonLock::take(test.root());
    ASSERT_FALSE(second);
    EXPECT_EQ(second.error(), EWOULDBLOCK);
    ::kill(child, SIGKILL);
    ::waitpid(child, nullptr, 0);
    EXPECT_FALSE(DaemonLock::isHeld(test.root()));
    if (::geteuid() == 0) {
        // Another user's lock on an inode of that number is none of a daemon's. Here it is the file itself.
        const pid_t other = ::fork();
        if (other == 0) {
            const int file = ::open(test.path("run/zorvane/zorvaned.lock").c_str(), O_RDWR);
            const bool held = ::flock(file, LOCK_EX) == 0 && ::setuid(501) == 0;
            ::kill(::getpid(), held ? SIGSTOP : SIGTERM);
            ::_exit(0);
        }
        ASSERT_EQ(::waitpid(other, &status, WUNTRACED), other);
        EXPECT_TRUE(WIFSTOPPED(status));
        EXPECT_FALSE(DaemonLock::isHeld(test.root()));
        ::kill(other, SIGKILL);
        ::waitpid(other, nullptr, 0);
    }
    EXPECT_TRUE(DaemonLock::take(test.root()));
    EXPECT_EQ(test.read("run/zorvane/zorvaned.lock"), std::to_string(::getpid()) + "\n");
}

} // namespace
} // namespace zor::platform
