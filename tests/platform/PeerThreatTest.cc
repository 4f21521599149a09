// SPDX-License-Identifier: Apache-2.0
// Ways in which a process could pass for another: a mount namespace of its own, the number of one that has ended.
// Real processes that run copies of the shell.
#include "platform/PeerProcess.h"
#include "platform/linux/LinuxPeerIdentity.h"
#include "platform/linux/Names.h"
#include "support/RecordingLog.h"

#include <linux/sched.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/syscall.h>

namespace zor::platform {
namespace {

/// "agent" is registered, "other" is not.
struct World {
    World() {
        copyProgram("/bin/sh", agent);
        copyProgram("/bin/sh", other);
        test.replace(std::string(names::identityDirectory) + "/agent.plist",
                     "<plist version=\"1.0\"><dict><key>Identifier</key><string>agent</string><key>Executable</key>"
                     "<string>" +
                         agent + "</string></dict></plist>");
    }
    [[nodiscard]] std::string who(int socket) {
        const auto peer = identity.peerOfSocket(socket);
        return peer ? who(*peer) : "no peer";
    }
    static std::string who(Peer& peer) {
        const Identity now = peer.identify(Peer::Explain::no);
        return now.grant ? now.grant->identifier.value_or("") : "-";
    }

    TestRoot test;
    const std::string agent = test.path("agent");
    const std::string other = test.path("other");
    support::RecordingLog log;
    IdentityRegistry registry{test.root(), log, ::geteuid()};
    LinuxPeerIdentity identity{registry, ::geteuid()};
    PeerServer server;
};

enum class Connects { yes, no };

/// Becomes `program` and waits to be killed; before that it may change its world and connect.
class Process {
public:
    Process(const PeerServer& server, const std::string& program, Connects connects,
            const std::function<bool()>& prepare = {}, pid_t wantedPid = 0) {
        const FileDescriptor connection(::socket(AF_UNIX, SOCK_STREAM, 0));
        clone_args arguments{};
        arguments.exit_signal = SIGCHLD;
        if (wantedPid != 0) {
            arguments.set_tid = reinterpret_cast<std::uintptr_t>(&wantedPid);
            arguments.set_tid_size = 1;
        }
        pid_ = static_cast<pid_t>(::syscall(SYS_clone3, &arguments, sizeof arguments));
        if (pid_ != 0)
            return;
        const bool ready =
            (!prepare || prepare()) && (connects == Connects::no || server.connect(connection.get()) == 0);
        if (ready)
            ::execl(program.c_str(), program.c_str(), "-c", "kill -STOP $$", nullptr);
        ::_exit(1);
    }
    ~Process() { end(); }
    Process(const Process&) = delete;
    Process& operator=(const Process&) = delete;

    [[nodiscard]] pid_t pid() const { return pid_; }
    /// Waits until it runs the file that `program` names here.
    [[nodiscard]] bool runs(const std::string& program) const {
        return eventually([&] {
            struct stat wanted{};
            struct stat actual{};
            return ::stat(program.c_str(), &wanted) == 0 &&
                   ::stat(("/proc/" + std::to_string(pid_) + "/exe").c_str(), &actual) == 0 &&
                   wanted.st_ino == actual.st_ino && wanted.st_dev == actual.st_dev;
        });
    }
    void end() {
        if (pid_ <= 0)
            return;
        ::kill(pid_, SIGKILL);
        ::waitpid(pid_, nullptr, 0);
        pid_ = -1;
    }

private:
    pid_t pid_ = -1;
};

/// In a mount namespace of the process alone, `shown` stands at the path `at`.
bool putOver(const std::string& at, const std::string& shown) {
    return ::unshare(CLONE_NEWNS) == 0 && ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
           ::mount(shown.c_str(), at.c_str(), nullptr, MS_BIND, nullptr) == 0;
}

bool canMount(const World& world) {
    const pid_t child = ::fork();
    if (child == 0)
        ::_exit(putOver(world.agent, world.other) ? 0 : 1);
    int status = 1;
    ::waitpid(child, &status, 0);
    return status == 0;
}

// Goal: a peer is judged by the file that it runs, not by the name that this file has for it. Method: processes in
// mount namespaces of their own, where another program has the registered path, and the registered program another
// path.
TEST(PeerThreat, NamesInAnotherMountNamespace) {
    World world;
    if (::geteuid() != 0 || !canMount(world))
        GTEST_SKIP() << "needs root and a root that is a mount point: mounts in a namespace of their own";
    const auto connect = [&](const std::string& at, const std::string& shown) {
        Process process(world.server, at, Connects::yes, [&] { return putOver(at, shown); });
        const FileDescriptor accepted = world.server.accept();
        EXPECT_TRUE(process.runs(shown)) << shown << " at " << at;
        return world.who(accepted.get());
    };
    EXPECT_EQ(connect(world.agent, world.other), "-");
    EXPECT_EQ(connect(world.other, world.agent), "agent");
}

// Goal: who gets the number of a process that has ended gets nothing else of it. Method: the kernel is told to use the
// number again, for the registered program; its predecessor had connected, and was accepted before it ended, or never.
TEST(PeerThreat, ANumberThatIsUsedAgain) {
    World world;
    for (const bool acceptedBefore : {true, false}) {
        SCOPED_TRACE(acceptedBefore);
        Process first(world.server, acceptedBefore ? world.agent : world.other, Connects::yes);
        ASSERT_TRUE(first.runs(acceptedBefore ? world.agent : world.other));
        const pid_t number = first.pid();
        FileDescriptor accepted;
        std::unique_ptr<Peer> peer;
        if (acceptedBefore) {
            accepted = world.server.accept();
            peer = world.identity.peerOfSocket(accepted.get());
            ASSERT_EQ(World::who(*peer), "agent");
        }
        first.end();
        Process second(world.server, world.agent, Connects::no, {}, number);
        if (second.pid() != number)
            GTEST_SKIP() << "the kernel does not let this user choose process numbers";
        ASSERT_TRUE(second.runs(world.agent));
        if (!acceptedBefore) {
            accepted = world.server.accept();
            peer = world.identity.peerOfSocket(accepted.get());
        }
        ASSERT_TRUE(peer);
        EXPECT_EQ(peer->pid(), number);
        EXPECT_EQ(World::who(*peer), "-");
    }
}

} // namespace
} // namespace zor::platform
