// SPDX-License-Identifier: Apache-2.0
// zorvane-run as a service manager uses it: a real daemon, real containers, real sandboxes. A test that makes sandboxes
// needs root, and a kernel that allows namespaces here.
#include "process/DaemonProcess.h"
#include "support/Frames.h"
#include "support/Waiting.h"
#include "whole/Expect.h"

#include <algorithm>
#include <csignal>
#include <fcntl.h>
#include <filesystem>
#include <poll.h>
#include <sys/epoll.h>
#include <sys/file.h>
#include <sys/socket.h>

namespace zor::whole {

namespace {

namespace files = std::filesystem;
using Words = std::vector<std::string>;
using support::eventually;

Words operator+(Words words, const Words& more) {
    words.insert(words.end(), more.begin(), more.end());
    return words;
}

const std::string notes = "org.example.notes";
const std::string maps = "org.example.maps";

/// Why no sandbox can be made here; empty when one can.
std::string whyNoSandbox() {
    if (::geteuid() != 0)
        return "needs root: becomes other users";
    if (!files::exists("/usr/bin/bwrap"))
        return "needs bubblewrap";
    const auto probe = runProgram({"/usr/bin/bwrap", "--unshare-pid", "--unshare-ipc", "--unshare-uts", "--ro-bind",
                                   "/", "/", "--proc", "/proc", "--dev", "/dev", "true"});
    return probe.exitStatus == 0 ? "" : "no namespaces here: " + probe.output;
}

#define ZOR_NEEDS_SANDBOX()                                                                                            \
    if (const std::string why = whyNoSandbox(); !why.empty())                                                          \
    GTEST_SKIP() << why

/// A daemon that knows the launcher, and two identifiers of user 501 that share a group.
class Launcher {
public:
    static constexpr const char* agent = "<key>KernelAgent</key><true/><key>Entitlements</key><dict/>";

    explicit Launcher(const std::string& entry = agent) {
        // A folder that every user can reach, whatever the checkout lies in.
        files::copy_file(programPath("zorvane-run"), program);
        daemon.registerProgram("30-run", program, entry);
        daemon.start();
        for (const std::string& identifier : {notes, maps})
            setGroups(identifier, {"group.shared"});
    }

    void setGroups(const std::string& identifier, const Words& groups, bool systemContainer = false) {
        zorvane::List list;
        for (const std::string& group : groups)
            list.push_back({group});
        zorvane::Map entitlements = {{"com.veltra.security.application-groups", {std::move(list)}}};
        if (systemContainer)
            entitlements["com.veltra.security.system-container"] = {true};
        ASSERT_TRUE(daemon.client().processEntitlements({.identifier = identifier, .entitlements = entitlements}));
    }
    [[nodiscard]] std::string data(const std::string& identifier, std::uint32_t user = 501) const {
        auto lookup = dataContainer(identifier);
        lookup.user = user;
        return daemon.client().createOrLookup(lookup).value().path;
    }
    [[nodiscard]] std::string group(const std::string& identifier, const std::string& group) const {
        return daemon.client().groupContainerPaths(501, identifier).value()[group];
    }
    [[nodiscard]] Words words(const std::string& identifier, const Words& more) const {
        return Words{program, "--root", daemon.root(), "--identifier", identifier, "--user", "501"} + more;
    }
    [[nodiscard]] Outcome run(const std::string& identifier, const Words& more) const {
        return runProgram(words(identifier, more));
    }
    [[nodiscard]] Outcome shell(const std::string& identifier, const std::string& script) const {
        return run(identifier, {"--", "sh", "-c", script});
    }

    DaemonProcess daemon;
    const std::string program = daemon.path("zorvane-run");
};

} // namespace

// Goal: while the daemon changes a program's files, the program is not started, or is started when that has ended; a
// file that a killed daemon left keeps nobody. Method: a lock on the assertion's file, held and let go by the test.
TEST(Run, TerminationAssertions) {
    ZOR_NEEDS_SANDBOX();
    Launcher launcher;
    const std::string file = launcher.daemon.path("run/zorvane/assertions/") + notes;
    files::create_directory(launcher.daemon.path("run/zorvane/assertions"));
    writeFile(file, "0", 0600);
    EXPECT_EQ(launcher.run(notes, {"--", "true"}).exitStatus, 0);
    const int held = ::open(file.c_str(), O_RDONLY | O_CLOEXEC);
    ASSERT_EQ(::flock(held, LOCK_EX | LOCK_NB), 0);
    expectOutcome(launcher.run(notes, {"--", "true"}), 125, "may not be started now: its files are being changed");
    EXPECT_EQ(launcher.run(maps, {"--", "true"}).exitStatus, 0);
    Program waiting(launcher.words(notes, {"--wait", "--", "echo", "started"}));
    std::this_thread::sleep_for(std::chrono::milliseconds(200));
    EXPECT_EQ(waiting.said(), "");
    ::unlink(file.c_str());
    ::close(held);
    EXPECT_EQ(waiting.wait(), 0);
    EXPECT_EQ(waiting.said(), "started\n");
}

// Goal: what the daemon begins while a program is being made ready keeps it from starting, too; whoever waits gets the
// container that is there then. Method: the daemon stands still while the launcher asks it; the test takes the lock.
TEST(Run, AnAssertionTakenMeanwhile) {
    ZOR_NEEDS_SANDBOX();
    Launcher launcher;
    const std::string file = launcher.daemon.path("run/zorvane/assertions/") + notes;
    const std::string old = launcher.data(notes);
    files::create_directories(launcher.daemon.path("run/zorvane/assertions"));
    for (const bool waits : {false, true}) {
        ::kill(launcher.daemon.pid(), SIGSTOP);
        Program run(launcher.words(notes, Words(waits ? 1 : 0, "--wait") + Words{"--", "sh", "-c", "echo $HOME"}));
        const std::string descriptors = "/proc/" + std::to_string(run.pid()) + "/fd";
        EXPECT_TRUE(eventually([&] {
            return std::ranges::any_of(files::directory_iterator(descriptors), [](const auto& entry) {
                std::error_code error;
                return files::read_symlink(entry, error).string().starts_with("socket:");
            });
        }));
        writeFile(file, "0", 0600);
        const int held = ::open(file.c_str(), O_RDONLY | O_CLOEXEC);
        ASSERT_EQ(::flock(held, LOCK_EX | LOCK_NB), 0);
        ::kill(launcher.daemon.pid(), SIGCONT);
        if (waits) {
            std::this_thread::sleep_for(std::chrono::milliseconds(300));
            EXPECT_EQ(run.said(), "");
            ASSERT_TRUE(launcher.daemon.client().deleteContainer(2, 501, notes, false));
            ::unlink(file.c_str());
            ::flock(held, LOCK_UN);
        }
        EXPECT_EQ(run.wait(), waits ? 0 : 125) << run.said();
        ::close(held);
        if (waits) {
            const std::string fresh = launcher.data(notes);
            EXPECT_NE(fresh, old);
            EXPECT_EQ(run.said(), fresh + "\n");
        }
    }
}

// Goal: whatever keeps a program from being run is 125 and says what to do. Method: a table of command lines, the last
// of them against a root without a daemon.
TEST(Run, CommandLines) {
    const support::TemporaryDirectory empty;
    const auto withUser = [](const char* user) { return Words{"--identifier", "a.b", "--user", user, "sh"}; };
    const std::tuple<Words, int, const char*> rows[] = {
        {{"--help"}, 0, "Examples:"},
        {{"--json", "--nothing", "sh"}, 125, "\"exitCode\": 125"},
        {{}, 125, "--identifier is missing"},
        {{"--identifier", "", "--user", "501", "sh"}, 125, "--identifier is missing"},
        {{"--identifier", "a.b", "sh"}, 125, "--user is missing"},
        {withUser("0"), 125, "'0' is no user"},
        {withUser("501x"), 125, "'501x' is neither a user id nor"},
        {{"--network", "lan", "sh"}, 125, "is no network"},
        {{"--identifier", "a.b", "--user", "501", "--"}, 125, "no program"},
        {{"--nothing", "sh"}, 125, "is no option"},
        {{"--inside", "0", "0", "none", "/", "sh"}, 125, "itself"},
        {{"--identifier", "a.b", "--user", "501", "--root", empty.path(), "sh", "--user"}, 125, "What to do: "},
    };
    for (const auto& [words, exitCode, says] : rows)
        expectOutcome(runProgram(Words{programPath("zorvane-run")} + words), exitCode, says);
    if (::geteuid() == 0) {
        Launcher launcher;
        const Words unprivileged = {"/usr/bin/setpriv", "--reuid", "501", "--clear-groups"};
        expectOutcome(runProgram(unprivileged + launcher.words(notes, {"sh"})), 125, "needs root");
    }
}

// Goal: a program finds its own containers, can write there, and nothing else of anybody. Method: a script inside asks;
// each line of the table is a condition that has to hold there.
TEST(Run, ItsOwnContainersAndNothingElse) {
    ZOR_NEEDS_SANDBOX();
    Launcher launcher;
    launcher.setGroups(notes, {"group.shared"}, true);
    launcher.setGroups(maps, {"group.shared", "group.maps"});
    const std::string home = launcher.data(notes);
    const std::string shared = launcher.group(notes, "group.shared");
    const std::string root = launcher.daemon.root();
    writeFile(launcher.data(maps) + "/secret", "secret", 0666);
    const std::string system = *launcher.daemon.client().systemContainerPath(notes);
    const std::string conditions[] = {
        "test \"$HOME\" = " + home,
        "test \"$(pwd)\" = " + home,
        "test \"$TMPDIR\" = " + home + "/tmp",
        "test \"$ZORVANE_IDENTIFIER\" = " + notes,
        "test \"$ZORVANE_SYSTEM_CONTAINER\" = " + system,
        "test \"$ZORVANE_APP_GROUPS\" = \"$(printf 'group.shared\\t" + shared + "')\"",
        "echo mine > $HOME/Documents/mine",
        "touch $TMPDIR/scratch",
        "echo ours > " + shared + "/Library/ours",
        "touch " + system + "/Library/mine",
        "touch /tmp/x && touch /dev/shm/x",
        "test ! -w $HOME/.com.veltra.zorvane.metadata.plist",
        "! touch /usr/x && ! touch /etc/x && ! touch /x && ! touch " + root + "/x",
        // Others' containers, and the way to them.
        "! cat " + launcher.data(maps) + "/secret",
        "! ls " + launcher.group(maps, "group.maps"),
        "! ls " + launcher.data(notes, 502),
        "test \"$(ls -A " + root + "/private/var/mobile/Containers/Data/Application)\" = \"${HOME##*/}\"",
        "test \"$(ls -A " + root + "/private/var/mobile/Containers/Shared/AppGroup)\" = \"" +
            files::path(shared).filename().string() + "\"",
        "! ls " + root + "/private/var/second && ! ls " + root + "/etc && ! ls " + root + "/run",
        "! ls /home && ! ls /root && ! ls /var && ! ls /run && ! ls /sys",
        "! ls /proc/1/root/ && ! ls /proc/1/cwd/",
        // The program's own state.
        "grep -qx 'Uid:\t501\t501\t501\t501' /proc/self/status",
        "grep -qx 'Gid:\t501\t501\t501\t501' /proc/self/status",
        "grep -qx 'Groups:\t *' /proc/self/status",
        "grep -qx 'NoNewPrivs:\t1' /proc/self/status",
        "test \"$(grep -c '^Cap.*:\t0000000000000000$' /proc/self/status)\" = 5",
        "grep -qx 'SigBlk:\t0000000000000000' /proc/self/status",
        "grep -qx 'SigIgn:\t0000000000000000' /proc/self/status && test $(umask) = 0022",
        // Ways to powers, and to what is the same in all namespaces.
        "grep -qx 'Seccomp:\t2' /proc/self/status && ! unshare -Ur true && ! cat /proc/keys",
        "test \"$(grep -c : /proc/net/dev)\" = 1 && test $(wc -l < /proc/net/unix) = 1",
        "test $(stat -f -c %c /tmp) -le 16384 && test $(stat -f -c %c /dev/shm) -le 16384",
        "test -z \"$ZORVANE_TEST_SECRET\" && test \"$LC_ALL\" = C.UTF-8",
        // The shell has the three descriptors; the fourth is what ls reads with.
        "test \"$(ls /proc/self/fd | tr '\\n' ' ')\" = '0 1 2 3 '",
        "test $(ls -d /proc/[0-9]* | wc -l) -le 6",
    };
    ::setenv("ZORVANE_TEST_SECRET", "secret", 1);
    ::setenv("LC_ALL", "C.UTF-8", 1);
    const int inherited = ::open("/", O_PATH | O_DIRECTORY); // a way out, were it passed on
    const mode_t mask = ::umask(0);
    ::signal(SIGPIPE, SIG_IGN);
    std::string script;
    for (const std::string& condition : conditions)
        script += "{ " + condition + "; } >$TMPDIR/out 2>&1 || cat <<'END'\nfailed: " + condition + "\nEND\n";
    for (const char* space : {"pid", "ipc", "mnt", "uts", "net"}) {
        const std::string link = std::string("/proc/self/ns/") + space;
        script += "test \"$(readlink " + link + ")\" != '" + files::read_symlink(link).string() + "' || echo shares " +
                  space + "\n";
    }
    const auto outcome = launcher.shell(notes, script + "exit 0");
    ::signal(SIGPIPE, SIG_DFL);
    ::umask(mask);
    ::close(inherited);
    ::unsetenv("ZORVANE_TEST_SECRET");
    EXPECT_EQ(outcome.exitStatus, 0);
    EXPECT_EQ(outcome.output, "");
    EXPECT_EQ(readFile(home + "/Documents/mine"), "mine\n");
    EXPECT_EQ(readFile(shared + "/Library/ours"), "ours\n");
    // The other one shares the group, and nothing more.
    EXPECT_EQ(launcher.shell(maps, "cat " + shared + "/Library/ours").output, "ours\n");
    EXPECT_NE(launcher.shell(maps, "cat " + home + "/Documents/mine").exitStatus, 0);
}

// Goal: the exit code and the signals are the program's own, and it does not outlive the launcher. Method: a table of
// ends; then real signals to the launcher, while the program waits for them.
TEST(Run, ExitCodesAndSignals) {
    ZOR_NEEDS_SANDBOX();
    Launcher launcher;
    const std::pair<Words, int> rows[] = {
        {{"--", "true"}, 0},
        {{"--", "sh", "-c", "exit 125"}, 125},
        {{"--", "sh", "-c", "kill -TERM $$"}, 128 + SIGTERM},
        {{"--", "sh", "-c", "kill -KILL $$"}, 128 + SIGKILL},
        {{"--", "no-such-program"}, 127},
        {{"--", "/no/such/program"}, 127},
        {{"--", "/etc/passwd"}, 126},
        {{"--bubblewrap", "/bin/true", "--", "true"}, 125},
    };
    for (const auto& [words, exitCode] : rows) {
        const auto outcome = launcher.run(notes, words);
        EXPECT_EQ(outcome.exitStatus, exitCode) << words.back() << ": " << outcome.output;
    }
    const Words careless = {"/usr/bin/env", "--ignore-signal=CHLD"};
    EXPECT_EQ(runProgram(careless + launcher.words(notes, {"--", "sh", "-c", "exit 9"})).exitStatus, 9)
        << "from a caller that does not wait for its children";
    const std::string ready = launcher.data(notes) + "/ready";
    const std::string wait = "touch $HOME/ready; while :; do sleep 0.02; done";
    // Sends a signal once the file is there.
    const auto signalled = [&](const Words& words, int signal) {
        files::remove(ready);
        Program run(launcher.words(notes, words));
        EXPECT_TRUE(eventually([&] { return files::exists(ready); }));
        run.signal(signal);
        const int exitCode = run.wait();
        return Outcome{exitCode, run.said()};
    };
    const std::tuple<int, std::string, int, const char*> signals[] = {
        {SIGTERM, "trap 'echo term; exit 3' TERM; ", 3, "term\n"},
        {SIGINT, "trap 'echo int; exit 4' INT; ", 4, "int\n"},
        {SIGUSR1, "trap 'echo usr1; exit 5' USR1; ", 5, "usr1\n"},
        {SIGTERM, "", 128 + SIGTERM, ""},
        {SIGHUP, "", 128 + SIGHUP, ""},
    };
    for (const auto& [number, script, exitCode, says] : signals) {
        const auto outcome = signalled({"--", "sh", "-c", script + wait}, number);
        EXPECT_EQ(outcome.exitStatus, exitCode) << number;
        EXPECT_EQ(outcome.output, says);
    }
    // A signal that comes before there is a program ends the program at its beginning.
    const std::string maker = launcher.daemon.path("maker");
    writeFile(maker, "#!/bin/sh\ntouch " + ready + "\nsleep 0.3\nexec /usr/bin/bwrap \"$@\"\n", 0755);
    EXPECT_EQ(signalled({"--bubblewrap", maker, "--", "sleep", "60"}, SIGTERM).exitStatus, 128 + SIGTERM);
}

// Goal: at whatever moment the launcher is killed, nothing that it started is left. Method: a pipe that all of them
// hold open ends; the launcher is killed at many moments of its beginning, and with a maker that has children and sees
// to nothing.
TEST(Run, NothingOutlivesTheLauncher) {
    ZOR_NEEDS_SANDBOX();
    Launcher launcher;
    const std::string ready = launcher.data(notes) + "/ready";
    const std::string maker = launcher.daemon.path("maker");
    writeFile(maker, "#!/bin/sh\nsetsid sleep 60 &\ntouch " + ready + "\nsleep 60\n", 0755);
    constexpr int moments = 40;
    for (int moment = 0; moment < moments + 2; ++moment) {
        SCOPED_TRACE(moment);
        const Words words = (moment == moments ? Words{"--bubblewrap", maker} : Words()) +
                            Words{"--", "sh", "-c", "touch $HOME/ready; sleep 60"};
        int ends[2] = {};
        ASSERT_EQ(::pipe2(ends, O_CLOEXEC), 0);
        files::remove(ready);
        Program run(launcher.words(notes, words), [&] { return ::dup2(ends[1], STDOUT_FILENO) == 1; });
        ::close(ends[1]);
        if (moment < moments)
            std::this_thread::sleep_for(std::chrono::microseconds(600 * moment));
        else
            EXPECT_TRUE(eventually([&] { return files::exists(ready); }));
        run.signal(SIGKILL);
        EXPECT_EQ(run.wait(), 128 + SIGKILL);
        pollfd end{.fd = ends[0], .events = 0, .revents = 0};
        EXPECT_EQ(::poll(&end, 1, 10'000), 1) << "somebody still holds the caller's pipe";
        ::close(ends[0]);
    }
}

// Goal: no standard descriptor leads out of the sandbox. Method: a table of what a caller may give as standard input,
// without and with the host's network; a directory also as standard output.
TEST(Run, StandardDescriptorsLeadNowhere) {
    ZOR_NEEDS_SANDBOX();
    Launcher launcher;
    const auto socket = [](int domain, int type) {
        int pair[2] = {::socket(domain, type & 0xFF, 0), -1};
        if ((type & 0x100) != 0)
            (void)!::socketpair(domain, type & 0xFF, 0, pair);
        return pair[0];
    };
    constexpr int connected = 0x100;
    const struct {
        const char* what;
        std::function<int()> open;
        int exitCodes[2]; // without the host's network, with it
    } rows[] = {
        {"a directory", [] { return ::open("/etc", O_RDONLY); }, {125, 125}},
        {"a place", [] { return ::open("/etc", O_PATH); }, {125, 125}},
        {"a file's place", [] { return ::open("/etc/passwd", O_PATH); }, {125, 125}},
        {"an epoll", [] { return ::epoll_create1(0); }, {125, 125}},
        {"datagrams", [&] { return socket(AF_UNIX, SOCK_DGRAM); }, {125, 0}},
        {"connected datagrams", [&] { return socket(AF_UNIX, SOCK_DGRAM | connected); }, {125, 0}},
        {"a socket of no peer", [&] { return socket(AF_UNIX, SOCK_STREAM); }, {125, 0}},
        {"a socket of the network", [&] { return socket(AF_INET, SOCK_STREAM); }, {125, 0}},
        {"a stream", [&] { return socket(AF_UNIX, SOCK_STREAM | connected); }, {0, 0}},
        {"a file", [] { return ::open("/etc/passwd", O_RDONLY); }, {0, 0}},
    };
    for (const auto& row : rows)
        for (const bool host : {false, true}) {
            Program run(launcher.words(notes, {"--network", host ? "host" : "none", "--", "true"}),
                        [&] { return ::dup2(row.open(), STDIN_FILENO) == 0; });
            EXPECT_EQ(run.wait(), row.exitCodes[host ? 1 : 0]) << row.what << ": " << run.said();
        }
    Program run(launcher.words(notes, {"--", "true"}),
                [] { return ::dup2(::open("/", O_RDONLY), STDOUT_FILENO) == 1; });
    expectEnd(run, 125, "standard output is a directory");
    EXPECT_EQ(launcher.run(notes, {"--network", "host", "--", "readlink", "/proc/self/ns/net"}).output,
              files::read_symlink("/proc/self/ns/net").string() + "\n");
}

// Goal: a container that only this process does not see is not taken for one that is gone. Method: a mount namespace
// that hides the homes, as a unit may ask for.
TEST(Run, HomesThatTheUnitHides) {
    ZOR_NEEDS_SANDBOX();
    const Launcher launcher;
    const std::string hide = "mount -t tmpfs none " + launcher.daemon.path("private/var/mobile") + " && exec \"$@\"";
    const auto outcome =
        runProgram(Words{"/usr/bin/unshare", "-m", "sh", "-c", hide, "sh"} + launcher.words(notes, {"--", "true"}));
    expectOutcome(outcome, 125, "the mount namespace of this process");
    EXPECT_EQ(outcome.output.find("delete"), std::string::npos) << outcome.output;
}

// Goal: nothing is used that is not registered, and the error says how to register it. Method: a table of choices, the
// mounts of each as a dry run tells them.
TEST(Run, OnlyWhatIsRegistered) {
    if (::geteuid() != 0)
        GTEST_SKIP() << "needs root";
    Launcher launcher;
    launcher.setGroups(notes, {"group.a", "group.b"}, true);
    struct Row {
        std::string identifier;
        Words words;
        int exitCode;
        Words says;
        Words saysNot;
    };
    const Row rows[] = {
        {notes, {}, 0, {"group.a", "group.b", "/Data/System/", "/Data/Application/"}, {"group.shared"}},
        {notes, {"--app-group", "group.b"}, 0, {"group.b", "/Data/System/"}, {"group.a"}},
        {notes, {"--system-container", notes}, 0, {"/Data/System/"}, {}},
        {notes,
         {"--app-group", "group.shared"},
         125,
         {"group.shared is no application group", "entitlements set " + notes + " --app-group group.shared"},
         {}},
        {notes, {"--system-group", "systemgroup.x"}, 125, {"no system group", "--system-group systemgroup.x"}, {}},
        {notes, {"--system-container", maps}, 125, {"cannot be given"}, {}},
        {maps, {"--system-container", maps}, 125, {"entitlements set " + maps + " --system-container"}, {}},
        {maps, {}, 0, {"group.shared"}, {"/Data/System/"}},
        {"org.example.unknown", {}, 0, {"/Data/Application/"}, {"/Shared/", "/Data/System/"}},
    };
    for (const Row& row : rows) {
        for (const char* form : {"--dry-run", "--json"}) {
            const auto outcome =
                launcher.run(row.identifier, row.words + Words{"--dry-run", form, "--", "no-such-program"});
            EXPECT_EQ(outcome.exitStatus, row.exitCode) << outcome.output;
            for (const std::string& text : row.says)
                EXPECT_NE(outcome.output.find(text), std::string::npos) << text << " in " << outcome.output;
            for (const std::string& text : row.saysNot)
                EXPECT_EQ(outcome.output.find(text), std::string::npos) << text << " in " << outcome.output;
        }
    }
    // Asking has not made containers that nothing refers to.
    EXPECT_TRUE(launcher.daemon.client().list(7, 501, false).value().size() == 3);
    EXPECT_EQ(launcher.daemon.client().list(12, 499, false).value().size(), 1U);
    EXPECT_EQ(launcher.daemon.client().list(13, 499, false).value().size(), 0U);
}

// Goal: a launcher that the daemon does not know, or not as the kernel's agent, is told so. Method: registry entries.
TEST(Run, TheDaemonHasToKnowTheLauncher) {
    if (::geteuid() != 0)
        GTEST_SKIP() << "needs root";
    const std::pair<const char*, const char*> rows[] = {
        {"<key>KernelAgent</key><true/>", "register this program"},
        {"<key>Entitlements</key><dict/>", "KernelAgent"},
        {"<key>KernelAgent</key><true/><key>Entitlements</key><dict/><key>UserIDs</key><array><integer>7</integer>"
         "</array>",
         "register this program"},
    };
    for (const auto& [entry, says] : rows) {
        const Launcher launcher(entry);
        expectOutcome(launcher.run(notes, {"--", "true"}), 125, says);
    }
}

// Goal: what is mounted is the container that was checked, even when its name leads elsewhere by then. Method: a maker
// of sandboxes that swaps the container for a link, or another directory, before it does its work.
TEST(Run, AContainerSwappedAfterTheCheck) {
    ZOR_NEEDS_SANDBOX();
    for (const char* swap : {"ln -s DIR/elsewhere", "mv DIR/elsewhere"}) {
        Launcher launcher;
        const std::string home = launcher.data(notes);
        const std::string elsewhere = launcher.daemon.path("elsewhere");
        files::create_directory(elsewhere);
        ASSERT_EQ(::chown(elsewhere.c_str(), 501, 501), 0);
        writeFile(elsewhere + "/which", "elsewhere");
        writeFile(home + "/which", "container");
        std::string put = swap;
        put.replace(put.find("DIR"), 3, launcher.daemon.root());
        const std::string maker = launcher.daemon.path("maker");
        writeFile(maker,
                  "#!/bin/sh\nmv '" + home + "' '" + home + ".old' && " + put + " '" + home +
                      "' || exit 1\nexec /usr/bin/bwrap \"$@\"\n",
                  0755);
        const auto outcome = launcher.run(notes, {"--bubblewrap", maker, "--", "cat", home + "/which"});
        EXPECT_EQ(outcome.output, "container") << swap;
        EXPECT_EQ(readFile(home + "/which"), "elsewhere") << "the swap took place";
    }
}

// Goal: a service manager hears of a program's state, from the launcher, and of nothing else. Method: a manager's
// socket, with too little room for what a program says that names another process and leaves a descriptor.
TEST(Run, TellsTheServiceManager) {
    ZOR_NEEDS_SANDBOX();
    Launcher launcher;
    const std::string path = launcher.daemon.path("manager");
    const platform::FileDescriptor manager(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    const sockaddr_un address = support::addressOf(path);
    ASSERT_EQ(::bind(manager.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    support::limitWaiting(manager.get());
    const int yes = 1;
    ASSERT_EQ(::setsockopt(manager.get(), SOL_SOCKET, SO_PASSCRED, &yes, sizeof yes), 0);
    const char* const script = R"(
import array, os, socket
manager = socket.socket(socket.AF_UNIX, socket.SOCK_DGRAM)
manager.connect(os.environ["NOTIFY_SOCKET"])
manager.sendmsg([b"MAINPID=1\nREADY=1\nFDSTORE=1\nSTATUS=" + os.environ["WATCHDOG_USEC"].encode()],
                [(socket.SOL_SOCKET, socket.SCM_RIGHTS, array.array("i", [0]))])
manager.send(b"BARRIER=1")
for number in range(600): manager.send(b"STATUS=%d" % number)
)";
    Program program(launcher.words(notes, {"--", "python3", "-c", script}), [&] {
        return ::setenv("NOTIFY_SOCKET", path.c_str(), 1) == 0 && ::setenv("WATCHDOG_USEC", "7", 1) == 0;
    });
    for (int number = -1; number < 600; ++number) {
        char text[256];
        alignas(cmsghdr) char control[CMSG_SPACE(sizeof(ucred))];
        iovec part{.iov_base = text, .iov_len = sizeof text};
        msghdr message{};
        message.msg_iov = &part;
        message.msg_iovlen = 1;
        message.msg_control = control;
        message.msg_controllen = sizeof control;
        const ssize_t bytes = ::recvmsg(manager.get(), &message, 0);
        ASSERT_GT(bytes, 0) << program.said();
        const std::string expected = number < 0 ? "READY=1\nSTATUS=7\n" : "STATUS=" + std::to_string(number) + "\n";
        ASSERT_EQ(std::string(text, static_cast<std::size_t>(bytes)), expected);
        ucred sender{};
        std::memcpy(&sender, CMSG_DATA(CMSG_FIRSTHDR(&message)), sizeof sender);
        ASSERT_EQ(sender.pid, program.pid());
        ASSERT_EQ(message.msg_flags & MSG_CTRUNC, 0);
    }
    EXPECT_EQ(program.wait(), 0) << program.said();
    Program without(launcher.words(notes, {"--", "true"}), [] { return ::setenv("NOTIFY_SOCKET", "/x", 1) == 0; });
    expectEnd(without, 125, "the service manager's socket /x cannot be reached");
}

// Goal: a directory to read is there, and only to read; the daemon's socket is such a one, so that a program can be a
// client. Method: a program that lies in one, and the tool.
TEST(Run, DirectoriesToRead) {
    ZOR_NEEDS_SANDBOX();
    Launcher launcher;
    const std::string code = launcher.daemon.path("opt");
    files::create_directory(code);
    writeFile(code + "/program", "#!/bin/sh\necho \"$@\"; touch " + code + "/x 2>/dev/null && echo written\n", 0755);
    const auto outcome = launcher.run(notes, {"--read-only", code, "--", code + "/program", "--user", "1"});
    EXPECT_EQ(outcome.exitStatus, 1);
    EXPECT_EQ(outcome.output, "--user 1\n");
    files::copy_file(programPath("zorvanectl"), code + "/zorvanectl");
    expectOutcome(launcher.run(notes, {"--read-only", code, "--read-only", launcher.daemon.path("run/zorvane"), "--",
                                       code + "/zorvanectl", "--root", launcher.daemon.root(), "status"}),
                  0, "EffectiveUserID: 501");
}

} // namespace zor::whole
