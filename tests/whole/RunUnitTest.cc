// SPDX-License-Identifier: Apache-2.0
// zorvane-run as the main process of a unit: the states that settings of the unit make, signals, passed sockets, and
// its words to the service manager. Real daemon, real sandboxes.
#include "os/SystemCallFilter.h"
#include "process/Relay.h"
#include "support/Frames.h"
#include "whole/Launcher.h"

#include <csignal>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <sstream>
#include <sys/epoll.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>

namespace zor::whole {

namespace {

/// In a mount namespace of its own, after these commands.
Words mounts(const std::string& commands) {
    return {"/usr/bin/unshare", "-m", "sh", "-c", commands + " && exec \"$@\"", "sh"};
}

Words capabilities(const std::string& set) {
    return {"/usr/bin/setpriv", "--bounding-set", set};
}

std::function<bool()> refused(int call) {
    return [call] {
        platform::SystemCallFilter filter;
        filter.refuse(call, EPERM);
        return ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 && filter.layOn(platform::SystemCallFilter::Rest::allowed);
    };
}

/// The first of a pair of sockets, or a single one.
int socketOf(int domain, int type, bool connected = false) {
    int pair[2] = {-1, -1};
    if (connected)
        (void)!::socketpair(domain, type, 0, pair);
    else
        pair[0] = ::socket(domain, type, 0);
    return pair[0];
}

} // namespace

// Goal: each row of the table of unit settings in docs/applications.md is true. Method: the state that the setting
// makes, around a launcher whose program looks for what the setting is to do, or not to do, to it.
TEST(RunInAUnit, Settings) {
    ZOR_NEEDS_SANDBOX();
    Launcher launcher;
    const std::string root = launcher.daemon.root();
    const std::string home = launcher.daemon.path("private/var/mobile");
    const std::string needed = "-all,+dac_override,+sys_admin,+net_admin,+setuid,+setgid,+setpcap";
    const std::string devices =
        "mount -t tmpfs none /mnt && mkdir /mnt/shm /mnt/pts && for n in null zero full random urandom tty; do touch "
        "/mnt/$n; mount --bind /dev/$n /mnt/$n; done && mount --bind /dev/shm /mnt/shm && mount --move /mnt /dev";
    const std::string etc = root + "/etc.copy";
    const std::string link = "cp -a /etc " + etc + " && mount --bind " + etc + " /etc && mount -t tmpfs none /run && " +
                             "ln -sf ../run/there/resolv.conf /etc/resolv.conf && mkdir /run/here && "
                             "echo nameserver > /run/here/resolv.conf && ";
    const Words host = {"--network", "host"};
    const struct {
        const char* setting;
        Words state;
        Words words; // the launcher's
        const char* script;
        int exitCode = 0;
        const char* says = "";
        std::function<bool()> prepare = {};
    } rows[] = {
        {"User=", {"/usr/bin/setpriv", "--reuid", "501", "--clear-groups"}, {}, "true", 125, "needs root"},
        {"SupplementaryGroups=", {"/usr/bin/setpriv", "--groups", "4"}, {}, "test \"$(id -G)\" = 501"},
        {"CapabilityBoundingSet=", capabilities(needed), {}, "true"},
        {"without CAP_SYS_ADMIN", capabilities("-sys_admin"), {}, "true", 125, "CAP_SYS_ADMIN"},
        {"without CAP_NET_ADMIN", capabilities("-net_admin"), {}, "true", 125, "CAP_NET_ADMIN"},
        {"NoNewPrivileges=", {"/usr/bin/setpriv", "--no-new-privs"}, {}, "true"},
        {"RestrictNamespaces=", {}, {}, "true", 125, "cannot be made: unshare", refused(SYS_unshare)},
        {"SystemCallFilter=", {}, {}, "true", 125, "restrict namespaces", refused(SYS_mount)},
        {"PrivateTmp=", mounts("mount -t tmpfs none /tmp"), {}, "touch /tmp/x"},
        {"PrivateDevices=", mounts(devices), {}, "head -c 1 /dev/urandom > /dev/null"},
        {"ProtectHome=", mounts("mount -t tmpfs none " + home), {}, "true", 125, "the mount namespace of this process"},
        {"ProtectSystem=full", mounts("mount --bind /usr /usr && mount -o remount,ro,bind /usr"), {}, "touch $HOME/x"},
        {"ProtectSystem=strict",
         mounts("mount --bind " + root + " " + root + " && mount -o remount,ro,bind " + root),
         {},
         "true",
         125,
         "read-only"},
        {"ProcSubset=pid", mounts("mount -t proc -o subset=pid proc /proc"), {}, "true", 125, "said why above"},
        {"ProtectProc=", mounts("mount -t proc -o hidepid=invisible proc /proc"), {}, "test -e /proc/stat"},
        {"PrivateNetwork=", {"/usr/bin/unshare", "-n"}, host, "test $(grep -c : /proc/net/dev) = 1"},
        {"PrivateIPC=", {"/usr/bin/unshare", "-i", "-u"}, {}, "true"},
        {"UMask=", {"/bin/sh", "-c", "umask 077; exec \"$@\"", "sh"}, {}, "test $(umask) = 0022"},
        {"WorkingDirectory=", {"/usr/bin/env", "-C", "/usr"}, {}, "test \"$(pwd) $PWD\" = \"$HOME $HOME\""},
        {"Environment=", {"/usr/bin/env", "A=1", "B=1"}, {"--setenv", "A=b=c"}, "test \"$A $B\" = 'b=c '"},
        {"LimitNOFILE=", {"/usr/bin/prlimit", "--nofile=64"}, {}, "test $(ulimit -n) = 64"},
        {"Nice=", {"/usr/bin/nice", "-n", "3"}, {}, "test $(nice) = 3"},
        {"OOMScoreAdjust=", {"/usr/bin/choom", "-n", "7", "--"}, {}, "test $(cat /proc/self/oom_score_adj) = 7"},
        {"resolv.conf", mounts(link + "mv /run/here /run/there"), host,
         "grep -q name /etc/resolv.conf && ! echo > /etc/resolv.conf && test \"$(find /run -type f)\" = "
         "/run/there/resolv.conf"},
        {"resolv.conf behind a link", mounts(link + "ln -s here /run/there"), host, "! cat /etc/resolv.conf"},
        {"resolv.conf without a network", mounts(link + "mv /run/here /run/there"), {}, "! cat /etc/resolv.conf"},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.setting);
        Program run(row.state + launcher.words(notes, row.words + Words{"--", "sh", "-c", row.script}), row.prepare);
        expectEnd(run, row.exitCode, row.says);
        files::remove_all(etc);
    }
    // MemoryMax= and the like are the control group's.
    EXPECT_EQ(launcher.shell(notes, "cat /proc/self/cgroup").output, readFile("/proc/self/cgroup"));
}

// Goal: no standard descriptor leads out of the sandbox, nor does a passed one, and those of a socket unit reach the
// program where an entry allows it. Method: a table of what is given as standard input and as the one passed, without
// and with the host's network; a client of a socket that listens.
TEST(RunInAUnit, Descriptors) {
    ZOR_NEEDS_SANDBOX();
    Launcher launcher;
    const std::string path = launcher.daemon.path("listener");
    const int listener = ::socket(AF_UNIX, SOCK_STREAM, 0);
    ASSERT_TRUE(support::bindTo(listener, path));
    ASSERT_EQ(::listen(listener, 1), 0);
    const std::string fifo = launcher.daemon.path("fifo");
    ASSERT_EQ(::mkfifo(fifo.c_str(), 0666), 0);
    const auto start = [&](const Words& words, int passed, bool toIt = true, const std::string& root = "") {
        const Words at = root.empty() ? Words() : Words{"--root", root};
        return Program(launcher.words(notes, at + words), [=] {
            const std::string process = std::to_string(::getpid() + (toIt ? 0 : 1));
            return ::dup2(passed, 3) == 3 && ::fcntl(3, F_SETFD, 0) == 0 &&
                   ::setenv("LISTEN_PID", process.c_str(), 1) == 0 && ::setenv("LISTEN_FDS", "1", 1) == 0 &&
                   ::setenv("LISTEN_FDNAMES", "web", 1) == 0;
        });
    };
    launcher.daemon.registerProgram("40-maps", "/usr/bin/true", "<key>PassedSockets</key><true/>", maps);
    Program notAllowed = start({"--", "true"}, listener);
    expectEnd(notAllowed, 125, "no entry of the registry allows that");
    Program another =
        start({"--", "sh", "-c", "test -z \"$LISTEN_FDS\" && test ! -e /proc/self/fd/3"}, listener, false);
    expectEnd(another, 0, "");
    launcher.daemon.registerProgram("40-notes", "/usr/bin/true", "<key>PassedSockets</key><true/>", notes);
    const Relay older(
        launcher.daemon, [](ipc::Command) { return Fate::passedOn; },
        [](Relay::Message, plist::Dictionary& message) { message.erase(ipc::keys::replyPassedSockets); });
    Program untold = start({"--", "true"}, listener, true, older.root());
    expectEnd(untold, 125, "does not say whether that is allowed");
    const struct {
        const char* what;
        int fd;
        int exitCodes[4]; // as standard input, and passed; then with the host's network
    } rows[] = {
        {"a directory", ::open("/etc", O_RDONLY), {125, 125, 125, 125}},
        {"a place", ::open("/etc", O_PATH), {125, 125, 125, 125}},
        {"an epoll", ::epoll_create1(0), {125, 125, 125, 125}},
        {"datagrams", socketOf(AF_UNIX, SOCK_DGRAM), {125, 125, 0, 0}},
        {"a socket of no peer", socketOf(AF_UNIX, SOCK_STREAM), {125, 125, 0, 0}},
        {"a socket of the network", socketOf(AF_INET, SOCK_STREAM), {125, 125, 0, 0}},
        {"a packet socket", socketOf(AF_PACKET, SOCK_RAW), {125, 125, 0, 125}},
        {"a stream", socketOf(AF_UNIX, SOCK_STREAM, true), {0, 0, 0, 0}},
        {"a socket that listens", listener, {125, 0, 0, 0}},
        {"a pipe with a name", ::open(fifo.c_str(), O_RDWR), {0, 0, 0, 0}},
        {"a file", ::open("/etc/passwd", O_RDONLY), {0, 125, 0, 125}},
    };
    const std::string looks = "test $LISTEN_PID = $$ && test \"$LISTEN_FDS $LISTEN_FDNAMES\" = '1 web' && "
                              "test \"$(ls /proc/self/fd | tr '\\n' ' ')\" = '0 1 2 3 4 '";
    for (const auto& row : rows)
        for (const bool host : {false, true}) {
            const Words network = {"--network", host ? "host" : "none", "--"};
            Program standard(launcher.words(notes, network + Words{"true"}), [&] { return ::dup2(row.fd, 0) == 0; });
            EXPECT_EQ(standard.wait(), row.exitCodes[host ? 2 : 0]) << row.what << ": " << standard.said();
            Program passed = start(network + Words{"sh", "-c", looks}, row.fd);
            EXPECT_EQ(passed.wait(), row.exitCodes[host ? 3 : 1]) << row.what << ": " << passed.said();
        }
    Program serving =
        start({"--", "python3", "-c", "import socket; socket.socket(fileno=3).accept()[0].send(b'hello')"}, listener);
    const platform::FileDescriptor client(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    ASSERT_TRUE(support::connectTo(client.get(), path));
    char text[8] = {};
    EXPECT_EQ(::recv(client.get(), text, sizeof text, 0), 5);
    expectEnd(serving, 0, "");
    for (const auto& row : rows)
        ::close(row.fd);
    Program toDirectory(launcher.words(notes, {"--", "true"}), [] { return ::dup2(::open("/", O_RDONLY), 1) == 1; });
    expectEnd(toDirectory, 125, "standard output is a directory");
    EXPECT_EQ(launcher.run(notes, {"--network", "host", "--", "readlink", "/proc/self/ns/net"}).output,
              files::read_symlink("/proc/self/ns/net").string() + "\n");
}

// Goal: the exit code and the signals are the program's own, and it does not outlive the launcher. Method: a table of
// ends; then real signals to the launcher, while the program waits for them.
TEST(RunInAUnit, ExitCodesAndSignals) {
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
    // A manager may send a signal to all processes of the control group.
    files::remove(ready);
    Program all(launcher.words(notes, {"--", "sh", "-c", "trap 'exit 6' TERM; " + wait}));
    EXPECT_TRUE(eventually([&] { return files::exists(ready); }));
    const std::function<void(pid_t)> terminate = [&](pid_t process) {
        const std::string number = std::to_string(process);
        std::istringstream children(readFile("/proc/" + number + "/task/" + number + "/children"));
        ::kill(process, SIGTERM);
        for (pid_t child = 0; children >> child;)
            terminate(child);
    };
    terminate(all.pid());
    EXPECT_EQ(all.wait(), 6) << all.said();
    // A signal that comes before there is a program ends the program at its beginning.
    const std::string maker = launcher.daemon.path("maker");
    writeFile(maker, "#!/bin/sh\ntouch " + ready + "\nsleep 0.3\nexec /usr/bin/bwrap \"$@\"\n", 0755);
    EXPECT_EQ(signalled({"--bubblewrap", maker, "--", "sleep", "60"}, SIGTERM).exitStatus, 128 + SIGTERM);
}

// Goal: at whatever moment the launcher is killed, nothing that it started is left. Method: a pipe that all of them
// hold open ends; the launcher is killed at many moments of its beginning, and with a maker that has children and sees
// to nothing.
TEST(RunInAUnit, NothingOutlivesTheLauncher) {
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

// Goal: a service manager hears of a program's state, from the launcher, and of nothing else. Method: a manager's
// socket, with too little room for what a program says that names another process and leaves a descriptor.
TEST(RunInAUnit, TellsTheServiceManager) {
    ZOR_NEEDS_SANDBOX();
    Launcher launcher;
    const std::string path = launcher.daemon.path("manager");
    const platform::FileDescriptor manager(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    ASSERT_TRUE(support::bindTo(manager.get(), path));
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

} // namespace zor::whole
