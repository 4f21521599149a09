// SPDX-License-Identifier: Apache-2.0
// The threads that serve, and whose turn it is. Users are uids that a test takes while it connects, so those about them
// need root.
#include "os/SerialWorkQueue.h"
#include "service/ListenerWorld.h"

#include <poll.h>

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
    void open(std::ptrdiff_t passes = 10'000) { passes_.release(passes); }

private:
    std::counting_semaphore<> passes_{0};
    std::atomic<int> inside_{0};
};

bool isReadable(const RawClient& client) {
    pollfd descriptor = {.fd = client.socket(), .events = POLLIN, .revents = 0};
    return ::poll(&descriptor, 1, 5) > 0;
}

// Handlers that wait, announced or found out by the watcher, never stop the others, up to the last thread; when they
// are done the threads go away again.
TEST(ListenerPool, GrowsWhileHandlersWaitAndShrinksAfterwards) {
    for (const Announced announced : {Announced::yes, Announced::no}) {
        SCOPED_TRACE(announced == Announced::yes ? "announced" : "found out");
        Gate gate;
        ListenerWorld world;
        world.limits.threadsRunning = 2;
        world.limits.threadsMax = 64;
        world.limits.threadIdle = std::chrono::milliseconds(200);
        world.start([&](PeerConnection&, ServiceEvent& event) {
            if (event.request == numbered(0))
                gate.wait(announced);
            event.reply->send(event.request);
        });
        RawClient other = world.connect();
        std::vector<RawClient> clients;
        const auto addOne = [&] {
            clients.push_back(world.connect());
            EXPECT_TRUE(clients.back().send(burstOf(1)));
        };
        while (clients.size() < 63) {
            addOne();
            EXPECT_TRUE(other.isServed()) << clients.size();
        }
        EXPECT_TRUE(gate.holds(63) && other.isServed());
        EXPECT_EQ(world.counters().threads, 64U);
        if (announced == Announced::yes) {
            // With every thread blocked a request waits, and is not lost.
            addOne();
            EXPECT_TRUE(gate.holds(64) && other.send(numbered(1), 1));
            std::this_thread::sleep_for(std::chrono::milliseconds(50));
            EXPECT_FALSE(isReadable(other));
        }
        gate.open();
        EXPECT_TRUE(announced == Announced::no || other.receives(1, numbered(1)));
        for (RawClient& client : clients)
            EXPECT_TRUE(client.receives(0, numbered(0)));
        EXPECT_EQ(world.counters().threadsMost, 64U);
        EXPECT_TRUE(eventually([&] { return world.counters().threads == 2; }));
        EXPECT_EQ(world.counters().threadsBlocked, 0U);
        EXPECT_TRUE(other.isServed());
    }
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
                const std::optional<Reply> reply = isReadable(client) ? client.receive() : std::nullopt;
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
    Gate announced;
    Gate silent;
    ListenerWorld world;
    world.limits.threadsRunning = 2;
    world.limits.threadsMax = 4;
    world.start([&](PeerConnection&, ServiceEvent& event) {
        if (event.request == numbered(1))
            announced.wait(Announced::yes);
        else if (event.request == numbered(2))
            silent.wait(Announced::no);
        event.reply->send(event.request);
    });
    std::vector<RawClient> clients = world.connect(4);
    for (std::size_t i = 0; i < 4; ++i)
        EXPECT_TRUE(clients[i].send(numbered(1 + i / 2), i));
    EXPECT_TRUE(announced.holds(2) && silent.holds(2));
    std::this_thread::sleep_for(5 * world.limits.tick);
    announced.open();
    EXPECT_TRUE(clients[0].receive() && clients[1].receive());
    std::this_thread::sleep_for(5 * world.limits.tick);
    EXPECT_TRUE(world.connect().isServed());
    silent.open();
}

constexpr uid_t greedy = 501;
constexpr uid_t modest = 502;

class TurnsByUser : public ::testing::Test {
protected:
    void SetUp() override {
        if (::geteuid() != 0)
            GTEST_SKIP() << "needs root: it connects under other uids";
        world.identity.owner = 0;
        world.limits.threadsRunning = 2;
    }
    ListenerWorld world;
};

// Goal: who asks once waits for a few turns, not for the thousands of requests that another user, or a crowd of unknown
// ones, has sent before. Method: the requests served between a question and its reply are counted.
TEST_F(TurnsByUser, NotByConnection) {
    struct Case {
        const char* what;
        uid_t first;
        std::size_t connections;
        std::uint64_t requestsOfEach;
        uid_t asks;
        int servedBeforeMost;
    };
    const Case cases[] = {
        {"one user with many connections", greedy, 150, 16, modest, 40},
        {"one connection with many requests", greedy, 1, 1000, modest, 40},
        {"another connection of the user who asks", greedy, 1, 1000, greedy, 40},
        {"a range of uids", 100'000, 150, 16, modest, 40},
        {"an owner of the root", greedy, 150, 16, 0, 40},
    };
    std::atomic<bool> open{false};
    std::atomic<int> served{0};
    std::atomic<int> servedBefore{0};
    world.start([&](PeerConnection& connection, ServiceEvent& event) {
        while (!open)
            std::this_thread::yield();
        std::this_thread::sleep_for(std::chrono::microseconds(100));
        const uid_t user = connection.peer().kernelUserId();
        if (user == modest || user == 0)
            servedBefore = served.load();
        else
            ++served;
        event.reply->send(event.request);
    });
    for (const Case& row : cases) {
        SCOPED_TRACE(row.what);
        RawClient asks = world.connectAs(row.asks);
        std::vector<RawClient> clients;
        for (std::size_t i = 0; i < row.connections; ++i)
            clients.push_back(world.connectAs(row.first < 1000 ? row.first : row.first + static_cast<uid_t>(i % 4)));
        open = false;
        for (RawClient& client : clients)
            ASSERT_TRUE(client.send(burstOf(row.requestsOfEach)));
        open = true;
        for (int i = 0; i < 3; ++i) {
            const int before = served;
            ASSERT_TRUE(asks.isServed());
            EXPECT_LE(servedBefore - before, row.servedBeforeMost);
        }
        for (RawClient& client : clients)
            for (std::uint64_t i = 0; i < row.requestsOfEach; ++i)
                ASSERT_TRUE(client.receives(i, numbered(i)));
    }
}

// Goal: users whose requests wait for ever, all there can be, leave threads to root and to the system's users; what
// waits behind them is served afterwards. Method: each asks for more than its share; the handler waits.
TEST_F(TurnsByUser, LeaveThreadsToOthers) {
    const unsigned share = world.limits.threadsMaxPerUser;
    Gate gate;
    world.start([&](PeerConnection& connection, ServiceEvent& event) {
        if (connection.peer().kernelUserId() >= greedy)
            gate.wait(Announced::yes);
        event.reply->send(event.request);
    });
    std::vector<RawClient> stuck;
    for (const uid_t uid : {501, 502, 503, 504, 505, 506, 507, 508, 509, 510, 100'000}) {
        for (unsigned i = 0; i <= share; ++i) {
            stuck.push_back(world.connectAs(uid));
            ASSERT_TRUE(stuck.back().send(numbered(1), 1));
        }
    }
    const int underWay = static_cast<int>(share) * 11;
    EXPECT_TRUE(gate.holds(underWay));
    for (const uid_t uid : {uid_t{33}, uid_t{0}})
        for (int i = 0; i < 20; ++i)
            ASSERT_TRUE(world.connectAs(uid).isServed());
    EXPECT_EQ(world.counts.messages, underWay + 40);
    gate.open();
    for (RawClient& client : stuck)
        EXPECT_TRUE(client.receives(1, numbered(1)));
}

} // namespace
} // namespace zor::platform
