// SPDX-License-Identifier: Apache-2.0
// The things that a program finds in its sandbox, and those that keep it from being started: a real daemon, real
// containers, real sandboxes.
#include "whole/Launcher.h"

#include <algorithm>
#include <fcntl.h>
#include <sys/file.h>

namespace zor::whole {

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
        {{"--setenv", "LD_PRELOAD=/x.so", "sh"}, 125, "gives that name a meaning"},
        {{"--setenv", "HOME=/", "sh"}, 125, "gives that name a meaning"},
        {{"--setenv", "DEBUG", "sh"}, 125, "NAME=VALUE"},
        {{"--identifier", "a.b", "--user", "501", "--"}, 125, "no program"},
        {{"--nothing", "sh"}, 125, "is no option"},
        {{"--inside", "0", "0", "none", "0", "sh"}, 125, "itself"},
        {{"--identifier", "a.b", "--user", "501", "--root", empty.path(), "sh", "--user"}, 125, "What to do: "},
    };
    for (const auto& [words, exitCode, says] : rows)
        expectOutcome(runProgram(Words{programPath("zorvane-run")} + words), exitCode, says);
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
        "! ls /home && ! ls /root && ! ls /sys && test -z \"$(find /var /run -mindepth 1)\"",
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
        "bash -c ': >/dev/udp/127.0.0.1/9 && : >/dev/udp/::1/9'",
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
// of sandboxes that swaps the container for a link, or another directory, once it was told what to do.
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
        const std::string told = launcher.daemon.path("told");
        writeFile(maker,
                  "#!/bin/bash\ncat <&$2 >" + told + "\nmv '" + home + "' '" + home + ".old' && " + put + " '" + home +
                      "' || exit 1\nexec /usr/bin/bwrap --args 99 \"${@:3}\" 99<" + told + "\n",
                  0755);
        const auto outcome = launcher.run(notes, {"--bubblewrap", maker, "--", "cat", home + "/which"});
        EXPECT_EQ(outcome.output, "container") << swap;
        EXPECT_EQ(readFile(home + "/which"), "elsewhere") << "the swap took place";
    }
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
