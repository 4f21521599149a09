// SPDX-License-Identifier: Apache-2.0
// Ways in which a process could pass for another: a mount namespace of its own, the number of one that has ended.
// "agent" is registered, "other" is not.
#include "platform/PeerProcess.h"

#include <sched.h>
#include <sys/mount.h>

namespace zor::platform {
namespace {

/// In a mount namespace of the process alone, `shown` stands at the path `at`.
bool putOver(const std::string& at, const std::string& shown) {
    return ::unshare(CLONE_NEWNS) == 0 && ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
           ::mount(shown.c_str(), at.c_str(), nullptr, MS_BIND, nullptr) == 0;
}

bool canMount(const PeerWorld& world) {
    const pid_t child = ::fork();
    if (child == 0)
        ::_exit(putOver(world.program("agent"), world.program("other")) ? 0 : 1);
    int status = 1;
    ::waitpid(child, &status, 0);
    return status == 0;
}

// A peer is judged by the file that it runs, not by the name that this has in a mount namespace of the peer's own.
TEST(PeerThreat, NamesInAnotherMountNamespace) {
    PeerWorld world;
    world.registerAs("agent.plist", "agent", "agent");
    if (::geteuid() != 0 || !canMount(world))
        GTEST_SKIP() << "needs root and a root that is a mount point: mounts in a namespace of their own";
    const auto judged = [&](const std::string& at, const std::string& shown) {
        const PeerProcess process(world.server, at, {.prepare = [&] { return putOver(at, shown); }, .runs = shown});
        return who(*world.peerOf(process));
    };
    EXPECT_EQ(judged(world.program("agent"), world.program("other")), "-");
    EXPECT_EQ(judged(world.program("other"), world.program("agent")), "agent");
}

// Who gets the number of a process that has ended gets nothing else of it, whether that one was accepted before or
// never.
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

} // namespace
} // namespace zor::platform
