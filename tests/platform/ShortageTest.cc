// SPDX-License-Identifier: Apache-2.0
// A process without descriptors, or without memory: what it could not look at it does not take for absent, and what one
// client's request lacked ends that client's connection and nothing else.
#include "base/BlockingScope.h"
#include "device/FileDeviceLockState.h"
#include "os/EpollRunLoop.h"
#include "os/Names.h"
#include "platform/ListenerWorld.h"
#include "platform/PeerProcess.h"
#include "service/ListenerPool.h"
#include "service/SeqpacketUpcallPort.h"
#include "service/StatusSocket.h"
#include "support/Allocations.h"
#include "support/FewDescriptors.h"

#include <functional>
#include <future>
#include <optional>

namespace zor::platform {
namespace {

// Goal: a registry that cannot be looked at holds what it held, and is looked at again. Method: a file changes while
// there is no descriptor, or one, which the directory takes.
TEST(WantOfDescriptors, TheRegistryHoldsWhatItHeld) {
    for (const rlim_t left : {0U, 1U}) {
        PeerWorld world;
        world.registerAs("a.plist", "agent", "old");
        const PeerProcess process(world.server, world.program("agent"));
        const auto peer = world.peerOf(process);
        ASSERT_TRUE(peer);
        EXPECT_EQ(who(*peer), "old");
        world.registerAs("next", "agent", "new");
        {
            const support::FewDescriptors few(left);
            ASSERT_EQ(::rename(world.test.path(PeerWorld::pathOf("next")).c_str(),
                               world.test.path(PeerWorld::pathOf("a.plist")).c_str()),
                      0);
            EXPECT_EQ(who(*peer), "old") << left;
            if (left == 0)
                ::usleep(1'100'000); // after a second everything is looked at, notice or not
            EXPECT_EQ(who(*peer), "old") << left;
        }
        EXPECT_TRUE(eventually([&] { return who(*peer) == "new"; })) << left;
    }
}

// Goal: a peer that cannot be pinned is refused, for it would be nobody as long as it is connected; one of which an
// entry's condition cannot be looked up is granted nothing, not what a later entry grants. Method: a process is looked
// at, and the kernel's agent accepted, with too few descriptors.
TEST(WantOfDescriptors, APeerIsRefusedAndNotMistaken) {
    PeerWorld world;
    world.registerAs("a.plist", "agent", "old");
    const PeerProcess process(world.server, world.program("agent"));
    for (const rlim_t left : {0U, 1U}) {
        const support::FewDescriptors few(left);
        EXPECT_FALSE(world.peerOf(process));
        EXPECT_EQ(errno, EMFILE);
    }
    EXPECT_EQ(who(*world.peerOf(process)), "old");
    world.registerAs("a-before.plist", "agent", "first", "<key>Unit</key><string>none.service</string>");
    const auto peer = world.peerOf(process);
    EXPECT_EQ(who(*world.peerOf(process)), "old");
    {
        const support::FewDescriptors none(0);
        EXPECT_EQ(who(*peer), "-");
    }
    EXPECT_EQ(who(*peer), "old");

    EpollRunLoop loop;
    SeqpacketUpcallPort port(world.test.root(), world.identity, {});
    ASSERT_EQ(port.checkIn(), 0);
    ASSERT_TRUE(port.serve(loop, [](const UpcallPacket&) { return std::vector<std::uint8_t>(); }));
    const FileDescriptor agent(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
    ASSERT_TRUE(
        connectTo(agent.get(), world.test.path(std::string(names::runtimeDirectory) + "/" + names::upcallSocket)));
    {
        const support::FewDescriptors few(1);
        loop.post([&] { loop.stop(); });
        loop.run();
    }
    char byte = 0;
    EXPECT_EQ(::recv(agent.get(), &byte, 1, MSG_DONTWAIT), 0);
}

// Goal: an unlock that is told while its file cannot be opened is not missed. Method: the file changes without a
// descriptor left, and never again.
TEST(WantOfDescriptors, AnUnlockIsSeenAfterwards) {
    const TestRoot test;
    const std::string directory = std::string(names::runtimeDirectory) + "/";
    EpollRunLoop loop;
    FileDeviceLockState state(test.root());
    std::atomic<int> seen{DeviceLockState::locked};
    test.write(directory + "next", "0");
    test.write(directory + names::lockState, "1");
    ASSERT_EQ(state.registerForChanges(loop, [&] { seen = state.currentState(); }), 0);
    std::thread runner([&] { loop.run(); });
    {
        const support::FewDescriptors none(0);
        EXPECT_EQ(::rename(test.path(directory + "next").c_str(), test.path(directory + names::lockState).c_str()), 0);
        EXPECT_TRUE(eventually([&] { return seen == FileDeviceLockState::unknown; }));
    }
    EXPECT_TRUE(eventually([&] { return seen == DeviceLockState::unlocked; }));
    loop.stop();
    runner.join();
}

// Goal: locks and unlocks are seen while the system gives no change notices, and notices are used as soon as it does.
// Method: a user namespace that allows none, in a process of its own.
TEST(WantOfNotices, AnUnlockIsSeenAllTheSame) {
    enum { good, notTold, notSeen, stillPolls, cannot };
    const TestRoot test;
    const std::string file = std::string(names::runtimeDirectory) + "/" + names::lockState;
    const pid_t child = ::fork();
    if (child == 0) {
        const auto allowNotices = [](const char* count) {
            const FileDescriptor limit(::open("/proc/sys/user/max_inotify_instances", O_WRONLY | O_CLOEXEC));
            return ::write(limit.get(), count, std::strlen(count)) > 0;
        };
        if (::unshare(CLONE_NEWUSER) != 0 || !allowNotices("0"))
            ::_exit(cannot);
        EpollRunLoop loop;
        FileDeviceLockState state(test.root());
        std::atomic<int> seen{FileDeviceLockState::unknown};
        std::atomic<int> looks{0};
        if (state.registerForChanges(loop, [&] {
                seen = state.currentState();
                ++looks;
            }) != EMFILE)
            ::_exit(notTold);
        std::thread runner([&] { loop.run(); });
        const auto sees = [&](int next) {
            test.replace(file, std::to_string(next));
            return eventually([&] { return seen == next; });
        };
        bool seenAll = sees(1) && sees(0) && allowNotices("8");
        ::usleep(400'000);
        const int before = looks;
        ::usleep(600'000);
        const bool polls = looks != before;
        seenAll = seenAll && sees(1);
        ::_exit(!seenAll ? notSeen : polls ? stillPolls : good);
    }
    int status = 0;
    ::waitpid(child, &status, 0);
    if (WEXITSTATUS(status) == cannot)
        GTEST_SKIP() << "needs a user namespace";
    EXPECT_EQ(WEXITSTATUS(status), good);
}

using support::NothingLarge;

// Goal: where memory runs out for a request or its reply, one connection ends, charges balance, and others are served.
// Method: a handler that throws, a request and a reply that are too large, and replies that pile up unread.
TEST(WantOfMemory, EndsOneConnection) {
    if (!support::allocationsCanFail())
        GTEST_SKIP() << "the sanitizer's allocations do not fail";
    constexpr std::size_t large = 100'000;
    ListenerWorld world;
    world.start([](PeerConnection&, ServiceEvent& event) {
        const std::uint64_t asked = event.request.unsignedInteger("Bytes").value_or(0);
        if (event.request.isTrue("Throw"))
            throw std::bad_alloc();
        if (asked == 0)
            return event.reply->send(event.request);
        const plist::Dictionary reply{{"Data", plist::Data(asked)}};
        const NothingLarge limit(large);
        event.reply->send(reply);
    });
    const auto throws = [](RawClient& client) { return client.send({{"Throw", true}}, 1); };
    const auto replies = [](RawClient& client) { return client.send({{"Bytes", std::uint64_t{3 * large}}}, 1); };
    const auto pilesUp = [](RawClient& client) {
        for (std::uint64_t i = 0; i < 100 && client.send({{"Bytes", std::uint64_t{large / 2}}}, i); ++i)
            ;
        ::usleep(100'000);
        while (client.receive()) {
        }
        return true;
    };
    const auto requests = [](RawClient& client) {
        plist::Data half = frameOf(3 * large, ipc::frameExpectsReply, 1, plist::Data(2 * large));
        const NothingLarge limit(large);
        return client.send(half) && client.ended();
    };
    RawClient bystander(world.socketPath());
    for (const std::function<bool(RawClient&)>& act :
         {std::function<bool(RawClient&)>(throws), std::function<bool(RawClient&)>(replies),
          std::function<bool(RawClient&)>(pilesUp), std::function<bool(RawClient&)>(requests)}) {
        RawClient client(world.socketPath());
        EXPECT_TRUE(act(client));
        EXPECT_TRUE(client.ended());
        EXPECT_TRUE(bystander.isServed());
    }
    EXPECT_EQ(world.counters().connectionsDropped, 4U);
    bystander.close();
    EXPECT_TRUE(world.isAtRest());
}

// Goal: a handler that is about to wait while there is no memory for another thread waits all the same, and the thread
// comes when there is. Method: the only thread waits, and a second client asks.
TEST(WantOfMemory, AThreadComesLater) {
    if (!support::allocationsCanFail())
        GTEST_SKIP() << "the sanitizer's allocations do not fail";
    ListenerWorld world;
    world.limits.threadsRunning = 1;
    std::promise<void> gate;
    world.start([opened = gate.get_future().share()](PeerConnection&, ServiceEvent& event) {
        if (event.request == numbered(1)) {
            std::optional<NothingLarge> limit(listenerScratchBytes);
            const BlockingScope blocking;
            limit.reset();
            opened.wait();
        }
        event.reply->send(event.request);
    });
    RawClient waits(world.socketPath());
    ASSERT_TRUE(waits.send(numbered(1), 1));
    RawClient asks(world.socketPath());
    EXPECT_TRUE(asks.isServed());
    gate.set_value();
    EXPECT_TRUE(waits.receive());
}

} // namespace
} // namespace zor::platform
