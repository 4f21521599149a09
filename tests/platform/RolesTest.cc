// SPDX-License-Identifier: Apache-2.0
#include "platform/PercentEncoding.h"
#include "platform/TestRoot.h"
#include "platform/linux/DaemonLock.h"
#include "platform/linux/DeviceQueries.h"
#include "platform/linux/EpollRunLoop.h"
#include "platform/linux/FileCrashAnnotation.h"
#include "platform/linux/FileDeviceLockState.h"
#include "platform/linux/LinkSandboxUserState.h"
#include "platform/linux/LinuxPasswordDatabase.h"
#include "platform/linux/Names.h"
#include "platform/linux/Openat2.h"
#include "platform/linux/SemaphoreBootMarker.h"
#include "platform/linux/XattrProtectionClass.h"

#include <array>
#include <atomic>
#include <cstring>
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

// Goal: mode and owner can be changed through a descriptor that cannot be read or written, and a link is not followed.
TEST(LinuxDisk, ActsOnPathDescriptors) {
    TestRoot test;
    test.write("file", "x", 0600);
    const auto file = openBeneath(test.root().descriptor(), "file", O_PATH).value();
    EXPECT_EQ(test.disk().changeMode(file.get(), 0640), 0);
    EXPECT_EQ(test.disk().changeOwner(file.get(), ::geteuid(), ::getegid()), 0);
    struct stat status{};
    ASSERT_EQ(::stat(test.path("file").c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & ALLPERMS, 0640U);
    ASSERT_EQ(::symlink("file", test.path("link").c_str()), 0);
    const FileDescriptor link(::open(test.path("link").c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
    EXPECT_NE(test.disk().changeMode(link.get(), 0777), 0);
    ASSERT_EQ(::stat(test.path("file").c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & ALLPERMS, 0640U);
    EXPECT_EQ(test.disk().changeMode(-1, 0600), -EBADF);
}

TEST(SystemVersion, ReadsReleaseFiles) {
    const std::vector<std::array<std::string, 2>> cases = {
        {"BUILD_ID=21A42\nVERSION_ID=3\n", "21A42"},
        {"NAME=\"X\"\nVERSION_ID=\"12\"\n", "12"},
        {"BUILD_ID=\"\"\nVERSION_ID='12 \"b\"'\n", "12 \"b\""},
        {"BUILD_ID=\"a\\\"b\\$c\\\\d\\n\"", "a\"b$c\\d\\n"},
        {"# BUILD_ID=comment\nXBUILD_ID=1\nBUILD_IDX=2\nVERSION_ID=7", "7"},
        {"BUILD_ID=first\r\nBUILD_ID=second\r\n", "second"},
        {"BUILD_ID=\"open\n", "\"open"},
        {"", ""},
    };
    for (const auto& [text, expected] : cases) {
        const TestRoot test;
        test.write(names::operatingSystemRelease, text);
        EXPECT_EQ(LinuxSystemVersionQuery(test.root()).buildVersion(), expected) << text;
    }
    // A link in a tree that only root writes to counts, and ends below the root; a FIFO holds nobody up.
    const TestRoot test;
    test.write("usr/lib/os-release", "BUILD_ID=linked\n");
    test.makeDirectories("etc");
    ASSERT_EQ(::symlink("/usr/lib/os-release", test.path(names::operatingSystemRelease).c_str()), 0);
    EXPECT_EQ(LinuxSystemVersionQuery(test.root()).buildVersion(), "linked");
    ::unlink(test.path(names::operatingSystemRelease).c_str());
    ASSERT_EQ(::mkfifo(test.path(names::operatingSystemRelease).c_str(), 0644), 0);
    EXPECT_EQ(LinuxSystemVersionQuery(test.root()).buildVersion(), "");
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
    const SystemRoot device = SystemRoot::open("/").value();
    ASSERT_TRUE(LinuxPasswordDatabase(device).entryForUserId(0));
    EXPECT_EQ(LinuxPasswordDatabase(device).entryForName("root")->uid, 0U);
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
    const std::string report = "** INTERNAL ERROR: Uncaught Exception **\nException: x\nStack:\n";
    crash.record(report);
    EXPECT_EQ(test.read(file), report);
}

// Goal: the marker is per root, made once, and only one of ours counts. Method: plant what others could plant.
TEST(BootMarker, BelievesOnlyItsOwn) {
    const TestRoot test;
    const TestRoot other;
    SemaphoreBootMarker marker(test.root());
    if (::access("/dev/shm", W_OK) != 0)
        GTEST_SKIP() << "there is no directory for semaphores";
    EXPECT_EQ(marker.name().size(), std::string(names::bootMarker).size() + 17);
    EXPECT_NE(marker.name(), SemaphoreBootMarker(other.root()).name());
    EXPECT_EQ(marker.name(), SemaphoreBootMarker(test.root()).name());
    EXPECT_EQ(SemaphoreBootMarker(SystemRoot::open("/").value()).name(), "zorvaned.fb_check");
    const std::string file = "/dev/shm/sem." + marker.name();
    EXPECT_FALSE(marker.look().present);
    ASSERT_EQ(marker.make(), 0);
    EXPECT_TRUE(marker.look().present);
    EXPECT_EQ(marker.make(), EEXIST);
    // A second name of it, or a mode that lets others in, is not what the daemon made.
    ASSERT_EQ(::link(file.c_str(), (file + ".link").c_str()), 0);
    EXPECT_TRUE(marker.look().foreign);
    ::unlink((file + ".link").c_str());
    EXPECT_TRUE(marker.look().present);
    ::chmod(file.c_str(), 0666);
    EXPECT_FALSE(marker.look().present);
    EXPECT_EQ(marker.make(), 0) << "a foreign one is replaced";
    marker.forget();
    marker.forget();
    ASSERT_EQ(::symlink(test.path("run").c_str(), file.c_str()), 0);
    EXPECT_TRUE(marker.look().foreign);
    EXPECT_EQ(marker.make(), 0);
    EXPECT_TRUE(marker.look().present);
    if (::geteuid() == 0) {
        ASSERT_EQ(::chown(file.c_str(), 501, 501), 0);
        EXPECT_TRUE(marker.look().foreign);
        EXPECT_EQ(marker.make(), 0);
        EXPECT_TRUE(marker.look().present);
    }
    marker.forget();
    EXPECT_FALSE(marker.look().present);
}

TEST(DeviceLockState, ReadsANumberOrNothing) {
    const TestRoot test;
    const FileDeviceLockState state(test.root());
    const std::string file = std::string(names::runtimeDirectory) + "/" + names::lockState;
    EXPECT_EQ(state.currentState(), 0);
    const std::vector<std::pair<std::string, int>> cases = {{"0", 0},
                                                            {"1\n", 1},
                                                            {"2", 2},
                                                            {"-3\n", -3},
                                                            {"", -1},
                                                            {"1 ", -1},
                                                            {"one", -1},
                                                            {"1\n\n", -1},
                                                            {"99999999999", -1},
                                                            {"0x1", -1},
                                                            {std::string(40, '1'), -1}};
    for (const auto& [text, expected] : cases) {
        test.replace(file, text);
        EXPECT_EQ(state.currentState(), expected) << text;
    }
    ::unlink(test.path(file).c_str());
    ASSERT_EQ(::symlink("/etc/hostname", test.path(file).c_str()), 0);
    EXPECT_EQ(state.currentState(), -1);
    ::unlink(test.path(file).c_str());
    ASSERT_EQ(::mkfifo(test.path(file).c_str(), 0644), 0);
    EXPECT_EQ(state.currentState(), -1);
}

// Goal: what is kept of a file that was left alone for a while does not outlive a change of any kind. Method: a state
// of each kind waits until it may be kept, is read, and is changed in one of the ways.
TEST(DeviceLockState, ForgetsWhatItKeptOfAFileThatChanges) {
    const std::string name = std::string(names::runtimeDirectory) + "/" + names::lockState;
    struct Case {
        TestRoot test{};
        FileDeviceLockState state{test.root()};
    };
    Case replaced;
    Case rewritten;
    Case removed;
    const std::vector<Case*> cases = {&replaced, &rewritten, &removed};
    for (Case* one : cases)
        one->test.replace(name, "3");
    ::usleep(2'100'000);
    for (Case* one : cases)
        EXPECT_EQ(one->state.currentState(), 3);
    replaced.test.replace(name, "1");
    EXPECT_EQ(replaced.state.currentState(), 1);
    const FileDescriptor open(::open(rewritten.test.path(name).c_str(), O_WRONLY | O_CLOEXEC));
    ASSERT_EQ(::pwrite(open.get(), "2", 1, 0), 1);
    EXPECT_EQ(rewritten.state.currentState(), 2);
    ::unlink(removed.test.path(name).c_str());
    EXPECT_EQ(removed.state.currentState(), 0);
    removed.test.replace(name, "4");
    EXPECT_EQ(removed.state.currentState(), 4);
}

// Goal: every change reaches the loop, by rename, by removal and by writing in place; other files of the directory do
// not.
TEST(DeviceLockState, TellsChanges) {
    const TestRoot test;
    const std::string file = std::string(names::runtimeDirectory) + "/" + names::lockState;
    FileDeviceLockState state(test.root());
    EpollRunLoop loop;
    std::atomic<int> calls{0};
    std::atomic<int> seen{-2};
    ASSERT_EQ(state.registerForChanges(loop,
                                       [&] {
                                           seen = state.currentState();
                                           ++calls;
                                       }),
              0);
    std::thread runner([&] { loop.run(); });
    test.replace(file, "1");
    EXPECT_TRUE(eventually([&] { return seen == 1; }));
    ::unlink(test.path(file).c_str());
    EXPECT_TRUE(eventually([&] { return seen == 0; }));
    test.write(file, "4");
    EXPECT_TRUE(eventually([&] { return seen == 4; }));
    test.replace(file, "0");
    EXPECT_TRUE(eventually([&] { return seen == 0; }));
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
    const int before = calls;
    test.write(std::string(names::runtimeDirectory) + "/other", "x");
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
    EXPECT_EQ(calls, before);
    loop.stop();
    runner.join();
}

// Goal: any string is one visible path component, and no two are the same. Method: round trips and non-names.
TEST(PercentEncoding, IsOneComponentAndReversible) {
    const std::vector<std::pair<std::string, std::string>> cases = {
        {"com.veltra.App-1_b", "com.veltra.App-1_b"},
        {".", "%2E"},
        {"..", "%2E."},
        {".hidden", "%2Ehidden"},
        {"a/b", "a%2Fb"},
        {"100%", "100%25"},
        {"%2E", "%252E"},
        {"\xc3\xa9", "%C3%A9"},
        {"a b\n", "a%20b%0A"},
        {std::string("\0", 1), "%00"},
        {"~", "%7E"},
    };
    for (const auto& [text, encoded] : cases) {
        EXPECT_EQ(percentEncode(text), encoded);
        EXPECT_EQ(percentDecode(encoded), text);
    }
    for (const char* wrong : {"%", "%2", "%2e", "%GG", ".x", "a/b", "%41", "a b"})
        EXPECT_EQ(percentDecode(wrong), std::nullopt) << wrong;
}

std::string linkTarget(const std::string& path) {
    char buffer[4096];
    const ssize_t bytes = ::readlink(path.c_str(), buffer, sizeof buffer);
    return bytes < 0 ? std::string() : std::string(buffer, static_cast<std::size_t>(bytes));
}

TEST(SandboxUserState, MapsReplacesAndRemoves) {
    TestRoot test;
    LinkSandboxUserState sandbox(test.root(), test.disk());
    const std::string name = test.path("run/zorvane/sandbox/501/1/a%2Fb");
    EXPECT_EQ(sandbox.setMapping(501, SandboxItemType::dataContainer, "a/b", std::nullopt), 0);
    EXPECT_NE(::access(test.path("run/zorvane/sandbox").c_str(), F_OK), 0) << "a removal makes nothing";
    EXPECT_EQ(sandbox.setMapping(501, SandboxItemType::dataContainer, "a/b", "/first"), 0);
    // What a kill between the two steps leaves under a name that is used again.
    ASSERT_EQ(::symlink("x", test.path("run/zorvane/sandbox/501/1/.new-1").c_str()), 0);
    EXPECT_EQ(sandbox.setMapping(501, SandboxItemType::dataContainer, "a/b", "/second"), 0);
    EXPECT_EQ(sandbox.setMapping(501, SandboxItemType::groupContainer, "a/b", "/group"), 0);
    EXPECT_EQ(linkTarget(name), "/second");
    EXPECT_EQ(linkTarget(test.path("run/zorvane/sandbox/501/2/a%2Fb")), "/group");
    EXPECT_EQ(sandbox.setMapping(501, SandboxItemType::dataContainer, "a/b", std::nullopt), 0);
    EXPECT_EQ(sandbox.setMapping(501, SandboxItemType::dataContainer, "a/b", std::nullopt), 0);
    EXPECT_EQ(linkTarget(name), "");
    EXPECT_EQ(sandbox.setMapping(501, SandboxItemType::dataContainer, "", "/x"), EINVAL);
    const std::string longest(255, 'i');
    EXPECT_EQ(sandbox.setMapping(501, SandboxItemType::dataContainer, longest, "/x"), 0);
    EXPECT_EQ(sandbox.setMapping(501, SandboxItemType::dataContainer, longest + "i", "/x"), ENAMETOOLONG);
    EXPECT_EQ(sandbox.setMapping(501, SandboxItemType::dataContainer, std::string(86, '/'), std::nullopt),
              ENAMETOOLONG);
    const auto leftOver = [&] { return ::access(test.path("run/zorvane/sandbox/501/1/.new-1").c_str(), F_OK); };
    EXPECT_NE(leftOver(), 0);
}

// Goal: a launch removes exactly the mappings whose container is gone. Method: one of each kind.
TEST(SandboxUserState, RemovesDanglingMappings) {
    TestRoot test;
    LinkSandboxUserState sandbox(test.root(), test.disk());
    EXPECT_EQ(sandbox.removeDanglingMappings(), 0U);
    test.makeDirectories("private/var/mobile/live");
    const auto map = [&](const char* identifier, const std::string& target) {
        ASSERT_EQ(sandbox.setMapping(501, SandboxItemType::dataContainer, identifier, target), 0);
    };
    map("live", test.path("private/var/mobile/live"));
    map("gone", test.path("private/var/mobile/gone"));
    map("not.ours", "/usr");
    map("beside", test.path("").substr(0, test.path("").size() - 1) + "x/usr");
    const std::string directory = test.path("run/zorvane/sandbox/501/1/");
    ASSERT_EQ(::symlink("half", (directory + ".new-7").c_str()), 0);
    EXPECT_EQ(sandbox.removeDanglingMappings(), 3U);
    EXPECT_NE(linkTarget(directory + "live"), "");
    for (const char* name : {"gone", "not.ours", "beside", ".new-7"})
        EXPECT_EQ(linkTarget(directory + name), "") << name;
}

class SettableLockState final : public DeviceLockState {
public:
    int state = 0;
    [[nodiscard]] int currentState() const override { return state; }
    int registerForChanges(RunLoop&, std::function<void()>) override { return 0; }
    [[nodiscard]] const char* registrationCallName() const override { return ""; }
    [[nodiscard]] const char* notificationName() const override { return ""; }
};

// Goal: a lock refuses exactly the classes whose keys are away, with an error that means nothing else. Method: every
// pair of classes, with each state; then damaged attributes.
TEST(FileProtectionClass, RefusesWhatALockTakesAway) {
    TestRoot test;
    SettableLockState lock;
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
                lock.state = 0;
                ASSERT_EQ(protection.setClass(file.get(), from), 0);
                lock.state = state;
                const bool refused = state == 1 && (from == 1 || from == 2 || to == 1 || to == 2);
                EXPECT_EQ(protection.setClass(file.get(), to), refused ? EPERM : 0) << state << from << to;
                EXPECT_EQ(protection.classOf(file.get()), refused ? from : to);
            }
        }
    }
    lock.state = 0;
    EXPECT_EQ(protection.setClass(file.get(), -1), EINVAL);
    for (const char* text : {"", "x", "1x", "-1", "99999999999", "00000000000000000001"}) {
        ASSERT_EQ(::fsetxattr(file.get(), protection.attributeName(), text, std::strlen(text), 0), 0);
        EXPECT_EQ(protection.classOf(file.get()), 3) << text;
    }
    EXPECT_EQ(protection.setClass(-1, 1), EBADF);
}

// Goal: one daemon on one root, and the lock goes with the process however it ends. Method: a child that holds it is
// killed.
TEST(DaemonLock, HoldsOffASecondDaemon) {
    const TestRoot test;
    int ends[2] = {};
    ASSERT_EQ(::pipe2(ends, O_CLOEXEC), 0);
    const pid_t child = ::fork();
    if (child == 0) {
        const auto held = DaemonLock::take(test.root());
        (void)!::write(ends[1], held ? "y" : "n", 1);
        ::pause();
        ::_exit(0);
    }
    char answer = 0;
    ASSERT_EQ(::read(ends[0], &answer, 1), 1);
    EXPECT_EQ(answer, 'y');
    const auto second = DaemonLock::take(test.root());
    ASSERT_FALSE(second);
    EXPECT_EQ(second.error(), EWOULDBLOCK);
    ::kill(child, SIGKILL);
    ::waitpid(child, nullptr, 0);
    const auto third = DaemonLock::take(test.root());
    EXPECT_TRUE(third);
    EXPECT_EQ(test.read("run/zorvane/zorvaned.lock"), std::to_string(::getpid()) + "\n");
    ::close(ends[0]);
    ::close(ends[1]);
}

} // namespace
} // namespace zor::platform
