// SPDX-License-Identifier: Apache-2.0
#include "platform/ListenerWorld.h"

#include "platform/linux/ListenerLimits.h"
#include "plist/Binary.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <mutex>
#include <random>
#include <string>
#include <sys/socket.h>
#include <thread>

namespace zor::platform::test {
namespace {

plist::Dictionary withData(std::size_t bytes) {
    return {{"Payload", plist::Data(bytes, 0x5A)}};
}

// Goal: whatever is no request ends its connection with exactly one "other" and one "invalid" event, without a reply
// and without a mark on anybody else. Method: a table of broken frames, each alone and behind a good request.
TEST(ListenerFrame, BrokenFramesEndTheirConnectionOnly) {
    const plist::Data good = *plist::writeBinary(numbered(1));
    const auto size = static_cast<std::uint32_t>(good.size());
    plist::Data cutTrailer(good.begin(), good.end() - 1);
    struct Row {
        const char* what;
        plist::Data bytes;
    };
    const std::vector<Row> rows = {
        {"length 0", frameOf(0, 1, 9, {})},
        {"length over the limit", frameOf(ipc::requestPayloadBytesMax + 1, 1, 9, {})},
        {"largest length", frameOf(0xFFFF'FFFF, 1, 9, {})},
        {"reply bit", frameOf(size, 2, 9, good)},
        {"reply bit and reply expected", frameOf(size, 3, 9, good)},
        {"unknown flag", frameOf(size, 4, 9, good)},
        {"highest flag", frameOf(size, 0x8000'0001, 9, good)},
        {"payload is text", frameOf(5, 1, 9, {'h', 'e', 'l', 'l', 'o'})},
        {"payload is one byte", frameOf(1, 1, 9, {0})},
        {"payload is cut", frameOf(size - 1, 1, 9, cutTrailer)},
        {"root is a string",
         frameOf(static_cast<std::uint32_t>(plist::writeBinary("x")->size()), 1, 9, *plist::writeBinary("x"))},
        {"root is an array", frameOf(static_cast<std::uint32_t>(plist::writeBinary(plist::Array())->size()), 1, 9,
                                     *plist::writeBinary(plist::Array()))},
    };
    ListenerWorld world;
    world.start();
    RawClient bystander(world.socketPath());
    int expected = 0;
    for (const Row& row : rows) {
        for (const bool behindAGoodOne : {false, true}) {
            SCOPED_TRACE(row.what);
            RawClient client(world.socketPath());
            plist::Data bytes = behindAGoodOne ? frameOf(numbered(1), 8) : plist::Data();
            bytes.insert(bytes.end(), row.bytes.begin(), row.bytes.end());
            // What comes after it is not served either.
            const plist::Data after = frameOf(numbered(2), 10);
            bytes.insert(bytes.end(), after.begin(), after.end());
            ASSERT_TRUE(client.send(bytes));
            if (behindAGoodOne) {
                const std::optional<Reply> reply = client.receive();
                ASSERT_TRUE(reply);
                EXPECT_EQ(reply->id, 8U);
            }
            EXPECT_TRUE(client.ended());
            ++expected;
            EXPECT_TRUE(eventually([&] { return world.counts.invalids == expected; }));
            EXPECT_EQ(world.counts.others, expected);
            EXPECT_TRUE(bystander.isServed());
        }
    }
    bystander.close();
    EXPECT_TRUE(world.isAtRest());
    EXPECT_EQ(world.counts.invalids, expected + 1);
}

// Goal: frames are put together right wherever the stream is cut, at every size at which the input changes its way of
// keeping bytes. Method: sizes around the limits, sent in pieces of many sizes, byte by byte for small ones.
TEST(ListenerFrame, AnyCutOfTheStreamGivesTheSameRequests) {
    ListenerWorld world;
    world.start();
    const std::size_t overhead = plist::writeBinary(withData(100'000))->size() - 100'000;
    std::vector<std::size_t> sizes = {1, 60, 200};
    for (const std::size_t edge :
         {listenerSmallInputBytes, 2 * listenerSmallInputBytes, listenerScratchBytes, 2 * listenerScratchBytes})
        for (const int offset : {-17, -16, -15, -1, 0, 1, 15, 16, 17})
            sizes.push_back(edge - overhead + static_cast<std::size_t>(offset + 20));
    plist::Data stream;
    for (std::size_t i = 0; i < sizes.size(); ++i) {
        const plist::Data frame = frameOf(withData(sizes[i]), i);
        stream.insert(stream.end(), frame.begin(), frame.end());
    }
    std::mt19937 random(20261124);
    for (const std::size_t pieceMax : {7U, 16U, 100U, 4095U, 5000U, 32768U, 40000U, 1'000'000U}) {
        SCOPED_TRACE(pieceMax);
        RawClient client(world.socketPath());
        // The longest runs are cut finely only at their beginning.
        std::thread sender([&] {
            std::uniform_int_distribution<std::size_t> piece(1, pieceMax);
            for (std::size_t done = 0; done < stream.size();) {
                const std::size_t most = done < 20'000 ? piece(random) : std::max(piece(random), pieceMax / 2 + 2'000);
                const std::size_t count = std::min(most, stream.size() - done);
                const auto from = stream.begin() + static_cast<std::ptrdiff_t>(done);
                if (!client.send(plist::Data(from, from + static_cast<std::ptrdiff_t>(count))))
                    return;
                done += count;
            }
        });
        for (std::size_t i = 0; i < sizes.size(); ++i) {
            const std::optional<Reply> reply = client.receive();
            ASSERT_TRUE(reply) << i;
            EXPECT_EQ(reply->id, i);
            EXPECT_TRUE(reply->message == withData(sizes[i])) << i;
        }
        sender.join();
    }
    EXPECT_TRUE(world.isAtRest());
}

TEST(ListenerFrame, TheLargestRequestIsServedAndOneByteMoreIsNot) {
    ListenerWorld world;
    world.start([](PeerConnection&, ServiceEvent& event) {
        event.reply->send(numbered(event.request.data("Payload")->size()));
    });
    const std::size_t overhead = plist::writeBinary(withData(500'000))->size() - 500'000;
    const std::size_t largest = ipc::requestPayloadBytesMax - overhead;
    RawClient client(world.socketPath());
    ASSERT_TRUE(client.send(withData(largest), 1));
    const std::optional<Reply> reply = client.receive();
    ASSERT_TRUE(reply);
    EXPECT_TRUE(reply->message == numbered(largest));
    client.send(withData(largest + 1), 2);
    EXPECT_TRUE(client.ended());
}

// Goal: a thousand requests in flight are each answered, in order, and another client is served meanwhile. Method: one
// client writes them all before it reads; the fairness limit cuts them into turns.
TEST(ListenerFrame, PipelinedRequestsAreServedInOrder) {
    ListenerWorld world;
    std::atomic<std::uint64_t> next{0};
    world.start([&](PeerConnection&, ServiceEvent& event) {
        EXPECT_EQ(next++, event.request.unsignedInteger("Number"));
        event.reply->send(event.request);
    });
    RawClient client(world.socketPath());
    plist::Data all;
    for (std::uint64_t i = 0; i < 1000; ++i) {
        const plist::Data frame = frameOf(numbered(i), i + 5);
        all.insert(all.end(), frame.begin(), frame.end());
    }
    std::thread sender([&] { EXPECT_TRUE(client.send(all)); });
    for (std::uint64_t i = 0; i < 1000; ++i) {
        const std::optional<Reply> reply = client.receive();
        ASSERT_TRUE(reply) << i;
        EXPECT_EQ(reply->id, i + 5);
        EXPECT_TRUE(reply->message == numbered(i));
    }
    sender.join();
    client.close();
    EXPECT_TRUE(world.isAtRest());
}

// Goal: neither does a client with endless requests hold up others, nor do many others hold it up. Method: one thread
// serves a peer with hundreds of queued requests and a hundred peers with one: who comes when is counted.
TEST(ListenerFrame, AFloodTakesTurnsWithOthers) {
    ListenerWorld world;
    world.limits.threadsRunning = 1;
    world.limits.threadsMax = 1;
    constexpr int floodCount = 400;
    constexpr int singleCount = 100;
    std::mutex gate;
    std::atomic<int> floodServed{0};
    std::atomic<int> singlesServed{0};
    std::atomic<int> floodBeforeFirstSingle{-1};
    std::atomic<int> floodBeforeLastSingle{-1};
    world.start([&](PeerConnection&, ServiceEvent& event) {
        const std::lock_guard lock(gate);
        if (!event.request.isTrue("Single")) {
            ++floodServed;
            return;
        }
        const int served = ++singlesServed;
        if (served == 1)
            floodBeforeFirstSingle = floodServed.load();
        if (served == singleCount)
            floodBeforeLastSingle = floodServed.load();
    });
    RawClient flood(world.socketPath());
    std::vector<std::unique_ptr<RawClient>> singles;
    for (int i = 0; i < singleCount; ++i)
        singles.push_back(std::make_unique<RawClient>(world.socketPath()));
    ASSERT_TRUE(eventually([&] { return world.listener().counters().connections == singleCount + 1; }));
    {
        const std::lock_guard closed(gate);
        plist::Data all;
        for (int i = 0; i < floodCount; ++i) {
            const plist::Data frame = frameOf(numbered(1), 0, 0);
            all.insert(all.end(), frame.begin(), frame.end());
        }
        ASSERT_TRUE(flood.send(all));
        ASSERT_TRUE(eventually([&] { return world.counts.messages == 1; }));
        for (const auto& single : singles)
            ASSERT_TRUE(single->send(plist::Dictionary{{"Single", true}}, 1));
    }
    ASSERT_TRUE(eventually([&] { return singlesServed == singleCount && floodServed == floodCount; }));
    EXPECT_LE(floodBeforeFirstSingle, 3 * static_cast<int>(world.limits.framesPerTurn));
    EXPECT_EQ(floodBeforeLastSingle, floodCount);
}

// Goal: replies that handlers keep go to the right request whenever they come, once, and nowhere after the end. Method:
// channels are kept and used out of order, twice, from other threads, and after the connection has gone.
TEST(ListenerFrame, DeferredRepliesComeInAnyOrderOnce) {
    ListenerWorld world;
    std::mutex mutex;
    std::vector<std::shared_ptr<ReplyChannel>> kept;
    const auto keptCount = [&] {
        const std::lock_guard lock(mutex);
        return kept.size();
    };
    world.start([&](PeerConnection&, ServiceEvent& event) {
        if (event.request.isTrue("Keep")) {
            const std::lock_guard lock(mutex);
            kept.push_back(event.reply);
        } else {
            event.reply->send(event.request);
        }
    });
    RawClient client(world.socketPath());
    const plist::Dictionary keep = {{"Keep", true}};
    for (std::uint64_t id = 0; id < 5; ++id)
        ASSERT_TRUE(client.send(keep, id));
    EXPECT_TRUE(client.isServed());
    ASSERT_TRUE(eventually([&] { return keptCount() == 5; }));
    std::thread([&] {
        for (const std::size_t index : {3U, 1U, 3U, 4U, 0U}) {
            kept[index]->send(numbered(index));
            kept[index]->send(numbered(99));
        }
    }).join();
    for (const std::uint64_t id : {3U, 1U, 4U, 0U}) {
        const std::optional<Reply> reply = client.receive();
        ASSERT_TRUE(reply);
        EXPECT_EQ(reply->id, id);
        EXPECT_TRUE(reply->message == numbered(id));
    }
    EXPECT_TRUE(client.isServed());
    client.close();
    ASSERT_TRUE(world.isAtRest());
    // The object of the old connection serves the new one now; the old channel must not reach it.
    RawClient next(world.socketPath());
    EXPECT_TRUE(next.isServed());
    kept[2]->send(numbered(2));
    EXPECT_TRUE(next.isServed());
    world.stop();
    kept[2]->send(numbered(2));
}

// Goal: a channel that is used again for the next request never answers the one before. Method: threads reply at once
// or late to a client with many requests in flight; every id must come exactly once with its own number.
TEST(ListenerFrame, ReusedChannelsDoNotMixReplies) {
    ListenerWorld world;
    std::vector<std::thread> repliers;
    std::mutex mutex;
    world.start([&](PeerConnection&, ServiceEvent& event) {
        const std::uint64_t number = *event.request.unsignedInteger("Number");
        if (number % 3 == 0) {
            event.reply->send(event.request);
            return;
        }
        const std::lock_guard lock(mutex);
        repliers.emplace_back([reply = event.reply, number] {
            if (number % 3 == 1)
                std::this_thread::yield();
            reply->send(numbered(number));
        });
    });
    RawClient client(world.socketPath());
    constexpr std::uint64_t count = 300;
    for (std::uint64_t i = 0; i < count; ++i)
        ASSERT_TRUE(client.send(numbered(i), 1000 + i));
    std::vector<bool> seen(count);
    for (std::uint64_t i = 0; i < count; ++i) {
        const std::optional<Reply> reply = client.receive();
        ASSERT_TRUE(reply);
        const std::uint64_t number = reply->id - 1000;
        ASSERT_LT(number, count);
        EXPECT_FALSE(seen[number]);
        seen[number] = true;
        EXPECT_TRUE(reply->message == numbered(number));
    }
    world.stop();
    for (std::thread& thread : repliers)
        thread.join();
}

// Goal: after cancel nothing of the connection is served or answered. Method: a refused request in the middle of a
// burst, whose handler even tries to reply.
TEST(ListenerFrame, CancelEndsTheConnectionWithoutReply) {
    ListenerWorld world;
    world.start([](PeerConnection& connection, ServiceEvent& event) {
        if (event.request == numbered(3))
            connection.cancel();
        event.reply->send(event.request);
    });
    RawClient client(world.socketPath());
    plist::Data burst;
    for (std::uint64_t i = 1; i <= 6; ++i) {
        const plist::Data frame = frameOf(numbered(i), i);
        burst.insert(burst.end(), frame.begin(), frame.end());
    }
    ASSERT_TRUE(client.send(burst));
    for (std::uint64_t i = 1; i <= 2; ++i) {
        const std::optional<Reply> reply = client.receive();
        ASSERT_TRUE(reply);
        EXPECT_EQ(reply->id, i);
    }
    EXPECT_TRUE(client.ended());
    EXPECT_TRUE(world.isAtRest());
    EXPECT_EQ(world.counts.messages, 3);
    EXPECT_EQ(world.counts.invalids, 1);
    EXPECT_EQ(world.counts.others, 0);
}

// Goal: a request that expects no reply has none to give. Method: such a request, then one that does expect one.
TEST(ListenerFrame, WithoutTheFlagThereIsNoReplyChannel) {
    ListenerWorld world;
    std::atomic<int> without{0};
    world.start([&](PeerConnection&, ServiceEvent& event) {
        if (event.reply)
            event.reply->send(event.request);
        else
            ++without;
    });
    RawClient client(world.socketPath());
    ASSERT_TRUE(client.send(frameOf(numbered(1), 1, 0)));
    EXPECT_TRUE(client.isServed());
    EXPECT_EQ(without, 1);
}

// Goal: peers that vanish at any byte leave nothing behind. Method: a request cut at every length, then a close, or a
// reset, which is a close with a reply unread.
TEST(ListenerFrame, PeersThatVanishMidFrameLeaveNothing) {
    ListenerWorld world;
    world.start();
    const plist::Data whole = frameOf(withData(100), 1);
    int connections = 0;
    for (std::size_t length = 0; length <= whole.size(); ++length) {
        for (const bool hard : {false, true}) {
            RawClient client(world.socketPath());
            if (hard) {
                ASSERT_TRUE(client.send(numbered(1), 1));
                std::uint8_t first = 0;
                ASSERT_EQ(::recv(client.socket(), &first, 1, MSG_PEEK), 1);
            }
            ASSERT_TRUE(client.send(plist::Data(whole.begin(), whole.begin() + static_cast<std::ptrdiff_t>(length))));
            ++connections;
        }
    }
    EXPECT_TRUE(eventually([&] { return world.counts.invalids == connections; }));
    EXPECT_TRUE(world.isAtRest());
    EXPECT_EQ(world.counts.others, 0);
}

// Goal: stop ends whatever is under way: half a frame, a kept reply, requests that wait for their turn. Method: all of
// them at once; every connection gets its invalid event and every charge is given back (the listener asserts it).
TEST(ListenerFrame, StopEndsEverything) {
    ListenerWorld world;
    std::mutex mutex;
    std::vector<std::shared_ptr<ReplyChannel>> kept;
    world.start([&](PeerConnection&, ServiceEvent& event) {
        const std::lock_guard lock(mutex);
        kept.push_back(event.reply);
    });
    std::vector<std::unique_ptr<RawClient>> clients;
    plist::Data burst;
    for (std::uint64_t i = 0; i < 200; ++i) {
        const plist::Data frame = frameOf(numbered(i), i);
        burst.insert(burst.end(), frame.begin(), frame.end());
    }
    burst.resize(burst.size() - 5);
    for (int i = 0; i < 20; ++i) {
        clients.push_back(std::make_unique<RawClient>(world.socketPath()));
        ASSERT_TRUE(clients.back()->send(burst));
    }
    ASSERT_TRUE(eventually([&] { return world.counts.messages > 1000; }));
    world.stop();
    EXPECT_EQ(world.counts.invalids, static_cast<int>(world.listener().counters().connectionsAccepted));
    EXPECT_EQ(world.identity.peers, 0);
    for (const auto& reply : kept)
        reply->send(numbered(1));
    for (const auto& client : clients)
        EXPECT_TRUE(client->ended());
}

} // namespace
} // namespace zor::platform::test
