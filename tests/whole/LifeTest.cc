// SPDX-License-Identifier: Apache-2.0
// The daemon's life as its users see it: started twice, told to stop, kept short.
#include "process/DaemonProcess.h"
#include "support/Frames.h"
#include "whole/Expect.h"

#include <filesystem>
#include <poll.h>
#include <sched.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <thread>
#include <tuple>
#include <unistd.h>

namespace zor::whole {

// Goal: one daemon a root, an end on request, start-up errors that say what to do; and the unit's fences are there.
TEST(Life, SecondDaemonAndSigtermAndBrokenCommandLines) {
    DaemonProcess daemon;
    std::filesystem::create_directories(daemon.path("run/zorvane/zorvaned.status/occupied"));
    daemon.start();
    const std::string fenced = "Seccomp:\t" + std::to_string(daemon.fences().hasFilter() ? 2 : 0);
    EXPECT_NE(readFile("/proc/" + std::to_string(daemon.pid()) + "/status").find(fenced), std::string::npos);
    EXPECT_NE(daemon.log().find("No status socket: "), std::string::npos); // a help, not a service
    expectOutcome(runProgram({programPath("zorvaned"), "--root", daemon.root()}), 1, "zorvaned: ");
    EXPECT_EQ(daemon.terminate(), 0);
    const std::tuple<const char*, const char*, int> mistakes[] = {{"--containers-per-user", "1x", 2},
                                                                  {"--root", "/nowhere", 1},
                                                                  {"--log-level", "8", 2},
                                                                  {"--log-level", "", 2},
                                                                  {"--nonsense", "1", 2},
                                                                  {"--", "start", 2},
                                                                  {"--version", "--nonsense", 0},
                                                                  {"--help", "", 0}};
    for (const auto& [option, value, status] : mistakes)
        EXPECT_EQ(runProgram({programPath("zorvaned"), option, value}).exitStatus, status) << option;
}

// Goal: a service manager hears what the daemon is at, that it is ready when it serves, and not before, that it lives,
// and that it ends. Method: a manager's socket; a client that asks as soon as it is told.
TEST(Life, TellsTheServiceManager) {
    DaemonProcess daemon;
    const std::string path = daemon.path("manager");
    const platform::FileDescriptor manager(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    ASSERT_TRUE(support::bindTo(manager.get(), path));
    support::limitWaiting(manager.get());
    // The first message that does not begin so.
    const auto hearsBehind = [&](const std::string& passed) {
        for (;;) {
            char text[256];
            const ssize_t bytes = ::recv(manager.get(), text, sizeof text, 0);
            const std::string message(text, bytes > 0 ? static_cast<std::size_t>(bytes) : 0);
            if (!message.starts_with(passed))
                return message;
        }
    };
    std::jthread asks([&] {
        EXPECT_TRUE(hearsBehind("-").starts_with("EXTEND_TIMEOUT_USEC="));
        EXPECT_EQ(hearsBehind("EXTEND_TIMEOUT_USEC="), "READY=1");
        auto client = zorvane::Client::connect(daemon.connection());
        EXPECT_TRUE(client && client->createOrLookup(dataContainer("org.example.told")));
        EXPECT_TRUE(hearsBehind("-").starts_with("WATCHDOG=1\nSTATUS=Serving " + daemon.root() + ": "));
    });
    daemon.start({}, [&] {
        return ::setenv("NOTIFY_SOCKET", path.c_str(), 1) == 0 && ::setenv("WATCHDOG_USEC", "400000", 1) == 0;
    });
    asks.join();
    EXPECT_EQ(daemon.terminate(), 0);
    EXPECT_TRUE(hearsBehind("WATCHDOG=1").starts_with("STOPPING=1\nSTATUS="));
}

// Goal: a daemon that would take its clients for other processes does not start, and says why. Method: the /proc of
// outside in a pid namespace of its own.
TEST(Life, TheProcOfAnotherPidNamespace) {
    constexpr int cannot = 99;
    const DaemonProcess place;
    Program daemon({programPath("zorvaned"), "--root", place.root()}, [] {
        const pid_t inner = ::unshare(CLONE_NEWPID) == 0 ? ::fork() : -1;
        int status = 0;
        if (inner != 0)
            ::_exit(::waitpid(inner, &status, 0) == inner ? WEXITSTATUS(status) : cannot);
        ::alarm(10);
        return true;
    });
    if (daemon.wait() == cannot)
        GTEST_SKIP() << "needs root and pid namespaces";
    EXPECT_NE(daemon.said().find("zorvaned: /proc is not mounted or belongs to another pid namespace"),
              std::string::npos)
        << daemon.said();
}

// Goal: where there are few descriptors, users that hold all the connections that they get shut out neither root, nor
// the upcall, nor the status. Method: three users connect as often as the daemon has descriptors.
TEST(Life, FewDescriptorsAreShared) {
    constexpr rlim_t descriptors = 512;
    if (::geteuid() != 0)
        GTEST_SKIP() << "needs root: it connects under other uids";
    const rlimit few{.rlim_cur = descriptors, .rlim_max = descriptors};
    DaemonProcess daemon;
    daemon.start({}, [&] { return ::setrlimit(RLIMIT_NOFILE, &few) == 0; });
    const auto connect = [&](uid_t uid, int type, const std::string& name) {
        platform::FileDescriptor socket(::socket(AF_UNIX, type | SOCK_CLOEXEC, 0));
        (void)::syscall(SYS_setresuid, -1, uid, -1);
        const bool connected = support::connectTo(socket.get(), daemon.path("run/zorvane/" + name));
        (void)::syscall(SYS_setresuid, -1, 0, -1);
        EXPECT_TRUE(connected) << errno;
        return socket;
    };
    std::vector<platform::FileDescriptor> idle;
    for (const uid_t uid : {501U, 502U, 100'000U})
        for (rlim_t i = 0; i < descriptors; ++i)
            idle.push_back(connect(uid, SOCK_STREAM, "com.veltra.zorvaned"));
    zorvane::Client client = daemon.client();
    EXPECT_TRUE(client.createOrLookup(dataContainer("a")));
    EXPECT_GT(daemon.counter("Connections"), 3 * 16);
    const platform::FileDescriptor agent = connect(0, SOCK_SEQPACKET, "com.veltra.zorvaned.upcall");
    pollfd refused{.fd = agent.get(), .events = POLLIN, .revents = 0};
    EXPECT_EQ(::poll(&refused, 1, 100), 0) << "the upcall's connection was closed";
}

// Goal: a file that may not grow any further is an error that is told, by the daemon and by the tool, and no end.
TEST(Life, FilesThatMayNotGrow) {
    constexpr rlim_t bytes = 16'384;
    const rlimit small{.rlim_cur = bytes, .rlim_max = RLIM_INFINITY};
    DaemonProcess daemon;
    daemon.start();
    zorvane::Client client = daemon.client();
    const auto made = client.createOrLookup(dataContainer("a"));
    ASSERT_TRUE(made);
    ASSERT_EQ(::prlimit(daemon.pid(), RLIMIT_FSIZE, &small, nullptr), 0);
    const auto set = client.setInfoValue({dataApplication, mobile, "a", made->uuid}, "k", {{std::string(bytes, 'x')}});
    ASSERT_FALSE(set);
    EXPECT_EQ(set.error().code, 34U);
    EXPECT_NE(daemon.log().find(std::strerror(EFBIG)), std::string::npos);
    EXPECT_TRUE(client.createOrLookup(dataContainer("b")));
    std::filesystem::create_directory(daemon.path("tmp/source"));
    writeFile(daemon.path("tmp/source/large"), std::string(2 * bytes, 'x'));
    Program tool(daemon.toolWords({"install", "--class", "2", "c", daemon.path("tmp/source")}),
                 [&] { return ::setrlimit(RLIMIT_FSIZE, &small) == 0; });
    EXPECT_LT(tool.wait(), 128);
    EXPECT_NE(tool.said().find(std::strerror(EFBIG)), std::string::npos) << tool.said();
}

} // namespace zor::whole
