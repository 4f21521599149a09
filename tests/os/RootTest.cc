// SPDX-License-Identifier: Apache-2.0
// A root, the disk below it, and the one daemon on it.
#include "os/SystemRoot.h"
#include "support/TestRoot.h"

#include <csignal>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/file.h>
#include <sys/wait.h>

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
    EXPECT_EQ(SystemRoot::open(test.path("absent")).error().number(), ENOENT);
    LinuxDisk disk(Syncs::off);
    ASSERT_EQ(::symlink(test.path().c_str(), test.path("link").c_str()), 0);
    SystemRoot again = SystemRoot::open(test.path("link")).value();
    EXPECT_EQ(again.canonicalPath(), root.canonicalPath());
    EXPECT_FALSE(again.makeRuntimeDirectory(disk));
    ::chmod(test.path("run/zorvane").c_str(), 0775);
    EXPECT_EQ(again.makeRuntimeDirectory(disk).number(), EPERM);
    ASSERT_EQ(::rename(test.path("run/zorvane").c_str(), test.path("run/elsewhere").c_str()), 0);
    ASSERT_EQ(::symlink("elsewhere", test.path("run/zorvane").c_str()), 0);
    EXPECT_TRUE(again.makeRuntimeDirectory(disk));
}

// One daemon on one root, and the lock goes with the process however it ends. Another user's lock on an inode of that
// number is none of a daemon's; here it is the file itself.
TEST(DaemonLock, HoldsOffASecondDaemon) {
    const TestRoot test;
    for (const bool isAnothers : {false, true}) {
        if (isAnothers && ::geteuid() != 0)
            continue;
        const pid_t child = ::fork();
        if (child == 0) {
            std::optional<ErrnoOr<DaemonLock>> lock;
            bool held = false;
            if (isAnothers)
                held = ::flock(::open(test.path("run/zorvane/zorvaned.lock").c_str(), O_RDWR), LOCK_EX) == 0 &&
                       ::setuid(501) == 0;
            else
                held = lock.emplace(DaemonLock::take(test.root())).has_value();
            ::kill(::getpid(), held ? SIGSTOP : SIGTERM);
            ::_exit(0);
        }
        int status = 0;
        ASSERT_EQ(::waitpid(child, &status, WUNTRACED), child);
        EXPECT_TRUE(WIFSTOPPED(status));
        EXPECT_EQ(DaemonLock::isHeld(test.root()), !isAnothers);
        EXPECT_TRUE(isAnothers || DaemonLock::take(test.root()).error() == EWOULDBLOCK);
        ::kill(child, SIGKILL);
        ::waitpid(child, nullptr, 0);
        EXPECT_FALSE(DaemonLock::isHeld(test.root()));
    }
    EXPECT_TRUE(DaemonLock::take(test.root()));
    EXPECT_EQ(test.read("run/zorvane/zorvaned.lock"), std::to_string(::getpid()) + "\n");
}

} // namespace
} // namespace zor::platform
