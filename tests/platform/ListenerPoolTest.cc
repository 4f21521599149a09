// SPDX-License-Identifier: Apache-2.0
#include "platform/ListenerWorld.h"

#include "platform/BlockingScope.h"

#include <gtest/gtest.h>

#include <condition_variable>
#include <cstdlib>
#include <ctime>
#include <dirent.h>
#include <fstream>
#include <memory>
#include <random>
#include <thread>

namespace zor::platform::test {
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
    int inside() {
        const std::lock_guard lock(mutex_);
        return inside_;
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
            clients.push_back(std::make_unique<RawClient>(world.socketPath()));
            ASSERT_TRUE(clients.back()->send(blockRequest, 1));
        }
    }
    ListenerWorld& world;
    Gate gate;
    std::vector<std::unique_ptr<RawClient>> clients;
};

// Goal: handlers that wait never stop the others, up to the last thread; when they are done the threads go away again.
// Method: as many blocked handlers as leave one thread over, announced or found out by the watcher; then all are let
// go.
TEST(ListenerPool, GrowsWhileHandlersWaitAndShrinksAfterwards) {
    for (const Announced announced : {Announced::yes, Announced::no}) {
        SCOPED_TRACE(announced == Announced::yes ? "announced" : "found out");
        ListenerWorld world;
        world.limits.threadsRunning = 2;
        world.limits.threadIdle = std::chrono::milliseconds(200);
        Blocked blocked(world, announced);
        RawClient other(world.socketPath());
        for (int count = 1; count < 64; ++count) {
            blocked.add(1);
            if (count % 16 == 0 || count > 60 || count < 4) {
                ASSERT_TRUE(other.isServed()) << count;
            }
        }
        ASSERT_TRUE(eventually([&] { return blocked.gate.inside() == 63; }));
        ASSERT_TRUE(other.isServed());
        EXPECT_EQ(world.listener().counters().threads, 64U);
        blocked.gate.open();
        for (const auto& client : blocked.clients)
            EXPECT_TRUE(client->receive());
        EXPECT_TRUE(eventually([&] { return world.listener().counters().threads == 2; }));
        EXPECT_EQ(world.listener().counters().threadsBlocked, 0U);
        EXPECT_TRUE(other.isServed());
    }
}

// Goal: the pool reacts to what workers say at once, without the watcher. Method: a tick of an hour, and the three ways
// in which work can be left without a worker.
TEST(ListenerPool, GrowsAtOnceWhenWorkersSaySo) {
    ListenerWorld world;
    world.limits.threadsRunning = 2;
    world.limits.tick = std::chrono::hours(1);
    Gate working;
    Gate blocked;
    std::atomic<int> floodServed{0};
    world.start([&](PeerConnection&, ServiceEvent& event) {
        const std::uint64_t number = event.request.unsignedInteger("Number").value_or(0);
        if (number == 1 || number == 3)
            working.wait(Announced::no);
        if (number == 1 || number == 2)
            blocked.wait(Announced::yes);
        if (number == 4)
            ++floodServed;
        if (event.reply)
            event.reply->send(event.request);
    });
    std::vector<std::unique_ptr<RawClient>> clients;
    const auto request = [&](std::uint64_t number) {
        clients.push_back(std::make_unique<RawClient>(world.socketPath()));
        ASSERT_TRUE(clients.back()->send(numbered(number), number));
    };
    RawClient other(world.socketPath());
    // Nobody waits any more when these two say that they block.
    request(1);
    request(1);
    ASSERT_TRUE(eventually([&] { return working.inside() == 2; }));
    working.letOneThrough();
    ASSERT_TRUE(eventually([&] { return blocked.inside() == 1; }));
    EXPECT_TRUE(other.isServed());
    working.letOneThrough();
    ASSERT_TRUE(eventually([&] { return blocked.inside() == 2; }));
    EXPECT_TRUE(other.isServed());
    // One blocks while another waits; then that one works, and another may run beside it.
    request(2);
    ASSERT_TRUE(eventually([&] { return blocked.inside() == 3; }));
    request(3);
    ASSERT_TRUE(eventually([&] { return working.inside() == 1; }));
    EXPECT_TRUE(other.isServed());
    EXPECT_EQ(world.listener().counters().threads, 5U);
    // Requests that wait for their turn are taken over when the worker that left them there gets busy.
    plist::Data flood;
    for (int i = 0; i < 2000; ++i) {
        const plist::Data frame = frameOf(numbered(4), 0, 0);
        flood.insert(flood.end(), frame.begin(), frame.end());
    }
    std::thread sender([&] { EXPECT_TRUE(other.send(flood)); });
    working.letOneThrough();
    request(3);
    EXPECT_TRUE(eventually([&] { return floodServed == 2000 && working.inside() == 1; }));
    sender.join();
    working.open();
    blocked.open();
    for (const auto& client : clients)
        EXPECT_TRUE(client->receive());
}

// Goal: at the limit requests wait, and none is lost. Method: one more request than there are threads, all blocked.
TEST(ListenerPool, WorkWaitsWhenEveryThreadIsBlocked) {
    ListenerWorld world;
    world.limits.threadsRunning = 2;
    world.limits.threadsMax = 6;
    Blocked blocked(world, Announced::yes);
    blocked.add(6);
    ASSERT_TRUE(eventually([&] { return blocked.gate.inside() == 6; }));
    RawClient other(world.socketPath());
    ASSERT_TRUE(other.send(numbered(1), 1));
    blocked.add(1);
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    EXPECT_EQ(world.counts.messages, 6);
    blocked.gate.letOneThrough();
    EXPECT_TRUE(other.receive());
    blocked.gate.open();
    for (const auto& client : blocked.clients)
        EXPECT_TRUE(client->receive());
    EXPECT_EQ(world.listener().counters().threadsMost, 6U);
}

// Goal: handlers that only compute never make the pool grow. Method: more clients than threads, each request computes
// for several ticks of the watcher.
TEST(ListenerPool, ComputingDoesNotMakeItGrow) {
    ListenerWorld world;
    world.limits.threadsRunning = 2;
    world.start([](PeerConnection&, ServiceEvent& event) {
        timespec begin = {};
        timespec now = {};
        ::clock_gettime(CLOCK_THREAD_CPUTIME_ID, &begin);
        do
            ::clock_gettime(CLOCK_THREAD_CPUTIME_ID, &now);
        while ((now.tv_sec - begin.tv_sec) * 1'000'000'000 + now.tv_nsec - begin.tv_nsec < 40'000'000);
        event.reply->send(event.request);
    });
    std::vector<std::unique_ptr<RawClient>> clients;
    for (int i = 0; i < 12; ++i) {
        clients.push_back(std::make_unique<RawClient>(world.socketPath()));
        ASSERT_TRUE(clients.back()->send(numbered(1), 1));
    }
    for (const auto& client : clients)
        EXPECT_TRUE(client->receive());
    EXPECT_EQ(world.listener().counters().threadsMost, 2U);
}

// Goal: many short waits of many clients lose no request and end in the same small pool. Method: handlers that open
// scopes inside scopes, some waiting, some not, under load; it is the counters' balance that is tested.
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
    std::vector<std::thread> threads;
    for (int i = 0; i < 8; ++i)
        threads.emplace_back([&] {
            RawClient client(world.socketPath());
            for (std::uint64_t number = 0; number < 400; ++number) {
                ASSERT_TRUE(client.send(numbered(number), number));
                const std::optional<Reply> reply = client.receive();
                ASSERT_TRUE(reply);
                ASSERT_EQ(reply->id, number);
            }
        });
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_TRUE(world.isAtRest());
    EXPECT_TRUE(eventually([&] { return world.listener().counters().threads == 2; }));
    EXPECT_EQ(world.listener().counters().threadsBlocked, 0U);
    EXPECT_EQ(world.listener().counters().messages, 8U * 400);
}

// Goal: connections that end at any moment leave no charge, no event and no reply to a later one of the same object.
// Method: clients that leave at random points while replies come at once, late from another thread, large, or never.
TEST(ListenerPool, ConnectionsEndWhileRepliesAreUnderWay) {
    ListenerWorld world;
    world.limits.outputBytesPaused = 50'000;
    std::mutex mutex;
    std::vector<std::shared_ptr<ReplyChannel>> late;
    std::atomic<bool> done{false};
    world.start([&](PeerConnection& connection, ServiceEvent& event) {
        switch (*event.request.unsignedInteger("Number") % 6) {
        case 0: {
            const std::lock_guard lock(mutex);
            late.push_back(event.reply);
            return;
        }
        case 1:
            event.reply->send(
                {{"Number", event.request.unsignedInteger("Number").value()}, {"Large", plist::Data(100'000, 1)}});
            return;
        case 2:
            if (*event.request.unsignedInteger("Number") % 5 == 0)
                connection.cancel();
            return;
        default:
            event.reply->send(event.request);
        }
    });
    std::thread replier([&] {
        while (!done) {
            std::vector<std::shared_ptr<ReplyChannel>> taken;
            {
                const std::lock_guard lock(mutex);
                taken.swap(late);
            }
            for (const auto& reply : taken)
                reply->send({{"Large", plist::Data(70'000, 2)}});
            std::this_thread::yield();
        }
    });
    std::vector<std::thread> clients;
    for (std::uint64_t seed = 0; seed < 6; ++seed)
        clients.emplace_back([&, seed] {
            std::mt19937_64 random(seed);
            for (int life = 0; life < 150; ++life) {
                RawClient client(world.socketPath());
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
    for (std::thread& client : clients)
        client.join();
    EXPECT_TRUE(world.isAtRest());
    done = true;
    replier.join();
    EXPECT_EQ(world.counts.invalids, static_cast<int>(world.listener().counters().connectionsAccepted));
    EXPECT_EQ(world.counts.others, 0);
}

// Goal: a reply from another thread that arms the connection just when its worker lets it go neither gets lost nor
// brings a second worker in. Method: bursts of requests, each answered late and with more than the socket takes; the
// peer waits for all answers of a burst, so that nothing else would wake the connection. More rounds with
// ZORVANE_TEST_LONG.
TEST(ListenerPool, LateRepliesMeetTheWorkerThatLetsGo) {
    ListenerWorld world;
    world.limits.threadsRunning = 3;
    std::mutex mutex;
    std::condition_variable changed;
    std::vector<std::shared_ptr<ReplyChannel>> late;
    bool done = false;
    world.start([&](PeerConnection&, ServiceEvent& event) {
        const std::lock_guard lock(mutex);
        late.push_back(event.reply);
        changed.notify_one();
    });
    const plist::Dictionary large = {{"Large", plist::Data(150'000, 2)}};
    std::thread replier([&] {
        std::unique_lock lock(mutex);
        while (!done) {
            changed.wait(lock, [&] { return done || !late.empty(); });
            std::vector<std::shared_ptr<ReplyChannel>> taken;
            taken.swap(late);
            lock.unlock();
            for (const auto& reply : taken)
                reply->send(large);
            lock.lock();
        }
    });
    RawClient client(world.socketPath());
    const int rounds = std::getenv("ZORVANE_TEST_LONG") ? 20'000 : 500;
    for (int round = 0; round < rounds && !testing::Test::HasFailure(); ++round) {
        constexpr std::uint64_t burst = 4;
        for (std::uint64_t i = 0; i < burst; ++i)
            ASSERT_TRUE(client.send(numbered(i), i));
        for (std::uint64_t i = 0; i < burst; ++i)
            ASSERT_TRUE(client.receive()) << "round " << round;
    }
    client.close();
    EXPECT_TRUE(world.isAtRest());
    {
        const std::lock_guard lock(mutex);
        done = true;
        changed.notify_one();
    }
    replier.join();
}

std::uint64_t switchesOfListenerThreads() {
    std::uint64_t sum = 0;
    DIR* tasks = ::opendir("/proc/self/task");
    while (const dirent* task = ::readdir(tasks)) {
        std::ifstream status("/proc/self/task/" + std::string(task->d_name) + "/status");
        bool ours = false;
        for (std::string line; std::getline(status, line);) {
            if (line.starts_with("Name:"))
                ours = line.find("listener") != std::string::npos;
            if (ours && line.starts_with("voluntary_ctxt_switches:"))
                sum += std::stoull(line.substr(line.find(':') + 1));
        }
    }
    ::closedir(tasks);
    return sum;
}

// Goal: an idle listener runs no code at all, also after it has been busy. Method: the context switches of its threads
// do not change while nothing happens.
TEST(ListenerPool, IdleCostsNothing) {
    ListenerWorld world;
    world.limits.threadsRunning = 2;
    world.limits.threadIdle = std::chrono::milliseconds(50);
    Blocked blocked(world, Announced::no);
    blocked.add(4);
    RawClient other(world.socketPath());
    EXPECT_TRUE(other.isServed());
    blocked.gate.open();
    for (const auto& client : blocked.clients)
        EXPECT_TRUE(client->receive());
    ASSERT_TRUE(eventually([&] { return world.listener().counters().threads == 2; }));
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    const std::uint64_t before = switchesOfListenerThreads();
    EXPECT_GT(before, 0U);
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    EXPECT_EQ(switchesOfListenerThreads(), before);
}

} // namespace
} // namespace zor::platform::test
