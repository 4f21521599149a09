// SPDX-License-Identifier: Apache-2.0
#include "base/BlockingScope.h"
#include "platform/ListenerWorld.h"
#include "support/LongRun.h"

#include <condition_variable>
#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <random>

namespace zor::platform {
namespace {

enum class Announced { yes, no };

/// Holds handlers until it is opened.
class Gate {
public:
    void wait(Announced announced) {
        std::optional<BlockingScope> scope;
        if (announced == Announced::yes)
            scope.emplace();
        std::unique_lock lock(mutex_);
        ++inside_;
        changed_.wait(lock, [this] { return open_ || passes_ > 0; });
        if (!open_)
            --passes_;
        --inside_;
    }
    /// Waits until so many are held.
    bool holds(int count) {
        return eventually([&] {
            const std::lock_guard lock(mutex_);
            return inside_ == count;
        });
    }
    void letOneThrough() {
        const std::lock_guard lock(mutex_);
        ++passes_;
        changed_.notify_one();
    }
    void open() {
        const std::lock_guard lock(mutex_);
        open_ = true;
        changed_.notify_all();
    }

private:
    std::mutex mutex_;
    std::condition_variable changed_;
    bool open_ = false;
    int passes_ = 0;
    int inside_ = 0;
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
        const std::uint64_t number = *event.request.unsignedInteger("Number");
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

// Scopes inside scopes, some waiting, some not, under load, lose no request and end in the same small pool.
TEST(ListenerPool, CountsStayRightUnderMixedLoad) {
    ListenerWorld world;
    world.limits.threadsRunning = 2;
    world.limits.threadIdle = std::chrono::milliseconds(100);
    world.start([](PeerConnection&, ServiceEvent& event) {
        const std::uint64_t number = *event.request.unsignedInteger("Number");
        if (number % 3 == 0) {
            const BlockingScope outer;
            const BlockingScope inner;
            std::this_thread::sleep_for(std::chrono::microseconds(number % 7 * 50));
        } else if (number % 101 == 1) {
            std::this_thread::sleep_for(std::chrono::milliseconds(25));
        }
        event.reply->send(event.request);
    });
    inThreads(8, [&](unsigned) {
        RawClient client = world.connect();
        for (std::uint64_t number = 0; number < 400; ++number) {
            ASSERT_TRUE(client.send(numbered(number), number));
            ASSERT_TRUE(client.receives(number, numbered(number)));
        }
    });
    EXPECT_TRUE(world.isAtRest());
    EXPECT_TRUE(eventually([&] { return world.counters().threads == 2; }));
    EXPECT_EQ(world.counters().threadsBlocked, 0U);
    EXPECT_EQ(world.counters().messages, 8U * 400);
}

/// Answers requests from a thread of its own.
class LateReplier {
public:
    explicit LateReplier(std::size_t bytes) : answer_{{"Large", plist::Data(bytes, 2)}}, thread_([this] { run(); }) {}
    ~LateReplier() {
        {
            const std::lock_guard lock(mutex_);
            done_ = true;
        }
        changed_.notify_one();
    }
    void take(const ServiceEvent& event) {
        const std::lock_guard lock(mutex_);
        late_.push_back(event.reply);
        changed_.notify_one();
    }

private:
    void run() {
        std::unique_lock lock(mutex_);
        while (!done_) {
            changed_.wait(lock, [this] { return done_ || !late_.empty(); });
            const auto taken = std::exchange(late_, {});
            lock.unlock();
            for (const auto& reply : taken)
                reply->send(answer_);
            lock.lock();
        }
    }

    const plist::Dictionary answer_;
    std::mutex mutex_;
    std::condition_variable changed_;
    std::vector<std::shared_ptr<ReplyChannel>> late_;
    bool done_ = false;
    std::jthread thread_;
};

// Clients that leave at any moment, while replies come at once, late, large or never, leave no charge, no event and no
// reply to a later connection of the same object.
TEST(ListenerPool, ConnectionsEndWhileRepliesAreUnderWay) {
    ListenerWorld world;
    world.limits.outputBytesPaused = 50'000;
    LateReplier replier(70'000);
    world.start([&](PeerConnection& connection, ServiceEvent& event) {
        const std::uint64_t number = *event.request.unsignedInteger("Number");
        if (number % 6 == 0)
            replier.take(event);
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

} // namespace
} // namespace zor::platform
