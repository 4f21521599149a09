// SPDX-License-Identifier: Apache-2.0
// Ways in which a process could pass for another: a mount namespace of its own, the number of one that has ended or of
// another pid namespace, a set-ID program executed on a connection.
// "agent" is registered, "other" is not.
#include "identity/PeerProcess.h"

#include <sched.h>
#include <sys/mount.h>
#include <sys/prctl.h>

namespace zor::platform {
namespace {

/// In a mount namespace of the process alone, `shown` stands at the path `at`.
bool putOver(const std::string& at, const std::string& shown) {
    return ::unshare(CLONE_NEWNS) == 0 && ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
           ::mount(shown.c_str(), at.c_str(), nullptr, MS_BIND, nullptr) == 0;
}

/// The exit status of a child.
int exitStatusOf(pid_t child) {
    int status = 0;
    ::waitpid(child, &status, 0);
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

// A peer is judged by the file that it runs, not by the name that this has in a mount namespace of the peer's own.
TEST(PeerThreat, NamesInAnotherMountNamespace) {
    PeerWorld world;
    world.registerAs("agent.plist", "agent", "agent");
    const pid_t tries = ::fork();
    if (tries == 0)
        ::_exit(::geteuid() == 0 && putOver(world.program("agent"), world.program("other")) ? 0 : 1);
    if (exitStatusOf(tries) != 0)
        GTEST_SKIP() << "needs root and a root that is a mount point: mounts in a namespace of their own";
    const auto judged = [&](const std::string& at, const std::string& shown) {
        const PeerProcess process(world.server, at, {.prepare = [&] { return putOver(at, shown); }, .runs = shown});
        return who(*world.peerOf(process));
    };
    EXPECT_EQ(judged(world.program("agent"), world.program("other")), "-");
    EXPECT_EQ(judged(world.program("other"), world.program("agent")), "agent");
}

// A process that gets the number of one that has ended gets nothing else of it, whether that one was accepted before
// or never.
TEST(PeerThreat, ANumberThatIsUsedAgain) {
    using Connects = PeerStart::Connects;
    PeerWorld world;
    world.registerAs("agent.plist", "agent", "agent");
    for (const bool acceptedBefore : {true, false}) {
        SCOPED_TRACE(acceptedBefore);
        PeerProcess first(world.server, world.program(acceptedBefore ? "agent" : "other"),
                          {.connects = acceptedBefore ? Connects::andIsAccepted : Connects::yes});
        const pid_t number = first.pid();
        auto peer = acceptedBefore ? world.peerOf(first) : nullptr;
        EXPECT_TRUE(!peer || who(*peer) == "agent");
        first.end();
        const PeerProcess second(world.server, world.program("agent"), {.connects = Connects::no, .number = number});
        if (second.pid() != number)
            GTEST_SKIP() << "the kernel does not let this user choose process numbers";
        const FileDescriptor accepted = acceptedBefore ? FileDescriptor() : world.server.accept();
        if (!acceptedBefore)
            peer = world.identity.peerOfSocket(accepted.get());
        ASSERT_TRUE(peer);
        EXPECT_EQ(peer->pid(), number);
        EXPECT_EQ(who(*peer), "-");
    }
}

// A set-group-ID program that is executed after the connect, though before the accept, has no powers on that
// connection; one that ran before has, also when it gave its group up first.
TEST(PeerThreat, AProgramThatGivesAGroup) {
    constexpr uid_t user = 501;
    constexpr gid_t given = 499;
    if (::geteuid() != 0)
        GTEST_SKIP() << "needs root: a program of another group";
    PeerWorld world;
    world.registerAs("sleeper.plist", "sleeper", "sleeper");
    ASSERT_EQ(::chown(world.program("sleeper").c_str(), 0, given), 0);
    ASSERT_EQ(::chmod(world.program("sleeper").c_str(), 02755), 0);
    const auto judged = [&](const std::function<bool()>& prepare) {
        const PeerProcess process(world.server, world.program("sleeper"),
                                  {.uid = user, .prepare = prepare, .argument = "1000"});
        return who(*world.peerOf(process));
    };
    EXPECT_EQ(judged({}), "-");
    EXPECT_EQ(judged([] { return ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0; }), "sleeper");
    // Without a capability a process keeps no earlier group but this one.
    const PeerProcess process(world.server, world.program("sleeper"),
                              {.prepare = [] { return ::setresgid(given, given, given) == 0; }, .argument = "1000"});
    EXPECT_EQ(who(*world.peerOf(process)), "sleeper");
}

// A peer that executes another program while a process that it made still shares its address space is found out all
// the same, a moment later: the peer is this test, registered, which shares its memory with a child and becomes
// "other".
TEST(PeerThreat, AnAddressSpaceThatOutlivesTheProgram) {
    PeerWorld world;
    const std::string self = std::filesystem::read_symlink("/proc/self/exe");
    world.registerAs("self.plist", self, "self");
    int ends[2] = {};
    ASSERT_EQ(::pipe2(ends, O_CLOEXEC), 0);
    const FileDescriptor reading(ends[0]);
    FileDescriptor writing(ends[1]);
    alignas(16) static char stack[64 * 1024];
    const auto share = [&] {
        char byte = 0;
        const int connection = ::socket(AF_UNIX, SOCK_STREAM, 0);
        const auto sleeper = [](void*) { return ::prctl(PR_SET_PDEATHSIG, SIGKILL) + ::pause(); };
        return ::clone(sleeper, stack + sizeof stack, CLONE_VM, nullptr) > 0 && world.server.connect(connection) == 0 &&
               ::read(reading.get(), &byte, 1) == 1;
    };
    const PeerProcess process(world.server, world.program("other"),
                              {.connects = PeerStart::Connects::no, .prepare = share, .runs = self});
    const FileDescriptor accepted = world.server.accept();
    const auto peer = world.identity.peerOfSocket(accepted.get());
    EXPECT_TRUE(AddressSpace::isTold()) << "every message of a peer costs a look at its executable";
    EXPECT_EQ(who(*peer), "self");
    ASSERT_EQ(::write(writing.get(), "x", 1), 1);
    EXPECT_TRUE(eventually([&] { return who(*peer) == "-"; }));
}

// Numbers of another pid namespace are nobody's: the first process of one, which sees the /proc of outside, is not the
// first process there.
TEST(PeerThreat, NumbersOfAnotherPidNamespace) {
    enum { isNobody, isSomebody, cannot };
    PeerWorld world;
    std::error_code ignored;
    const std::string first = std::filesystem::read_symlink("/proc/1/exe", ignored);
    world.registerAs("first.plist", first, "first");
    const pid_t outer = ::fork();
    if (outer == 0) {
        if (::geteuid() != 0 || ::unshare(CLONE_NEWPID) != 0)
            ::_exit(cannot);
        const pid_t inner = ::fork();
        if (inner > 0)
            ::_exit(exitStatusOf(inner));
        const FileDescriptor client(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
        if (LinuxPeerIdentity::procIsOurs() || world.server.connect(client.get()) != 0)
            ::_exit(isSomebody);
        const FileDescriptor accepted = world.server.accept();
        const auto peer = world.identity.peerOfSocket(accepted.get());
        ::_exit(!peer || who(*peer) == "-" ? isNobody : isSomebody);
    }
    const int outcome = exitStatusOf(outer);
    if (outcome == cannot)
        GTEST_SKIP() << "needs root and pid namespaces";
    EXPECT_EQ(outcome, isNobody);
}

} // namespace
} // namespace zor::platform
