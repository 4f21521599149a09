// SPDX-License-Identifier: Apache-2.0
#include "base/Format.h"
#include "device/DeviceQueries.h"
#include "device/FileCrashAnnotation.h"
#include "device/FileDeviceLockState.h"
#include "device/LinkSandboxUserState.h"
#include "device/SemaphoreBootMarker.h"
#include "device/XattrProtectionClass.h"
#include "identity/LinuxPasswordDatabase.h"
#include "os/DaemonLock.h"
#include "os/EpollRunLoop.h"
#include "os/Names.h"
#include "os/Openat2.h"
#include "platform/TestRoot.h"

#include <atomic>
#include <csignal>
#include <cstring>
#include <filesystem>
#include <functional>
#include <span>
#include <sys/file.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

namespace zor::platform {
namespace {

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
    ASSERT_EQ(::symlink(test.path("").c_str(), test.path("link").c_str()), 0);
    SystemRoot again = SystemRoot::open(test.path("link")).value();
    EXPECT_EQ(again.canonicalPath(), root.canonicalPath());
    EXPECT_EQ(again.makeRuntimeDirectory(disk), 0);
    ::chmod(test.path("run/zorvane").c_str(), 0775);
    EXPECT_EQ(again.makeRuntimeDirectory(disk), EPERM);
    ASSERT_EQ(::rename(test.path("run/zorvane").c_str(), test.path("run/elsewhere").c_str()), 0);
    ASSERT_EQ(::symlink("elsewhere", test.path("run/zorvane").c_str()), 0);
    EXPECT_NE(again.makeRuntimeDirectory(disk), 0);
}

// Mode and owner can be changed through a descriptor that cannot be read or written, and a link is not followed.
TEST(LinuxDisk, ActsOnPathDescriptors) {
    TestRoot test;
    test.write("file", "x", 0600);
    const auto mode = [&] { return std::filesystem::status(test.path("file")).permissions(); };
    const auto file = openBeneath(test.root().descriptor(), "file", O_PATH).value();
    EXPECT_EQ(test.disk().changeMode(file.get(), 0640), 0);
    EXPECT_EQ(test.disk().changeOwner(file.get(), ::geteuid(), ::getegid()), 0);
    EXPECT_EQ(mode(), std::filesystem::perms(0640));
    ASSERT_EQ(::symlink("file", test.path("link").c_str()), 0);
    const FileDescriptor link(::open(test.path("link").c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
    EXPECT_NE(test.disk().changeMode(link.get(), 0777), 0);
    EXPECT_EQ(mode(), std::filesystem::perms(0640));
    EXPECT_EQ(test.disk().changeMode(-1, 0600), -EBADF);
}

TEST(SystemVersion, ReadsReleaseFiles) {
    const std::pair<const char*, const char*> cases[] = {
        {"BUILD_ID=21A42\nVERSION_ID=3\n", "21A42"},
        {"BUILD_ID=\"\"\nVERSION_ID='12 \"b\"'\n", "12 \"b\""},
        {"BUILD_ID=\"a\\\"b\\$c\\\\d\\n\"", "a\"b$c\\d\\n"},
        {"# BUILD_ID=comment\nXBUILD_ID=1\nBUILD_IDX=2\nVERSION_ID=7", "7"},
        {"BUILD_ID=\"open\n", "\"open"},
        {"", ""},
    };
    const TestRoot test;
    const std::string file = test.path(names::operatingSystemRelease);
    const auto version = [&] { return LinuxSystemVersionQuery(test.root()).buildVersion(); };
    for (const auto& [text, expected] : cases) {
        test.write(names::operatingSystemRelease, text);
        EXPECT_EQ(version(), expected) << text;
    }
    // A link in a tree that only root writes to counts, and ends below the root; a FIFO holds nobody up.
    test.write("usr/lib/os-release", "BUILD_ID=linked\n");
    ::unlink(file.c_str());
    ASSERT_EQ(::symlink("/usr/lib/os-release", file.c_str()), 0);
    EXPECT_EQ(version(), "linked");
    ::unlink(file.c_str());
    ASSERT_EQ(::mkfifo(file.c_str(), 0644), 0);
    EXPECT_EQ(version(), "");
    EXPECT_FALSE(LinuxInternalBuildQuery(test.root()).isInternalBuild());
    test.write(names::internalBuildMark, "");
    EXPECT_TRUE(LinuxInternalBuildQuery(test.root()).isInternalBuild());
}

TEST(PasswordDatabase, ReadsTheRootsOwnFile) {
    const TestRoot test;
    const LinuxPasswordDatabase database(test.root());
    EXPECT_FALSE(database.entryForUserId(0)) << "the system's own database must not be asked";
    test.write(names::passwordFile, "root:x:0:0:root:/private/var/root:/bin/sh\n"
                                    "# a comment\nbroken line\nmobile:x:501:501::/private/var/mobile:/bin/sh\n"
                                    "homeless:x:502:502:::/bin/sh\nrelative:x:503:503::home:/bin/sh\n"
                                    "other:x:501:501::/elsewhere:/bin/sh\n");
    ASSERT_TRUE(database.entryForUserId(501));
    EXPECT_EQ(database.entryForUserId(501)->name, "mobile");
    EXPECT_EQ(database.entryForUserId(501)->homeDirectory, test.path("private/var/mobile"));
    EXPECT_EQ(database.entryForName("other")->homeDirectory, test.path("elsewhere"));
    for (const char* name : {"homeless", "relative", "absent", ""})
        EXPECT_FALSE(database.entryForName(name)) << name;
    // On the device itself the whole database of the system counts.
    EXPECT_TRUE(LinuxPasswordDatabase(SystemRoot::open("/").value()).entryForUserId(0));
}

TEST(CrashAnnotation, KeepsTheLastMessageWhole) {
    TestRoot test;
    test.makeDirectories(names::logDirectory);
    const std::string file = std::string(names::logDirectory) + "/" + names::crashFile;
    FileCrashAnnotation crash(test.root(), test.disk());
    crash.record("first");
    EXPECT_EQ(test.read(file), "first");
    // What a kill in the middle of an earlier record left is in nobody's way.
    test.write(std::string(names::logDirectory) + "/." + names::crashFile, "half");
    crash.record("second, longer");
    EXPECT_EQ(test.read(file), "second, longer");
}

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
            ASSERT_EQ(marker.make(), 0) << "a foreign one is replaced";
            ASSERT_EQ(::unlink(otherMark.c_str()), 0);
            EXPECT_TRUE(marker.look().present) << mark;
            EXPECT_FALSE(marker.look().foreign);
            trick(mark);
            EXPECT_FALSE(marker.look().present) << mark;
            EXPECT_EQ(marker.look().foreign, mark == semaphore);
            ::unlink((mark + ".link").c_str());
        }
    // Who keeps the semaphore's name taken makes no launch a boot.
    marker.forget();
    ASSERT_EQ(::mkdir(semaphore.c_str(), 0755) | ::mkdir((semaphore + "/kept").c_str(), 0755), 0);
    EXPECT_EQ(marker.make(), 0);
    EXPECT_TRUE(marker.look().present && marker.look().foreign);
    ::rmdir((semaphore + "/kept").c_str());
    EXPECT_EQ(marker.make(), 0);
    EXPECT_FALSE(marker.look().foreign);
    // A file of another boot says nothing of this one.
    marker.forget();
    marker.forget();
    EXPECT_FALSE(marker.look().present);
    test.write(std::string(names::runtimeDirectory) + "/" + names::bootMarkerFile,
               "00000000-0000-4000-8000-000000000000\n");
    ::chmod(file.c_str(), 0400);
    EXPECT_FALSE(marker.look().present);
    marker.forget();
}

const std::string lockStateFile = std::string(names::runtimeDirectory) + "/" + names::lockState;

TEST(DeviceLockState, ReadsANumberOrNothing) {
    const TestRoot test;
    const FileDeviceLockState state(test.root());
    EXPECT_EQ(state.currentState(), 0);
    for (const char* number : {"0", "1\n", "2", "-3\n"}) {
        test.replace(lockStateFile, number);
        EXPECT_EQ(state.currentState(), std::atoi(number));
    }
    for (const char* wrong : {"", "1 ", "one", "1\n\n", "99999999999", "0x1"}) {
        test.replace(lockStateFile, wrong);
        EXPECT_EQ(state.currentState(), -1) << wrong;
    }
    ::unlink(test.path(lockStateFile).c_str());
    ASSERT_EQ(::symlink("/etc/hostname", test.path(lockStateFile).c_str()), 0);
    EXPECT_EQ(state.currentState(), -1);
    ::unlink(test.path(lockStateFile).c_str());
    ASSERT_EQ(::mkfifo(test.path(lockStateFile).c_str(), 0644), 0);
    EXPECT_EQ(state.currentState(), -1);
}

// What is kept of a file that was left alone for a while does not outlive a change of any kind.
TEST(DeviceLockState, ForgetsWhatItKeptOfAFileThatChanges) {
    struct Case {
        TestRoot test{};
        FileDeviceLockState state{test.root()};
    };
    Case cases[3];
    auto& [replaced, rewritten, removed] = cases;
    for (const Case& one : cases)
        one.test.replace(lockStateFile, "3");
    const std::time_t made = std::time(nullptr);
    ASSERT_TRUE(eventually([&] { return std::time(nullptr) > made + 1; }));
    for (const Case& one : cases)
        EXPECT_EQ(one.state.currentState(), 3);
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

// Every change reaches the loop: rename, removal, writing in place; those of other files do not.
TEST(DeviceLockState, TellsChanges) {
    const TestRoot test;
    EpollRunLoop loop;
    FileDeviceLockState state(test.root());
    std::atomic<int> calls{0};
    std::atomic<int> seen{-2};
    const auto changed = [&] {
        seen = state.currentState();
        ++calls;
    };
    ASSERT_EQ(state.registerForChanges(loop, changed), 0);
    std::thread runner([&] { loop.run(); });
    const auto sees = [&](int expected) { return eventually([&] { return seen == expected; }); };
    test.replace(lockStateFile, "1");
    EXPECT_TRUE(sees(1));
    ::unlink(test.path(lockStateFile).c_str());
    EXPECT_TRUE(sees(0));
    test.write(lockStateFile, "4");
    EXPECT_TRUE(sees(4));
    test.replace(lockStateFile, "0");
    EXPECT_TRUE(sees(0));
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
    const int before = calls;
    test.write(std::string(names::runtimeDirectory) + "/other", "x");
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
    EXPECT_EQ(calls, before);
    loop.stop();
    runner.join();
}

// Any string is one visible path component, and no two are the same.
TEST(PercentEncoding, IsOneComponentAndReversible) {
    const std::pair<std::string, const char*> cases[] = {
        {"com.veltra.App-1_b", "com.veltra.App-1_b"},
        {"..", "%2E."},
        {"a/b", "a%2Fb"},
        {"%2E", "%252E"},
        {"\xc3\xa9", "%C3%A9"},
        {"a b\n", "a%20b%0A"},
        {std::string("\0", 1), "%00"},
    };
    for (const auto& [text, encoded] : cases) {
        EXPECT_EQ(percentEncode(text), encoded);
        EXPECT_EQ(percentDecode(encoded), text);
    }
    for (const char* wrong : {"%", "%2", "%2e", "%GG", ".x", "a/b", "%41", "a b"})
        EXPECT_EQ(percentDecode(wrong), std::nullopt) << wrong;
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
    EXPECT_EQ(sandbox.setMapping(501, data, "a/b", std::nullopt), 0);
    EXPECT_NE(::access(test.path("run/zorvane/sandbox").c_str(), F_OK), 0) << "a removal makes nothing";
    EXPECT_EQ(sandbox.setMapping(501, data, "a/b", "/first"), 0);
    // What a kill between the two steps leaves under a name that is used again.
    ASSERT_EQ(::symlink("x", test.path("run/zorvane/sandbox/501/1/.new-1").c_str()), 0);
    EXPECT_EQ(sandbox.setMapping(501, data, "a/b", "/second"), 0);
    EXPECT_EQ(sandbox.setMapping(501, SandboxItemType::groupContainer, "a/b", "/group"), 0);
    EXPECT_EQ(linkTarget(name), "/second");
    EXPECT_EQ(linkTarget(test.path("run/zorvane/sandbox/501/2/a%2Fb")), "/group");
    EXPECT_EQ(sandbox.setMapping(501, data, "a/b", std::nullopt), 0);
    EXPECT_EQ(sandbox.setMapping(501, data, "a/b", std::nullopt), 0);
    EXPECT_EQ(linkTarget(name), "");
    EXPECT_EQ(sandbox.setMapping(501, data, "", "/x"), EINVAL);
    const std::string longest(255, 'i');
    EXPECT_EQ(sandbox.setMapping(501, data, longest, "/x"), 0);
    EXPECT_EQ(sandbox.setMapping(501, data, longest + "i", "/x"), ENAMETOOLONG);
    EXPECT_EQ(sandbox.setMapping(501, data, std::string(86, '/'), std::nullopt), ENAMETOOLONG);
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
        ASSERT_EQ(sandbox.setMapping(501, SandboxItemType::dataContainer, identifier, target), 0);
    };
    map("live", test.path("private/var/mobile/live"));
    map("gone", test.path("private/var/mobile/gone"));
    map("not.ours", "/usr");
    map("beside", test.path("").substr(0, test.path("").size() - 1) + "private/var/mobile/live");
    const std::string directory = test.path("run/zorvane/sandbox/501/1/");
    ASSERT_EQ(::symlink("half", (directory + ".new-7").c_str()), 0);
    EXPECT_EQ(remove(), 0U);
    EXPECT_NE(linkTarget(directory + "gone"), "");
    mayConclude = true;
    EXPECT_EQ(remove(), 3U);
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
    for (const int state : {0, 1, 2, -1}) {
        for (int from = 0; from <= 5; ++from) {
            for (int to = 0; to <= 5; ++to) {
                setState(0);
                ASSERT_EQ(protection.setClass(file.get(), from), 0);
                setState(state);
                const bool refused = state == 1 && (from == 1 || from == 2 || to == 1 || to == 2);
                EXPECT_EQ(protection.setClass(file.get(), to), refused ? EPERM : 0) << state << from << to;
                EXPECT_EQ(protection.classOf(file.get()), refused ? from : to);
            }
        }
    }
    setState(0);
    EXPECT_EQ(protection.setClass(file.get(), -1), EINVAL);
    for (const char* text : {"", "x", "1x", "-1", "99999999999", "00000000000000000001"}) {
        ASSERT_EQ(::fsetxattr(file.get(), protection.attributeName(), text, std::strlen(text), 0), 0);
        EXPECT_EQ(protection.classOf(file.get()), 3) << text;
    }
    EXPECT_EQ(protection.setClass(-1, 1), EBADF);
    // What an encryption keeps from being read can be opened for its path alone.
    const FileDescriptor path(::open(test.path("file").c_str(), O_PATH | O_CLOEXEC));
    EXPECT_EQ(protection.setClass(path.get(), 4), 0);
    EXPECT_EQ(protection.classOf(path.get()), 4);
    EXPECT_EQ(protection.classOf(file.get()), 4);
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
