// SPDX-License-Identifier: Apache-2.0
// zorvanectl install against a real daemon: what comes in, and what stays when it does not.
#include "archives/ArchiveMaker.h"
#include "process/DaemonProcess.h"
#include "process/Relay.h"
#include "whole/Expect.h"

#include <atomic>
#include <chrono>
#include <csignal>
#include <cstdlib>
#include <future>
#include <sys/ptrace.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace zor::whole {

namespace {

using zor::test::file;
using zor::test::Form;
using zor::test::makeArchive;

constexpr const char* identifier = "org.example.installed";
constexpr int exitLocalError = 5;

std::string contentOf(const std::string& path) {
    auto tree = support::readTree(path, {metadataFile});
    for (auto& [id, inode] : tree.inodes) {
        inode.uid = inode.gid = 0;
        inode.attributes.clear();
    }
    return tree.describe();
}

std::vector<std::string> installing(const std::string& root, const std::string& source,
                                    std::uint64_t containerClass = bundleApplication) {
    const std::string number = std::to_string(containerClass);
    return toolWords(root, {"--json", "install", identifier, source, "--class", number, "--yes", "--progress", "json"});
}

void install(const DaemonProcess& daemon, const std::string& source) {
    const auto done = runProgram(installing(daemon.root(), source));
    ASSERT_EQ(done.exitStatus, 0) << done.output;
}

/// An installer whose system calls are looked at.
class TracedInstaller {
public:
    TracedInstaller(const DaemonProcess& daemon, const std::string& source)
        : program_(daemon.toolWords({"install", identifier, source, "--class", "1", "--yes"}), [] {
              ::setenv("ASAN_OPTIONS", "detect_leaks=0", 1); // it would trace, too
              return ::ptrace(PTRACE_TRACEME, 0, nullptr, nullptr) == 0;
          }) {
        isTraced_ = program_.nextStop().has_value();
        ::ptrace(PTRACE_SETOPTIONS, program_.pid(), nullptr, PTRACE_O_EXITKILL | PTRACE_O_TRACESYSGOOD);
    }
    [[nodiscard]] bool isTraced() const { return isTraced_; }
    /// Before the change with this number is made, from 0; false when there are not so many.
    bool killedAtChange(std::size_t number) {
        constexpr int atCall = SIGTRAP | 0x80;
        for (int signal = 0;;) {
            ::ptrace(PTRACE_SYSCALL, program_.pid(), nullptr, signal);
            const auto stop = program_.nextStop();
            if (!stop)
                return false;
            signal = *stop == atCall ? 0 : *stop;
            if (*stop == atCall && changesSomething() && number-- == 0)
                break;
        }
        program_.signal(SIGKILL);
        (void)program_.wait();
        return true;
    }

private:
    [[nodiscard]] bool changesSomething() const {
        static const std::set<std::uint64_t> changes = {
            SYS_openat,    SYS_openat2,         SYS_mkdirat,   SYS_renameat,  SYS_renameat2, SYS_unlinkat,
            SYS_symlinkat, SYS_linkat,          SYS_fchmod,    SYS_fchmodat,  SYS_fchown,    SYS_fchownat,
            SYS_write,     SYS_pwrite64,        SYS_fsetxattr, SYS_ftruncate, SYS_fsync,     SYS_fdatasync,
            SYS_syncfs,    SYS_copy_file_range, SYS_utimensat, SYS_sendmsg,   SYS_sendto,    SYS_ioctl};
        __ptrace_syscall_info info{};
        return ::ptrace(PTRACE_GET_SYSCALL_INFO, program_.pid(), sizeof info, &info) > 0 &&
               info.op == PTRACE_SYSCALL_INFO_ENTRY && changes.contains(info.entry.nr) &&
               (info.entry.nr != SYS_openat || (info.entry.args[2] & O_CREAT) != 0);
    }
    Program program_;
    bool isTraced_ = false;
};

std::string pathOf(const DaemonProcess& daemon, std::uint64_t containerClass, bool transient = false) {
    auto client = daemon.client();
    const std::uint32_t user = zorvane::defaultUserOfClass(containerClass);
    const auto list = client.list(containerClass, user, transient);
    for (std::size_t i = 0; list && i < list->size(); ++i)
        if ((*list)[i].identifier == identifier)
            return client.metadata({containerClass, user, identifier, (*list)[i].uuid})->path;
    return {};
}

/// The new container, once there is something in it; the installer stands still then.
std::string stopInTheMiddle(const DaemonProcess& daemon, const Program& installer) {
    for (int tries = 0; tries < 10'000; ++tries) {
        const std::string path = pathOf(daemon, bundleApplication, true);
        installer.signal(SIGSTOP);
        if (!path.empty() && contentOf(path).find(".install-") != std::string::npos)
            return path;
        installer.signal(SIGCONT);
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    return {};
}

/// Long enough in the making to be met in the middle.
std::string largeArchive() {
    std::vector<zor::test::Made> entries;
    for (int i = 0; i < 8000; ++i)
        entries.push_back(file("folder" + std::to_string(i / 100) + "/file" + std::to_string(i), "content"));
    return makeArchive(Form::tarZstd, entries);
}

bool isGone(const DaemonProcess& daemon) {
    return pathOf(daemon, bundleApplication, true).empty();
}

void expectWhole(const DaemonProcess& daemon) {
    const auto checked = daemon.tool({"check"});
    EXPECT_EQ(checked.exitStatus, 0) << checked.output;
}

bool hasAll(const DaemonProcess& daemon) {
    return std::filesystem::exists(pathOf(daemon, bundleApplication) + "/folder79/file7999");
}

} // namespace

// Goal: what is installed is what was given, byte for byte, in the place of what was there. Method: a directory, then
// an archive, as a data container with its standard subdirectories and as a bundle.
TEST(Install, DirectoryThenArchive) {
    DaemonProcess daemon;
    daemon.start();
    const support::TemporaryDirectory place;
    const std::string folder = place.path() + "/source";
    writeFile(folder + "/Documents/deep/f", std::string(300'000, 'f'));
    writeFile(folder + "/Library/\n", "x");
    std::filesystem::create_symlink("Documents/deep", folder + "/link");
    const std::string archive = place.path() + "/archive";
    writeFile(archive, makeArchive(Form::tarXz, {file("only/f", "new")}));
    const auto throughShell = [&](const char* script, const std::vector<std::string>& words) {
        std::vector<std::string> all = {"/bin/sh", "-c", script, archive};
        all.insert(all.end(), words.begin(), words.end());
        return runProgram(all);
    };
    for (const auto containerClass : {bundleApplication, dataApplication}) {
        const auto first = runProgram(installing(daemon.root(), folder, containerClass));
        expectOutcome(first, 0, "\"phase\": \"syncing\"");
        expectOutcome(first, 0, "\"replaced\": false");
        const std::string path = pathOf(daemon, containerClass);
        if (containerClass == bundleApplication) {
            EXPECT_EQ(contentOf(path), contentOf(folder));
        } else {
            EXPECT_EQ(contentOf(path + "/Documents"), contentOf(folder + "/Documents"));
            for (const char* there : {"/Library/\n", "/Library/Caches", "/Library/Preferences", "/tmp"})
                EXPECT_TRUE(std::filesystem::exists(path + there)) << there;
        }
        expectOutcome(throughShell("cat \"$0\" | \"$@\"", installing(daemon.root(), "-", containerClass)), 0,
                      "\"replaced\": true");
        const std::string newPath = pathOf(daemon, containerClass);
        EXPECT_EQ(readFile(newPath + "/only/f"), "new");
        EXPECT_FALSE(std::filesystem::exists(path) || std::filesystem::exists(newPath + "/link"));
        EXPECT_TRUE(isGone(daemon));
    }
    // A message does not go into the daemon's socket, which gets the third number.
    expectOutcome(throughShell("exec \"$@\" 0<&- 1>&- 2>&-", installing(daemon.root(), archive)), 0, "");
    EXPECT_EQ(daemon.counter("BrokenFrames"), 0);
    for (const auto& [source, whereTo] : {std::pair("/nowhere", "1"), std::pair("/etc", "shared-app")})
        EXPECT_EQ(daemon.tool({"install", identifier, source, "--class", whereTo, "--yes"}).exitStatus, 2);
}

// Goal: however an installation ends before its time, the old container is as it was, and nothing of the new one
// stays longer than it must. Method: a table of ends, each in the middle of the installation.
TEST(Install, WhateverFailsTheOldOneStays) {
    const support::TemporaryDirectory place;
    const std::string good = place.path() + "/good.tar.zst";
    const std::string cut = place.path() + "/cut.tar.zst";
    const std::string bytes = largeArchive();
    writeFile(good, bytes);
    writeFile(cut, bytes.substr(0, bytes.size() * 3 / 4));
    struct Row {
        const char* what;
        std::string source;
        std::function<void(DaemonProcess&, const Program&)> meanwhile;
        int exitStatus;
        const char* says;
        /// The daemon has to boot before the new container is gone.
        bool goesAtBoot = false;
    };
    const auto sends = [](int signal) {
        return [signal](DaemonProcess&, const Program& installer) { installer.signal(signal); };
    };
    const std::vector<Row> rows = {
        {"a cut archive", cut, sends(SIGCONT), exitLocalError, "thrown away"},
        {"interrupted", good, sends(SIGINT), 128 + SIGINT, "interrupted"},
        {"terminated", good, sends(SIGTERM), 128 + SIGTERM, "thrown away"},
        {"killed", good, sends(SIGKILL), 128 + SIGKILL, "", true},
        {"the daemon is killed", good, [](DaemonProcess& daemon, const Program&) { daemon.kill(); }, exitLocalError,
         "until the next boot", true},
        {"asked for by another", good,
         [](DaemonProcess& daemon, const Program&) {
             EXPECT_TRUE(daemon.client().createOrLookup({bundleApplication, 33, identifier, true, true}));
         },
         exitLocalError, "somebody else's", true},
    };
    writeFile(place.path() + "/old.zip", makeArchive(Form::zip, {file("old", "stays")}));
    for (const Row& row : rows) {
        SCOPED_TRACE(row.what);
        DaemonProcess daemon;
        daemon.start();
        install(daemon, place.path() + "/old.zip");
        const std::string path = pathOf(daemon, bundleApplication);
        const std::string old = contentOf(path);

        Program installer(installing(daemon.root(), row.source));
        ASSERT_NE(stopInTheMiddle(daemon, installer), "");
        row.meanwhile(daemon, installer);
        installer.signal(SIGCONT);
        expectEnd(installer, row.exitStatus, row.says);
        if (!daemon.running())
            daemon.start();
        EXPECT_EQ(pathOf(daemon, bundleApplication), path);
        EXPECT_EQ(contentOf(path), old);
        if (row.goesAtBoot) {
            EXPECT_FALSE(isGone(daemon));
            daemon.kill();
            daemon.start({"--forget-boot"});
        }
        EXPECT_TRUE(isGone(daemon));
        EXPECT_EQ(contentOf(path), old);
        expectWhole(daemon);
        install(daemon, good);
        EXPECT_TRUE(hasAll(daemon));
    }
}

// Goal: wherever the installer ends, the old container or the new one is there whole, and what it left goes at the next
// boot. Method: SIGKILL at the first, second, ... system call by which it changes anything outside itself, until it
// meets none; both contents take turns.
TEST(Install, KilledAtEachOfItsChanges) {
    const support::TemporaryDirectory place;
    std::string sources[2];
    std::string contents[2];
    DaemonProcess daemon;
    daemon.start();
    for (const int version : {0, 1}) {
        sources[version] = place.path() + "/" + std::to_string(version);
        std::vector<zor::test::Made> entries;
        for (const int number : {1, 2, 3})
            entries.push_back(file("folder/f" + std::to_string(number), std::to_string(version)));
        writeFile(sources[version], makeArchive(Form::tar, entries));
        install(daemon, sources[version]);
        contents[version] = contentOf(pathOf(daemon, bundleApplication));
    }
    int current = 1;
    std::size_t point = 0;
    for (bool ended = false; !ended; ++point) {
        SCOPED_TRACE(point);
        TracedInstaller installer(daemon, sources[1 - current]);
        if (!installer.isTraced())
            GTEST_SKIP() << "skipped: processes may not be traced here";
        ended = !installer.killedAtChange(point);
        const std::string content = contentOf(pathOf(daemon, bundleApplication));
        if (content == contents[1 - current])
            current = 1 - current;
        else
            ASSERT_EQ(content, contents[current]);
        daemon.kill();
        daemon.start({"--forget-boot"});
        EXPECT_TRUE(isGone(daemon));
        EXPECT_EQ(contentOf(pathOf(daemon, bundleApplication)), contents[current]);
        expectWhole(daemon);
    }
    EXPECT_GT(point, 30U);
}

// Goal: content that is whole is not thrown away when the old one is not there any more. Method: it is deleted while
// the new one is put together; the new one is then put in place by hand.
TEST(Install, OldOneDeletedMeanwhile) {
    const support::TemporaryDirectory place;
    const std::string source = place.path() + "/archive";
    DaemonProcess daemon;
    daemon.start();
    writeFile(source, makeArchive(Form::tar, {file("old")}));
    install(daemon, source);
    writeFile(source, largeArchive());
    Program installer(installing(daemon.root(), source));
    const std::string path = stopInTheMiddle(daemon, installer);
    ASSERT_NE(path, "");
    ASSERT_TRUE(daemon.client().deleteContainer(bundleApplication, 33, identifier, false));
    installer.signal(SIGCONT);
    expectEnd(installer, exitLocalError, path);
    EXPECT_EQ(daemon.tool({"replace", identifier, "--class", "1", "--yes"}).exitStatus, 0);
    EXPECT_TRUE(hasAll(daemon));
}

// Goal: where nobody can tell which container is live, none is thrown away. Method: the answer to the replace is lost,
// and so is that to the next question; then the daemon answers again.
TEST(Install, WhatMayBeTheOnlyOneIsKept) {
    const support::TemporaryDirectory place;
    DaemonProcess daemon;
    daemon.start();
    writeFile(place.path() + "/archive", makeArchive(Form::tar, {file("new")}));
    std::atomic<bool> lost{false};
    const Relay relay(daemon, [&](ipc::Command command) {
        if (command == ipc::Command::replaceContainer) {
            lost = true;
            return Fate::hungUp;
        }
        return lost.exchange(false) ? Fate::hungUp : Fate::passedOn;
    });
    Program installer(installing(relay.root(), place.path() + "/archive"));
    expectEnd(installer, exitLocalError, "cannot be told");
    EXPECT_TRUE(std::filesystem::exists(pathOf(daemon, bundleApplication, true) + "/new"));
}

// Goal: a signal ends an installation also where the daemon does not answer. Method: it is silent before the first
// change, where one signal is to do and leaves nothing, and after the last, where a second one is.
TEST(Install, SignalsWhileTheDaemonIsSilent) {
    const support::TemporaryDirectory place;
    DaemonProcess daemon;
    daemon.start();
    writeFile(place.path() + "/archive", makeArchive(Form::tar, {file("f")}));
    install(daemon, place.path() + "/archive");
    for (const auto& [silentAt, signals, begun] : {std::tuple(ipc::Command::getDiskUsage, 1, false),
                                                   std::tuple(ipc::Command::recreateDefaultStructure, 5, true)}) {
        std::promise<void> silent;
        std::atomic<bool> told{false};
        const Relay relay(daemon, [&, command = silentAt](ipc::Command asked) {
            if (asked != command)
                return Fate::passedOn;
            if (!told.exchange(true))
                silent.set_value();
            return Fate::unanswered;
        });
        Program installer(installing(relay.root(), place.path() + "/archive"));
        silent.get_future().wait();
        for (int sent = 0; sent < signals; ++sent) {
            installer.signal(SIGINT);
            std::this_thread::sleep_for(std::chrono::milliseconds(100));
        }
        EXPECT_EQ(installer.wait(), 128 + SIGINT);
        EXPECT_EQ(installer.said().find("\"error\""), std::string::npos) << installer.said();
        EXPECT_EQ(isGone(daemon), !begun);
    }
}

// Goal: who owns a container may fill it without being root. Method: the tool runs as that user, with the powers that
// an entry of the registry gives him.
TEST(Install, AsTheContainersOwner) {
    if (::geteuid() != 0)
        GTEST_SKIP() << "only root can become another user";
    DaemonProcess daemon;
    daemon.registerProgram("15-owner", programPath("zorvanectl"),
                           "<key>UserIDs</key><array><integer>501</integer></array><key>Entitlements</key><dict>"
                           "<key>com.veltra.private.Zorvane.allowed</key><true/></dict>");
    daemon.start();
    const support::TemporaryDirectory place;
    ::chmod(place.path().c_str(), 0755);
    const std::string archive = place.path() + "/archive";
    writeFile(archive, makeArchive(Form::tarGzip, {file("Documents/f", "mine")}));
    Program installer(installing(daemon.root(), archive, dataApplication),
                      [] { return ::setgid(mobile) == 0 && ::setuid(mobile) == 0; });
    const int status = installer.wait();
    if (status == 127)
        GTEST_SKIP() << "the build lies where others cannot execute it";
    ASSERT_EQ(status, 0) << installer.said();
    struct stat found{};
    ASSERT_EQ(::lstat((pathOf(daemon, dataApplication) + "/Documents/f").c_str(), &found), 0);
    EXPECT_EQ(found.st_uid, mobile);
}

} // namespace zor::whole
