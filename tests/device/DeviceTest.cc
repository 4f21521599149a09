// SPDX-License-Identifier: Apache-2.0
#include "device/DataProtection.h"
#include "device/DeviceQueries.h"
#include "device/LinkSandboxUserState.h"
#include "os/RunLoop.h"
#include "os/SystemRoot.h"
#include "support/FewDescriptors.h"
#include "support/TestRoot.h"
#include "support/Waiting.h"

#include <atomic>
#include <cstring>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <sys/xattr.h>

namespace zor::platform {
namespace {

using support::eventually;
using support::TestRoot;

// The marker is per root, and only one of ours counts, not what others could plant. Each mark is judged without the
// other one.
TEST(BootMarker, BelievesOnlyItsOwn) {
    const TestRoot test;
    const TestRoot other;
    SemaphoreBootMarker marker(test.root());
    if (::access("/dev/shm", W_OK) != 0)
        GTEST_SKIP() << "there is no directory for semaphores";
    EXPECT_EQ(marker.name().size(), std::string(names::bootMarker).size() + 17);
    EXPECT_NE(marker.name(), SemaphoreBootMarker(other.root()).name());
    EXPECT_EQ(marker.name(), SemaphoreBootMarker(test.root()).name());
    const SystemRoot deviceRoot = SystemRoot::open("/").value();
    EXPECT_EQ(SemaphoreBootMarker(deviceRoot).name(), "zorvaned.fb_check");
    const std::string semaphore = "/dev/shm/sem." + marker.name();
    const std::string file = test.path(std::string(names::runtimeDirectory) + "/" + names::bootMarkerFile);
    EXPECT_FALSE(marker.look().present);
    const auto link = [](const std::string& mark) { (void)::link(mark.c_str(), (mark + ".link").c_str()); };
    const auto open = [](const std::string& mark) { ::chmod(mark.c_str(), 0666); };
    const auto symbolic = [&](const std::string& mark) {
        ::unlink(mark.c_str());
        (void)::symlink(test.path("run").c_str(), mark.c_str());
    };
    const auto given = [](const std::string& mark) { (void)::chown(mark.c_str(), 501, 501); };
    const std::function<void(const std::string&)> tricks[] = {link, open, symbolic, given};
    for (const auto& trick : std::span(tricks).first(::geteuid() == 0 ? 4 : 3))
        for (const auto& [mark, otherMark] : {std::pair(semaphore, file), std::pair(file, semaphore)}) {
            ASSERT_FALSE(marker.make()) << "a foreign one is replaced";
            ASSERT_EQ(::unlink(otherMark.c_str()), 0);
            EXPECT_TRUE(marker.look().present) << mark;
            EXPECT_FALSE(marker.look().foreign);
            trick(mark);
            EXPECT_FALSE(marker.look().present) << mark;
            EXPECT_EQ(marker.look().foreign, mark == semaphore);
            ::unlink((mark + ".link").c_str());
        }
    // Nobody makes a launch a boot by keeping the semaphore's name taken.
    marker.forget();
    ASSERT_EQ(::mkdir(semaphore.c_str(), 0755) | ::mkdir((semaphore + "/kept").c_str(), 0755), 0);
    EXPECT_FALSE(marker.make());
    EXPECT_TRUE(marker.look().present && marker.look().foreign);
    ::rmdir((semaphore + "/kept").c_str());
    EXPECT_FALSE(marker.make());
    EXPECT_FALSE(marker.look().foreign);
    // A file of another boot says nothing of this one.
    marker.forget();
    marker.forget();
    EXPECT_FALSE(marker.look().present);
    test.write(std::string(names::runtimeDirectory) + "/" + names::bootMarkerFile,
               "00000000-0000-4000-8000-000000000000\n", 0400);
    EXPECT_FALSE(marker.look().present);
    marker.forget();
}

const std::string lockStateFile = std::string(names::runtimeDirectory) + "/" + names::lockState;

TEST(DeviceLockState, ReadsANumberOrNothing) {
    const TestRoot test;
    const FileDeviceLockState state(test.root());
    const std::string file = test.path(lockStateFile);
    EXPECT_EQ(state.currentState(), 0);
    const std::pair<const char*, int> rows[] = {{"0", 0},    {"1\n", 1},    {"-3\n", -3},        {"", -1},   {"1 ", -1},
                                                {"one", -1}, {"1\n\n", -1}, {"99999999999", -1}, {"0x1", -1}};
    for (const auto& [text, number] : rows) {
        test.replace(lockStateFile, text);
        EXPECT_EQ(state.currentState(), number) << text;
    }
    ASSERT_EQ(::unlink(file.c_str()) | ::symlink("/etc/hostname", file.c_str()), 0);
    EXPECT_EQ(state.currentState(), -1);
    ASSERT_EQ(::unlink(file.c_str()) | ::mkfifo(file.c_str(), 0644), 0);
    EXPECT_EQ(state.currentState(), -1);
}

// Goal: what is kept does not outlive a change of any kind. Method: files left alone for a while change, without
// notices and with some that nobody takes; then each change is asked for at once while the loop takes its notice away.
TEST(DeviceLockState, ForgetsWhatItKeptOfAFileThatChanges) {
    struct Case {
        TestRoot test{};
        RunLoop loop{};
        FileDeviceLockState state{test.root()};
    };
    Case cases[6];
    for (Case& one : std::span(cases).subspan(3))
        ASSERT_FALSE(one.state.registerForChanges(one.loop, [] {}));
    for (const Case& one : cases)
        one.test.replace(lockStateFile, "3");
    const std::time_t made = std::time(nullptr);
    ASSERT_TRUE(eventually([&] { return std::time(nullptr) > made + 1; }));
    for (const Case& one : cases)
        EXPECT_EQ(one.state.currentState(), 3);
    for (std::size_t first : {0, 3}) {
        const Case& replaced = cases[first];
        const Case& rewritten = cases[first + 1];
        const Case& removed = cases[first + 2];
        replaced.test.replace(lockStateFile, "1");
        EXPECT_EQ(replaced.state.currentState(), 1);
        const FileDescriptor open(::open(rewritten.test.path(lockStateFile).c_str(), O_WRONLY | O_CLOEXEC));
        ASSERT_EQ(::pwrite(open.get(), "2", 1, 0), 1);
        EXPECT_EQ(rewritten.state.currentState(), 2);
        ::unlink(removed.test.path(lockStateFile).c_str());
        EXPECT_EQ(removed.state.currentState(), 0);
        removed.test.replace(lockStateFile, "4");
        EXPECT_EQ(removed.state.currentState(), 4);
    }
    Case& told = cases[3];
    std::thread runner([&] { told.loop.run(); });
    int stale = 0;
    for (int change = 0; change < 3000; ++change) {
        told.test.replace(lockStateFile, std::to_string(change));
        for (int look = 0; look < 3; ++look)
            stale += told.state.currentState() == change ? 0 : 1;
    }
    EXPECT_EQ(stale, 0);
    told.loop.stop();
    runner.join();
}

/// "" when there is no link.
std::string linkTarget(const std::string& path) {
    std::error_code ignored;
    return std::filesystem::read_symlink(path, ignored);
}

TEST(SandboxUserState, MapsReplacesAndRemoves) {
    constexpr auto data = SandboxItemType::dataContainer;
    TestRoot test;
    LinkSandboxUserState sandbox(test.root(), test.disk());
    const std::string name = test.path("run/zorvane/sandbox/501/1/a%2Fb");
    EXPECT_FALSE(sandbox.setMapping(501, data, "a/b", std::nullopt));
    EXPECT_NE(::access(test.path("run/zorvane/sandbox").c_str(), F_OK), 0) << "a removal makes nothing";
    EXPECT_FALSE(sandbox.setMapping(501, data, "a/b", "/first"));
    // A kill between the two steps leaves this link under a name that is used again.
    ASSERT_EQ(::symlink("x", test.path("run/zorvane/sandbox/501/1/.new-1").c_str()), 0);
    EXPECT_FALSE(sandbox.setMapping(501, data, "a/b", "/second"));
    EXPECT_FALSE(sandbox.setMapping(501, SandboxItemType::groupContainer, "a/b", "/group"));
    EXPECT_EQ(linkTarget(name), "/second");
    EXPECT_EQ(linkTarget(test.path("run/zorvane/sandbox/501/2/a%2Fb")), "/group");
    EXPECT_FALSE(sandbox.setMapping(501, data, "a/b", std::nullopt));
    EXPECT_FALSE(sandbox.setMapping(501, data, "a/b", std::nullopt));
    EXPECT_EQ(linkTarget(name), "");
    EXPECT_EQ(sandbox.setMapping(501, data, "", "/x").number(), EINVAL);
    const std::string longest(255, 'i');
    EXPECT_FALSE(sandbox.setMapping(501, data, longest, "/x"));
    EXPECT_EQ(sandbox.setMapping(501, data, longest + "i", "/x").number(), ENAMETOOLONG);
    EXPECT_EQ(sandbox.setMapping(501, data, std::string(86, '/'), std::nullopt).number(), ENAMETOOLONG);
    EXPECT_EQ(linkTarget(test.path("run/zorvane/sandbox/501/1/.new-1")), "");
}

// A launch removes exactly the mappings whose container is gone.
TEST(SandboxUserState, RemovesDanglingMappings) {
    TestRoot test;
    LinkSandboxUserState sandbox(test.root(), test.disk());
    bool mayConclude = false;
    const auto isGone = [](const std::string& path) { return ::access(path.c_str(), F_OK) != 0; };
    const auto remove = [&] {
        return sandbox.removeDanglingMappings([&](std::uint32_t) { return mayConclude; }, isGone);
    };
    EXPECT_EQ(remove(), 0U);
    test.makeDirectories("private/var/mobile/live");
    const auto map = [&](const char* identifier, const std::string& target) {
        ASSERT_FALSE(sandbox.setMapping(501, SandboxItemType::dataContainer, identifier, target));
    };
    map("live", test.path("private/var/mobile/live"));
    map("gone", test.path("private/var/mobile/gone"));
    map("not.ours", "/usr");
    // A directory that is there, whose path only begins as the root's does.
    const std::string beside = test.path() + "-beside";
    ASSERT_EQ(::mkdir(beside.c_str(), 0755), 0);
    map("beside", beside);
    const std::string directory = test.path("run/zorvane/sandbox/501/1/");
    ASSERT_EQ(::symlink("half", (directory + ".new-7").c_str()), 0);
    EXPECT_EQ(remove(), 0U);
    EXPECT_NE(linkTarget(directory + "gone"), "");
    mayConclude = true;
    EXPECT_EQ(remove(), 3U);
    ::rmdir(beside.c_str());
    EXPECT_NE(linkTarget(directory + "live"), "");
    for (const char* name : {"gone", "not.ours", "beside", ".new-7"})
        EXPECT_EQ(linkTarget(directory + name), "") << name;
}

// A lock refuses exactly the classes whose keys are away, for every pair of classes; damaged attributes are no class.
TEST(FileProtectionClass, RefusesWhatALockTakesAway) {
    TestRoot test;
    const FileDeviceLockState lock(test.root());
    const auto setState = [&](int state) { test.replace(lockStateFile, std::to_string(state)); };
    XattrProtectionClass protection(test.disk(), lock);
    test.write("file", "x");
    const FileDescriptor file(::open(test.path("file").c_str(), O_RDONLY | O_CLOEXEC));
    EXPECT_EQ(protection.classOf(file.get()), 3);
    if (protection.setClass(file.get(), 3) == EOPNOTSUPP) {
        EXPECT_FALSE(protection.supported());
        GTEST_SKIP() << "this file system has no extended attributes";
    }
    EXPECT_TRUE(protection.supported());
    constexpr int classes[] = {0, 1, 2, 3, 4, 5, 258}; // the last is no 2
    for (const int state : {0, 1, 2, -1}) {
        for (const int from : classes) {
            for (const int to : classes) {
                setState(0);
                ASSERT_EQ(protection.setClass(file.get(), from).number(), 0);
                setState(state);
                const bool refused = state == 1 && (from == 1 || from == 2 || to == 1 || to == 2);
                EXPECT_EQ(protection.setClass(file.get(), to).number(), refused ? EPERM : 0) << state << from << to;
                EXPECT_EQ(protection.classOf(file.get()), refused ? from : to);
            }
        }
    }
    setState(0);
    EXPECT_EQ(protection.setClass(file.get(), -1).number(), EINVAL);
    for (const char* text : {"", "x", "1x", "-1", "4294967298", "00000000000000000001"}) {
        ASSERT_EQ(::fsetxattr(file.get(), protection.attributeName(), text, std::strlen(text), 0), 0);
        EXPECT_EQ(protection.classOf(file.get()), 3) << text;
    }
    EXPECT_EQ(protection.setClass(-1, 1).number(), EBADF);
    // A file that an encryption keeps from being read can be opened for its path alone.
    const FileDescriptor path(::open(test.path("file").c_str(), O_PATH | O_CLOEXEC));
    EXPECT_EQ(protection.setClass(path.get(), 4).number(), 0);
    EXPECT_EQ(protection.classOf(path.get()), 4);
    EXPECT_EQ(protection.classOf(file.get()), 4);
}

// Goal: every change reaches the loop, rename, removal, writing in place, and an unlock that is told while its file
// cannot be opened is not missed. Method: the file changes, at last without a descriptor left, and never again.
TEST(WantOfDescriptors, AnUnlockIsSeenAfterwards) {
    const TestRoot test;
    RunLoop loop;
    FileDeviceLockState state(test.root());
    std::atomic<int> seen{-2};
    ASSERT_FALSE(state.registerForChanges(loop, [&] { seen = state.currentState(); }));
    std::thread runner([&] { loop.run(); });
    const auto sees = [&](int expected) { return eventually([&] { return seen == expected; }); };
    test.replace(lockStateFile, "1");
    EXPECT_TRUE(sees(1));
    ::unlink(test.path(lockStateFile).c_str());
    EXPECT_TRUE(sees(0));
    test.write(lockStateFile, "1");
    EXPECT_TRUE(sees(1));
    test.write(lockStateFile + ".next", "0");
    {
        const support::FewDescriptors none(0);
        EXPECT_EQ(::rename(test.path(lockStateFile + ".next").c_str(), test.path(lockStateFile).c_str()), 0);
        EXPECT_TRUE(sees(FileDeviceLockState::unknown));
    }
    EXPECT_TRUE(sees(DeviceLockState::unlocked));
    loop.stop();
    runner.join();
}

// Goal: locks and unlocks are seen while the system gives no change notices, and notices are used as soon as it does.
// Method: a user namespace that allows none, in a process of its own.
TEST(WantOfNotices, AnUnlockIsSeenAllTheSame) {
    enum { good, notTold, notSeen, stillPolls, cannot };
    const TestRoot test;
    const pid_t child = ::fork();
    if (child == 0) {
        const auto allowNotices = [](const char* count) {
            const FileDescriptor limit(::open("/proc/sys/user/max_inotify_instances", O_WRONLY | O_CLOEXEC));
            return ::write(limit.get(), count, std::strlen(count)) > 0;
        };
        if (::unshare(CLONE_NEWUSER) != 0 || !allowNotices("0"))
            ::_exit(cannot);
        RunLoop loop;
        FileDeviceLockState state(test.root());
        std::atomic<int> seen{FileDeviceLockState::unknown};
        std::atomic<int> looks{0};
        if (state.registerForChanges(loop, [&] {
                seen = state.currentState();
                ++looks;
            }) != EMFILE)
            ::_exit(notTold);
        std::thread runner([&] { loop.run(); });
        const auto sees = [&](int next) {
            test.replace(lockStateFile, std::to_string(next));
            return eventually([&] { return seen == next; });
        };
        bool seenAll = sees(1) && sees(0) && allowNotices("8");
        ::usleep(400'000);
        const int before = looks;
        ::usleep(600'000);
        const bool polls = looks != before;
        seenAll = seenAll && sees(1);
        ::_exit(!seenAll ? notSeen : polls ? stillPolls : good);
    }
    int status = 0;
    ::waitpid(child, &status, 0);
    if (WEXITSTATUS(status) == cannot)
        GTEST_SKIP() << "needs a user namespace";
    EXPECT_EQ(WEXITSTATUS(status), good);
}

} // namespace
} // namespace zor::platform
