// SPDX-License-Identifier: Apache-2.0
// Turns go by user. Users are uids that this test takes while it connects, so it needs root.
#include "base/BlockingScope.h"
#include "service/ListenerWorld.h"

#include <semaphore>

namespace zor::platform {
namespace {

constexpr uid_t greedy = 501;
constexpr uid_t modest = 502;

/// The uid that a connection was made under, as the handler sees it.
uid_t userOf(PeerConnection& connection) {
    return connection.peer().kernelUserId();
}

class TurnsByUser : public ::testing::Test {
protected:
    void SetUp() override {
        if (::geteuid() != 0)
            GTEST_SKIP() << "needs root: it connects under other uids";
        world.identity.ownersAre(0);
        world.limits.threadsRunning = 2;
    }
    std::vector<RawClient> connectAs(uid_t uid, std::size_t count) {
        std::vector<RawClient> clients;
        while (clients.size() < count)
            clients.push_back(world.connectAs(uid));
        return clients;
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
        if (userOf(connection) == modest || userOf(connection) == 0)
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
    std::counting_semaphore<> gate(0);
    world.start([&](PeerConnection& connection, ServiceEvent& event) {
        if (userOf(connection) >= greedy) {
            const BlockingScope blocking;
            gate.acquire();
        }
        event.reply->send(event.request);
    });
    std::vector<RawClient> stuck;
    for (const uid_t uid : {501, 502, 503, 504, 505, 506, 507, 508, 509, 510, 100'000}) {
        for (RawClient& client : connectAs(uid, share + 1)) {
            ASSERT_TRUE(client.send(numbered(1), 1));
            stuck.push_back(std::move(client));
        }
    }
    const int underWay = static_cast<int>(share) * 11;
    EXPECT_TRUE(eventually([&] { return world.counts.messages == underWay; }));
    for (const uid_t uid : {uid_t{33}, uid_t{0}})
        for (int i = 0; i < 20; ++i)
            ASSERT_TRUE(world.connectAs(uid).isServed());
    EXPECT_EQ(world.counts.messages, underWay + 40);
    gate.release(static_cast<std::ptrdiff_t>(stuck.size()));
    for (RawClient& client : stuck)
        EXPECT_TRUE(client.receives(1, numbered(1)));
}

} // namespace
} // namespace zor::platform
