// SPDX-License-Identifier: Apache-2.0
// What the listener does when there is no thread or no descriptor left.
#include "base/BlockingScope.h"
#include "platform/ListenerWorld.h"
#include "support/FileTree.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <semaphore>
#include <sys/resource.h>
#include <sys/socket.h>
#include <thread>

namespace zor::platform {
namespace {

// Goal: threads that become free are used although the others never say that they wait. Method: all threads are taken,
// by handlers that say so and by some that do not; the former end long after the watcher has seen that no thread can be
// added, and then a request comes.
TEST(ListenerWant, ThreadsThatAreFreeAgainStandInForStuckOnes) {
    std::counting_semaphore<> announced(0);
    std::counting_semaphore<> silent(0);
    ListenerWorld world;
    world.limits.threadsRunning = 2;
    world.limits.threadsMax = 4;
    world.start([&](PeerConnection&, ServiceEvent& event) {
        if (event.request == numbered(1)) {
            const BlockingScope scope;
            announced.acquire();
        } else if (event.request == numbered(2)) {
            silent.acquire();
        }
        event.reply->send(event.request);
    });
    RawClient other(world.socketPath());
    std::vector<RawClient> clients;
    for (const std::uint64_t number : {1U, 1U, 2U, 2U}) {
        clients.emplace_back(world.socketPath());
        EXPECT_TRUE(clients.back().send(numbered(number), number));
    }
    EXPECT_TRUE(eventually([&] { return world.counts.messages == 4; }));
    std::this_thread::sleep_for(5 * world.limits.tick);
    announced.release(2);
    EXPECT_TRUE(clients[0].receive() && clients[1].receive());
    std::this_thread::sleep_for(5 * world.limits.tick);
    EXPECT_TRUE(other.isServed());
    silent.release(2);
}

// Goal: a listener that cannot start lets nobody in to wait for ever. Method: a passed socket with a client, and no
// descriptor for anything else.
TEST(ListenerWant, ASocketThatCannotBeServedIsClosed) {
    const support::TemporaryDirectory directory("/tmp");
    const FileDescriptor opened(::open(directory.path().c_str(), O_PATH | O_CLOEXEC));
    auto made = makeListenerSocket({.directory = opened.get(), .directoryPath = directory.path(), .name = "s"},
                                   SOCK_STREAM, 0666);
    ASSERT_TRUE(made);
    RawClient client(directory.path() + "/s");
    KernelIdentity identity;
    ListenerOptions options;
    options.passed = std::move(*made);
    LinuxServiceListener listener(identity, std::move(options));
    rlimit before = {};
    ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &before), 0);
    const rlimit none = {.rlim_cur = 3, .rlim_max = before.rlim_max};
    ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &none), 0);
    EXPECT_FALSE(listener.resume([](PeerConnection&, ServiceEvent&) {}));
    ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &before), 0);
    EXPECT_TRUE(client.ended());
}

} // namespace
} // namespace zor::platform
