// SPDX-License-Identifier: Apache-2.0
// zorvanectl install against a real daemon: what comes in, and what stays when it does not.
#include "archives/ArchiveMaker.h"
#include "platform/FileDescriptor.h"
#include "process/DaemonProcess.h"
#include "process/Relay.h"

#include <atomic>
#include <chrono>
#include <csignal>
#include <cstdlib>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <functional>
#include <future>
#include <gtest/gtest.h>
#include <set>
#include <sys/mount.h>
#include <sys/ptrace.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

namespace zor::whole {

namespace {

using zor::test::file;
using zor::test::Form;
using zor::test::makeArchive;

constexpr std::uint64_t bundleApplication = 1;
constexpr std::uint64_t dataApplication = 2;
constexpr const char* identifier = "org.example.installed";
constexpr const char* metadata = ".com.veltra.zorvane.metadata.plist";
constexpr int exitLocalError = 5;

void writeFile(const std::string& path, const std::string& bytes) {
    std::ofstream(path, std::ios::binary) << bytes;
}

std::string contentOf(const std::string& path) {
    auto tree = support::readTree(path, {metadata});
    for (auto& [id, inode] : tree.inodes) {
        inode.uid = inode.gid = 0;
        inode.attributes.clear();
    }
    return tree.describe();
}

/// The installer at work, in a process of its own.
class Installer {
public:
    Installer(const DaemonProcess& daemon, const std::string& source, uid_t user = 0)
        : Installer(daemon.root(), source, user) {}
    Installer(const std::string& root, const std::string& source, uid_t user = 0) {
        int ends[2];
        EXPECT_EQ(::pipe2(ends, O_CLOEXEC), 0);
        pid_ = ::fork();
        if (pid_ == 0) {
            ::dup3(ends[1], 1, 0);
            ::dup3(ends[1], 2, 0);
            if (user != 0 && (::setgid(user) != 0 || ::setuid(user) != 0))
                ::_exit(127);
            const std::string program = programPath("zorvanectl");
            ::execl(program.c_str(), "zorvanectl", "--root", root.c_str(), "--json", "install", identifier,
                    source.c_str(), "--class", user == 0 ? "1" : "2", "--yes", "--progress", "json",
                    static_cast<char*>(nullptr));
            ::_exit(127);
        }
        ::close(ends[1]);
        output_.reset(ends[0]);
    }
    void signal(int number) const { ::kill(pid_, number); }
    /// The exit status, 128 and the number after a signal; what was said is in `said` then.
    int wait() {
        char buffer[4096];
        for (ssize_t count; (count = ::read(output_.get(), buffer, sizeof buffer)) > 0;)
            said.append(buffer, static_cast<std::size_t>(count));
        int status = 0;
        ::waitpid(pid_, &status, 0);
        return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    }
    std::string said;

private:
    pid_t pid_ = -1;
    platform::FileDescriptor output_;
};

/// An installer whose system calls are looked at.
class TracedInstaller {
public:
    TracedInstaller(const DaemonProcess& daemon, const std::string& source) : pid_(::fork()) {
        if (pid_ == 0) {
            const platform::FileDescriptor nothing(::open("/dev/null", O_WRONLY | O_CLOEXEC));
            ::dup2(nothing.get(), 1);
            ::dup2(nothing.get(), 2);
            ::setenv("ASAN_OPTIONS", "detect_leaks=0", 1); // it would trace, too
            if (::ptrace(PTRACE_TRACEME, 0, nullptr, nullptr) != 0)
                ::_exit(0);
            const std::string program = programPath("zorvanectl");
            ::execl(program.c_str(), "zorvanectl", "--root", daemon.root().c_str(), "install", identifier,
                    source.c_str(), "--class", "1", "--yes", static_cast<char*>(nullptr));
            ::_exit(127);
        }
        stopped_ = next();
        if (stopped_)
            ::ptrace(PTRACE_SETOPTIONS, pid_, nullptr, PTRACE_O_EXITKILL | PTRACE_O_TRACESYSGOOD);
    }
    ~TracedInstaller() { end(); }
    TracedInstaller(const TracedInstaller&) = delete;
    TracedInstaller& operator=(const TracedInstaller&) = delete;
    [[nodiscard]] bool isTraced() const { return stopped_; }
    /// Before the change with this number is made, from 0; false when there are not so many.
    bool killedAtChange(std::size_t number) {
        for (int signal = 0; stopped_;) {
            ::ptrace(PTRACE_SYSCALL, pid_, nullptr, signal);
            stopped_ = next();
            signal = stopped_ && WSTOPSIG(status_) != (SIGTRAP | 0x80) ? WSTOPSIG(status_) : 0;
            if (!stopped_ || signal != 0 || !changesSomething())
                continue;
            if (number-- == 0) {
                end();
                return true;
            }
        }
        return false;
    }

private:
    void end() {
        if (stopped_)
            ::kill(pid_, SIGKILL);
        while (stopped_)
            stopped_ = next();
    }
    bool next() { return ::waitpid(pid_, &status_, 0) == pid_ && WIFSTOPPED(status_); }
    [[nodiscard]] bool changesSomething() const {
        static const std::set<std::uint64_t> changes = {
            SYS_openat,    SYS_openat2,         SYS_mkdirat,   SYS_renameat,  SYS_renameat2, SYS_unlinkat,
            SYS_symlinkat, SYS_linkat,          SYS_fchmod,    SYS_fchmodat,  SYS_fchown,    SYS_fchownat,
            SYS_write,     SYS_pwrite64,        SYS_fsetxattr, SYS_ftruncate, SYS_fsync,     SYS_fdatasync,
            SYS_syncfs,    SYS_copy_file_range, SYS_utimensat, SYS_sendmsg,   SYS_sendto,    SYS_ioctl};
        __ptrace_syscall_info info{};
        return ::ptrace(PTRACE_GET_SYSCALL_INFO, pid_, sizeof info, &info) > 0 &&
               info.op == PTRACE_SYSCALL_INFO_ENTRY && changes.contains(info.entry.nr) && !onlyReads(info);
    }
    [[nodiscard]] static bool onlyReads(const __ptrace_syscall_info& info) {
        return info.entry.nr == SYS_openat && (info.entry.args[2] & O_CREAT) == 0;
    }
    const pid_t pid_;
    int status_ = 0;
    bool stopped_ = false;
};

std::string pathOf(const DaemonProcess& daemon, std::uint64_t containerClass, bool transient = false) {
    auto client = daemon.client();
    const std::uint32_t user = zorvane::defaultUserOfClass(containerClass);
    const auto list = client.list(containerClass, user, transient);
    for (std::size_t i = 0; list && i < list->size(); ++i)
        if ((*list)[i].identifier == identifier)
            return client
                .metadata(
                    {.containerClass = containerClass, .user = user, .identifier = identifier, .uuid = (*list)[i].uuid})
                ->path;
    return {};
}

/// The new container, once there is something in it; the installer stands still then.
std::string stopInTheMiddle(const DaemonProcess& daemon, const Installer& installer) {
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

} // namespace

// Goal: what is installed is what was given, byte for byte, in the place of what was there. Method: a directory, then
// an archive, as a data container with its standard subdirectories and as a bundle.
TEST(Install, DirectoryThenArchive) {
    DaemonProcess daemon;
    daemon.start();
    const support::TemporaryDirectory place;
    const std::string folder = place.path() + "/source";
    std::filesystem::create_directories(folder + "/Documents/deep");
    std::filesystem::create_directories(folder + "/Library");
    writeFile(folder + "/Documents/deep/f", std::string(300'000, 'f'));
    writeFile(folder + "/Library/\n", "x");
    std::filesystem::create_symlink("Documents/deep", folder + "/link");
    for (const auto containerClass : {bundleApplication, dataApplication}) {
        const auto install = [&](const std::string& source) {
            return runProgram({programPath("zorvanectl"), "--root", daemon.root(), "--json", "install", identifier,
                               source, "--class", std::to_string(containerClass), "--yes", "--progress", "json"});
        };
        const auto first = install(folder);
        ASSERT_EQ(first.exitStatus, 0) << first.output;
        EXPECT_NE(first.output.find("\"phase\": \"syncing\""), std::string::npos) << first.output;
        EXPECT_NE(first.output.find("\"replaced\": false"), std::string::npos) << first.output;
        const std::string path = pathOf(daemon, containerClass);
        if (containerClass == bundleApplication) {
            EXPECT_EQ(contentOf(path), contentOf(folder));
        } else {
            EXPECT_EQ(contentOf(path + "/Documents"), contentOf(folder + "/Documents"));
            EXPECT_TRUE(std::filesystem::exists(path + "/Library/\n"));
            for (const char* standard : {"/Library/Caches", "/Library/Preferences", "/tmp"})
                EXPECT_TRUE(std::filesystem::is_directory(path + standard)) << standard;
        }
        writeFile(place.path() + "/archive", makeArchive(Form::tarXz, {file("only/f", "new")}));
        const auto second = install(place.path() + "/archive");
        ASSERT_EQ(second.exitStatus, 0) << second.output;
        EXPECT_NE(second.output.find("\"replaced\": true"), std::string::npos) << second.output;
        const std::string newPath = pathOf(daemon, containerClass);
        std::ifstream read(newPath + "/only/f");
        EXPECT_EQ(std::string(std::istreambuf_iterator<char>(read), {}), "new");
        EXPECT_FALSE(std::filesystem::exists(path));
        EXPECT_FALSE(std::filesystem::exists(newPath + "/link"));
        EXPECT_TRUE(isGone(daemon));
        const auto wrong = install("/nowhere");
        EXPECT_EQ(wrong.exitStatus, 2) << wrong.output;
    }
    const auto shared = runProgram({programPath("zorvanectl"), "--root", daemon.root(), "install", identifier, folder,
                                    "--class", "shared-app", "--yes"});
    EXPECT_EQ(shared.exitStatus, 2) << shared.output;
}

// Goal: what is said does not go into a file or socket that got a standard descriptor's number. Method: an installation
// without any, where the third number would be the daemon's socket.
TEST(Install, StandardDescriptorsThatAreClosed) {
    DaemonProcess daemon;
    daemon.start();
    const support::TemporaryDirectory place;
    writeFile(place.path() + "/archive", makeArchive(Form::tar, {file("f")}));
    const auto installed = runProgram({"/bin/sh", "-c", "exec \"$@\" 0<&- 1>&- 2>&-", "sh", programPath("zorvanectl"),
                                       "--root", daemon.root(), "install", identifier, place.path() + "/archive",
                                       "--class", "1", "--yes", "--progress", "json"});
    EXPECT_EQ(installed.exitStatus, 0);
    EXPECT_EQ(daemon.counter("BrokenFrames"), 0);
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
        std::function<void(DaemonProcess&, const Installer&)> meanwhile;
        int exitStatus;
        const char* says;
        /// The daemon has to boot before the new container is gone.
        bool goesAtBoot = false;
    };
    const auto nothing = [](DaemonProcess&, const Installer&) {};
    const auto sends = [](int signal) {
        return [signal](DaemonProcess&, const Installer& installer) { installer.signal(signal); };
    };
    const std::vector<Row> rows = {
        {"a cut archive", cut, nothing, exitLocalError, "thrown away"},
        {"interrupted", good, sends(SIGINT), 128 + SIGINT, "interrupted"},
        {"terminated", good, sends(SIGTERM), 128 + SIGTERM, "thrown away"},
        {"killed", good, sends(SIGKILL), 128 + SIGKILL, "", true},
        {"the daemon is killed", good, [](DaemonProcess& daemon, const Installer&) { daemon.kill(); }, exitLocalError,
         "until the next boot", true},
        {"asked for by another", good,
         [](DaemonProcess& daemon, const Installer&) {
             const auto made = daemon.client().createOrLookup({.containerClass = bundleApplication,
                                                               .user = 33,
                                                               .identifier = identifier,
                                                               .create = true,
                                                               .transient = true});
             EXPECT_TRUE(made);
         },
         exitLocalError, "somebody else's", true},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.what);
        DaemonProcess daemon;
        daemon.start();
        writeFile(place.path() + "/old.zip", makeArchive(Form::zip, {file("old", "stays")}));
        Installer first(daemon, place.path() + "/old.zip");
        ASSERT_EQ(first.wait(), 0) << first.said;
        const std::string path = pathOf(daemon, bundleApplication);
        const std::string old = contentOf(path);

        Installer installer(daemon, row.source);
        ASSERT_NE(stopInTheMiddle(daemon, installer), "");
        row.meanwhile(daemon, installer);
        installer.signal(SIGCONT);
        EXPECT_EQ(installer.wait(), row.exitStatus) << installer.said;
        EXPECT_NE(installer.said.find(row.says), std::string::npos) << installer.said;
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
        const auto checked = runProgram({programPath("zorvanectl"), "--root", daemon.root(), "check"});
        EXPECT_EQ(checked.exitStatus, 0) << checked.output;
        Installer again(daemon, good);
        EXPECT_EQ(again.wait(), 0) << again.said;
        EXPECT_TRUE(std::filesystem::exists(pathOf(daemon, bundleApplication) + "/folder79/file7999"));
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
        Installer whole(daemon, sources[version]);
        ASSERT_EQ(whole.wait(), 0) << whole.said;
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
        const auto checked = runProgram({programPath("zorvanectl"), "--root", daemon.root(), "check"});
        EXPECT_EQ(checked.exitStatus, 0) << checked.output;
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
    Installer first(daemon, source);
    ASSERT_EQ(first.wait(), 0) << first.said;
    writeFile(source, largeArchive());
    Installer installer(daemon, source);
    const std::string path = stopInTheMiddle(daemon, installer);
    ASSERT_NE(path, "");
    ASSERT_TRUE(daemon.client().deleteContainer(bundleApplication, 33, identifier, false));
    installer.signal(SIGCONT);
    EXPECT_EQ(installer.wait(), exitLocalError);
    EXPECT_NE(installer.said.find(path), std::string::npos) << installer.said;
    const auto replaced = runProgram(
        {programPath("zorvanectl"), "--root", daemon.root(), "replace", identifier, "--class", "1", "--yes"});
    EXPECT_EQ(replaced.exitStatus, 0) << replaced.output;
    EXPECT_TRUE(std::filesystem::exists(pathOf(daemon, bundleApplication) + "/folder79/file7999"));
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
            return Relay::Fate::hungUp;
        }
        return lost.exchange(false) ? Relay::Fate::hungUp : Relay::Fate::passedOn;
    });
    Installer installer(relay.root(), place.path() + "/archive");
    EXPECT_EQ(installer.wait(), exitLocalError);
    EXPECT_NE(installer.said.find("cannot be told"), std::string::npos) << installer.said;
    EXPECT_TRUE(std::filesystem::exists(pathOf(daemon, bundleApplication, true) + "/new"));
}

// Goal: a signal ends an installation also where the daemon does not answer. Method: it is silent before the first
// change, where one signal is to do and leaves nothing, and after the last, where a second one is.
TEST(Install, SignalsWhileTheDaemonIsSilent) {
    const support::TemporaryDirectory place;
    DaemonProcess daemon;
    daemon.start();
    writeFile(place.path() + "/archive", makeArchive(Form::tar, {file("f")}));
    Installer first(daemon, place.path() + "/archive");
    ASSERT_EQ(first.wait(), 0) << first.said;
    for (const auto& [silentAt, signals, begun] : {std::tuple(ipc::Command::getDiskUsage, 1, false),
                                                   std::tuple(ipc::Command::recreateDefaultStructure, 5, true)}) {
        std::promise<void> silent;
        std::atomic<bool> told{false};
        const Relay relay(daemon, [&, command = silentAt](ipc::Command asked) {
            if (asked != command)
                return Relay::Fate::passedOn;
            if (!told.exchange(true))
                silent.set_value();
            return Relay::Fate::unanswered;
        });
        Installer installer(relay.root(), place.path() + "/archive");
        silent.get_future().wait();
        for (int sent = 0; sent < signals; ++sent) {
            installer.signal(SIGINT);
            std::this_thread::sleep_for(std::chrono::milliseconds(100));
        }
        EXPECT_EQ(installer.wait(), 128 + SIGINT);
        EXPECT_EQ(installer.said.find("\"error\""), std::string::npos) << installer.said;
        EXPECT_EQ(isGone(daemon), !begun);
    }
}

// Goal: a disk that is too small for the new content keeps the old, and room for others. Method: a small file system.
TEST(Install, FullDisk) {
    if (::geteuid() != 0)
        GTEST_SKIP() << "only root can make a small file system";
    const support::TemporaryDirectory place;
    if (::mount("none", place.path().c_str(), "tmpfs", 0, "size=48m") != 0)
        GTEST_SKIP() << "mounts are not permitted here";
    {
        const support::TemporaryDirectory sources;
        DaemonProcess daemon(DaemonProcess::Syncs::off, place.path());
        daemon.start();
        writeFile(sources.path() + "/old", makeArchive(Form::tar, {file("old")}));
        writeFile(sources.path() + "/new", makeArchive(Form::tarZstd, {file("new", std::string(60'000'000, 'n'))}));
        Installer first(daemon, sources.path() + "/old");
        ASSERT_EQ(first.wait(), 0) << first.said;
        const std::string path = pathOf(daemon, bundleApplication);
        Installer installer(daemon, sources.path() + "/new");
        EXPECT_EQ(installer.wait(), exitLocalError);
        EXPECT_NE(installer.said.find("too little space"), std::string::npos) << installer.said;
        EXPECT_EQ(pathOf(daemon, bundleApplication), path);
        EXPECT_TRUE(std::filesystem::exists(path + "/old"));
        EXPECT_TRUE(isGone(daemon));
        ASSERT_TRUE(daemon.client().emptyDeathRow());
        EXPECT_GT(std::filesystem::space(place.path()).available, 40'000'000U);
    }
    ::umount2(place.path().c_str(), MNT_DETACH);
}

// Goal: who owns a container may fill it without being root. Method: the tool runs as that user, with the powers that
// an entry of the registry gives him.
TEST(Install, AsTheContainersOwner) {
    constexpr uid_t owner = 501;
    if (::geteuid() != 0)
        GTEST_SKIP() << "only root can become another user";
    DaemonProcess daemon;
    writeFile(daemon.path("etc/zorvane/identities.d/15-owner.plist"),
              "<plist version=\"1.0\"><dict><key>Executable</key><string>" + programPath("zorvanectl") +
                  "</string><key>UserIDs</key><array><integer>501</integer></array><key>Entitlements</key><dict>"
                  "<key>com.veltra.private.Zorvane.allowed</key><true/></dict></dict></plist>");
    daemon.start();
    const support::TemporaryDirectory place;
    ::chmod(place.path().c_str(), 0755);
    writeFile(place.path() + "/archive", makeArchive(Form::tarGzip, {file("Documents/f", "mine")}));
    Installer installer(daemon, place.path() + "/archive", owner);
    const int status = installer.wait();
    if (status == 127)
        GTEST_SKIP() << "the build lies where others cannot execute it";
    ASSERT_EQ(status, 0) << installer.said;
    struct stat found{};
    ASSERT_EQ(::lstat((pathOf(daemon, dataApplication) + "/Documents/f").c_str(), &found), 0);
    EXPECT_EQ(found.st_uid, owner);
}

} // namespace zor::whole
