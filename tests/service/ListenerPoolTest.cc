// SPDX-License-Identifier: Apache-2.0
#include "base/BlockingScope.h"
#include "os/SerialWorkQueue.h"
#include "service/ListenerWorld.h"

#include <random>
#include <semaphore>

namespace zor::platform {
namespace {

enum class Announced { yes, no };

/// Holds handlers until it is opened.
class Gate {
public:
    void wait(Announced announced) {
        std::optional<BlockingScope> outer;
        std::optional<BlockingScope> inner;
        if (announced == Announced::yes) {
            outer.emplace();
            inner.emplace();
        }
        ++inside_;
        passes_.acquire();
        --inside_;
    }
    /// Waits until so many are held.
    bool holds(int count) {
        return eventually([&] { return inside_ == count; });
    }
    void letOneThrough() { passes_.release(); }
    void open() { passes_.release(10'000); }

private:
    std::counting_semaphore<> passes_{0};
    std::atomic<int> inside_{0};
};

const plist::Dictionary blockRequest = {{"Block", true}};

/// Clients whose requests wait at a gate.
struct Blocked {
    Blocked(ListenerWorld& theWorld, Announced announced) : world(theWorld) {
        world.start([this, announced](PeerConnection&, ServiceEvent& event) {
            if (event.request == blockRequest)
                gate.wait(announced);
            event.reply->send(event.request);
        });
    }
    ~Blocked() {
        gate.open();
        world.stop();
    }
    void add(int count) {
        for (int i = 0; i < count; ++i) {
            clients.push_back(world.connect());
            ASSERT_TRUE(clients.back().send(blockRequest, 1));
        }
    }
    void letGo() {
        gate.open();
        for (RawClient& client : clients)
            EXPECT_TRUE(client.receives(1, blockRequest));
    }
    ListenerWorld& world;
    Gate gate;
    std::vector<RawClient> clients;
};

// Handlers that wait, announced or found out by the watcher, never stop the others, up to the last thread; when they
// are done the threads go away again.
TEST(ListenerPool, GrowsWhileHandlersWaitAndShrinksAfterwards) {
    for (const Announced announced : {Announced::yes, Announced::no}) {
        SCOPED_TRACE(announced == Announced::yes ? "announced" : "found out");
        ListenerWorld world;
        world.limits.threadsRunning = 2;
        world.limits.threadsMax = 64;
        world.limits.threadIdle = std::chrono::milliseconds(200);
        Blocked blocked(world, announced);
        RawClient other = world.connect();
        for (int count = 1; count < 64; ++count) {
            blocked.add(1);
            if (count % 16 == 0 || count > 60 || count < 4) {
                ASSERT_TRUE(other.isServed()) << count;
            }
        }
        ASSERT_TRUE(blocked.gate.holds(63));
        ASSERT_TRUE(other.isServed());
        EXPECT_EQ(world.counters().threads, 64U);
        if (announced == Announced::yes) {
            // With every thread blocked a request waits, and is not lost.
            blocked.add(1);
            ASSERT_TRUE(blocked.gate.holds(64));
            const int before = world.counts.messages;
            ASSERT_TRUE(other.send(numbered(1), 1));
            std::this_thread::sleep_for(std::chrono::milliseconds(50));
            EXPECT_EQ(world.counts.messages, before);
            blocked.gate.letOneThrough();
            EXPECT_TRUE(other.receives(1, numbered(1)));
        }
        blocked.letGo();
        EXPECT_EQ(world.counters().threadsMost, 64U);
        EXPECT_TRUE(eventually([&] { return world.counters().threads == 2; }));
        EXPECT_EQ(world.counters().threadsBlocked, 0U);
        EXPECT_TRUE(other.isServed());
    }
}

// With a tick of an hour: the pool reacts at once in the three ways in which work can be left without a worker.
TEST(ListenerPool, GrowsAtOnceWhenWorkersSaySo) {
    ListenerWorld world;
    world.limits.threadsRunning = 2;
    world.limits.tick = std::chrono::hours(1);
    Gate working;
    Gate blocked;
    std::atomic<int> floodServed{0};
    world.start([&](PeerConnection&, ServiceEvent& event) {
        if (!event.reply) {
            ++floodServed;
            return;
        }
        const std::uint64_t number = event.request.unsignedInteger("Number").value_or(0);
        if (number == 1 || number == 3)
            working.wait(Announced::no);
        if (number == 1 || number == 2)
            blocked.wait(Announced::yes);
        event.reply->send(event.request);
    });
    std::vector<RawClient> clients;
    const auto request = [&](std::uint64_t number) {
        clients.push_back(world.connect());
        ASSERT_TRUE(clients.back().send(numbered(number), number));
    };
    RawClient other = world.connect();
    // Nobody waits any more when these two say that they block.
    request(1);
    request(1);
    ASSERT_TRUE(working.holds(2));
    working.letOneThrough();
    ASSERT_TRUE(blocked.holds(1));
    EXPECT_TRUE(other.isServed());
    working.letOneThrough();
    ASSERT_TRUE(blocked.holds(2));
    EXPECT_TRUE(other.isServed());
    // One blocks while another waits; then that one works, and another may run beside it.
    request(2);
    ASSERT_TRUE(blocked.holds(3));
    request(3);
    ASSERT_TRUE(working.holds(1));
    EXPECT_TRUE(other.isServed());
    EXPECT_EQ(world.counters().threads, 5U);
    // Requests that wait for their turn are taken over when the worker that left them there gets busy.
    std::thread sender([&] { EXPECT_TRUE(other.send(burstOf(2000, 0))); });
    working.letOneThrough();
    request(3);
    EXPECT_TRUE(eventually([&] { return floodServed == 2000; }) && working.holds(1));
    sender.join();
    working.open();
    blocked.open();
    for (RawClient& client : clients)
        EXPECT_TRUE(client.receive());
}

// Clients that leave at any moment, while replies come at once, late, large or never, leave no charge, no event and no
// reply to a later connection of the same object.
TEST(ListenerPool, ConnectionsEndWhileRepliesAreUnderWay) {
    ListenerWorld world;
    world.limits.outputBytesPaused = 50'000;
    const plist::Dictionary lateAnswer = {{"Large", plist::Data(70'000, 2)}};
    SerialWorkQueue late("com.veltra.test");
    ASSERT_TRUE(late.start());
    world.start([&](PeerConnection& connection, ServiceEvent& event) {
        const std::uint64_t number = event.request.unsignedInteger("Number").value_or(0);
        if (number % 6 == 0)
            late.async([&lateAnswer, reply = event.reply] { reply->send(lateAnswer); });
        else if (number % 6 == 1)
            event.reply->send({{"Large", plist::Data(100'000, 1)}});
        else if (number % 6 > 2)
            event.reply->send(event.request);
        else if (number % 5 == 0)
            connection.cancel();
    });
    inThreads(6, [&](unsigned seed) {
        std::mt19937_64 random(seed);
        for (int life = 0; life < 150; ++life) {
            RawClient client = world.connect();
            const std::uint64_t first = random() << 32U;
            // Some wait for late replies, each of which finds the connection just let go, or just taken.
            for (std::uint64_t i = 0; i < 5 && life % 3 == 0; ++i)
                ASSERT_TRUE(client.send(numbered(0), first + i));
            for (std::uint64_t i = 0; i < 5 && life % 3 == 0; ++i)
                ASSERT_TRUE(client.receive());
            const std::uint64_t requests = random() % 12;
            for (std::uint64_t i = 0; i < requests; ++i)
                if (!client.send(numbered((random() & 0xFF)), first + i))
                    break;
            for (std::uint64_t replies = random() % 3; replies > 0 && requests > 4; --replies) {
                const std::optional<Reply> reply = client.receiveIfAny();
                EXPECT_TRUE(!reply || (reply->id >= first && reply->id < first + requests));
            }
        }
    });
    EXPECT_TRUE(world.isAtRest());
    EXPECT_EQ(world.counts.invalids, static_cast<int>(world.counters().connectionsAccepted));
    EXPECT_EQ(world.counts.others, 0);
}

// Goal: threads that become free are used although the others never say that they wait. Method: all threads are taken,
// by handlers that say so and by some that do not; the former end long after the watcher has seen that no thread can be
// added, and then a request comes.
TEST(ListenerPool, ThreadsThatAreFreeAgainStandInForStuckOnes) {
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

} // namespace
} // namespace zor::platform
