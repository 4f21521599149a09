// SPDX-License-Identifier: Apache-2.0
#include "service/ListenerWorld.h"

namespace zor::platform {
namespace {

plist::Dictionary withData(std::size_t bytes) {
    return {{"Payload", plist::Data(bytes, 0x5A)}};
}

// A frame that is no request ends its connection with one "other" and one "invalid" event, without a reply, and marks
// nobody else: broken frames, each alone and behind a good request.
TEST(ListenerFrame, BrokenFramesEndTheirConnectionOnly) {
    const auto framed = [](std::uint32_t flags, const plist::Data& payload) {
        return frameOf(static_cast<std::uint32_t>(payload.size()), flags, 9, payload);
    };
    const plist::Data good = *plist::writeBinary(numbered(1));
    const std::pair<const char*, plist::Data> rows[] = {
        {"length 0", framed(1, {})},
        {"length over the limit", frameOf(ipc::requestPayloadBytesMax + 1, 1, 9, {})},
        {"reply bit", framed(2, good)},
        {"unknown flag", framed(4, good)},
        {"payload is text", framed(1, {'h', 'e', 'l', 'l', 'o'})},
        {"payload is cut", framed(1, partOf(good, 0, good.size() - 1))},
        {"root is an array", framed(1, *plist::writeBinary(plist::Array()))},
    };
    ListenerWorld world;
    world.start();
    RawClient bystander = world.connect();
    int expected = 0;
    for (const auto& [what, broken] : rows) {
        for (const bool behindAGoodOne : {false, true}) {
            SCOPED_TRACE(what);
            RawClient client = world.connect();
            plist::Data bytes = behindAGoodOne ? frameOf(numbered(1), 8) : plist::Data();
            append(bytes, broken);
            // A frame after the broken one is not served either.
            append(bytes, frameOf(numbered(2), 10));
            ASSERT_TRUE(client.send(bytes));
            EXPECT_TRUE(!behindAGoodOne || client.receives(8, numbered(1)));
            EXPECT_TRUE(client.ended());
            ++expected;
            EXPECT_TRUE(eventually([&] { return world.counts.invalids == expected; }));
            EXPECT_EQ(world.counts.others, expected);
            EXPECT_TRUE(bystander.isServed());
        }
    }
}

// Frames are put together right and served in order wherever the stream is cut: a thousand small ones, then sizes
// around those at which the input changes its way of keeping bytes, then the largest, sent in pieces of many sizes.
TEST(ListenerFrame, AnyCutOfTheStreamGivesTheSameRequests) {
    ListenerWorld world;
    const std::size_t overhead = plist::writeBinary(withData(100'000))->size() - 100'000;
    std::vector<std::size_t> sizes(1000, 1);
    for (const std::size_t edge :
         {listenerSmallInputBytes, 2 * listenerSmallInputBytes, listenerScratchBytes, 2 * listenerScratchBytes})
        for (std::size_t offset = 0; offset < 40; ++offset)
            sizes.push_back(edge - overhead + offset);
    sizes.push_back(ipc::requestPayloadBytesMax - overhead);
    plist::Data stream;
    for (std::size_t i = 0; i < sizes.size(); ++i)
        append(stream, frameOf(withData(sizes[i]), i));
    world.start([count = sizes.size(), served = std::size_t{0}](PeerConnection&, ServiceEvent& event) mutable {
        EXPECT_EQ(event.requestId, served++ % count);
        event.reply->send(event.request);
    });
    std::mt19937 random(20261124);
    for (const std::size_t pieceMax : {7U, 16U, 100U, 4095U, 5000U, 32768U, 40000U, 1'000'000U}) {
        SCOPED_TRACE(pieceMax);
        RawClient client = world.connect();
        const std::jthread sender([&] {
            for (std::size_t done = 0, end = 0; done < stream.size(); done = end) {
                // The longest runs are cut finely only at their beginning.
                const std::size_t piece = 1 + random() % pieceMax;
                const std::size_t most = done < 20'000 ? piece : std::max(piece, pieceMax / 2 + 2'000);
                end = std::min(done + most, stream.size());
                if (!client.send(partOf(stream, done, end)))
                    return;
            }
        });
        for (std::size_t i = 0; i < sizes.size(); ++i)
            ASSERT_TRUE(client.receives(i, withData(sizes[i]))) << i;
    }
    EXPECT_TRUE(world.isAtRest());
}

// Replies that are kept go to the right request, once, and nowhere after the end: out of order, twice, from other
// threads. The stop ends half a frame and waiting requests too: every connection gets its invalid event, and every
// charge is given back (the listener asserts it).
TEST(ListenerFrame, DeferredRepliesComeInAnyOrderOnce) {
    ListenerWorld world;
    KeptReplies replies;
    world.start([&](PeerConnection&, ServiceEvent& event) {
        if (event.request == ordinaryRequest)
            event.reply->send(event.request);
        else
            replies.keep(event);
    });
    RawClient client = world.connect();
    ASSERT_TRUE(client.send(burstOf(5)));
    EXPECT_TRUE(client.isServed());
    const auto kept = replies.take(5);
    ASSERT_EQ(kept.size(), 5U);
    std::thread([&] {
        for (const std::size_t index : {3U, 1U, 3U, 4U, 0U}) {
            kept[index]->send(numbered(index));
            kept[index]->send(numbered(99));
        }
    }).join();
    for (const std::uint64_t id : {3U, 1U, 4U, 0U})
        EXPECT_TRUE(client.receives(id, numbered(id))) << id;
    EXPECT_TRUE(client.isServed());
    client.close();
    ASSERT_TRUE(world.isAtRest());
    // The object of the old connection serves the new one now; the old channel must not reach it.
    RawClient next = world.connect();
    EXPECT_TRUE(next.isServed());
    kept[2]->send(numbered(2));
    EXPECT_TRUE(next.isServed());
    const plist::Data burst = burstOf(200);
    std::vector<RawClient> clients = world.connect(20);
    for (RawClient& one : clients)
        ASSERT_TRUE(one.send(partOf(burst, 0, burst.size() - 5)));
    const auto late = replies.take(1000);
    world.stop();
    EXPECT_EQ(world.counts.invalids, static_cast<int>(world.counters().connectionsAccepted));
    EXPECT_EQ(world.identity.peers, 0);
    for (const auto& reply : late)
        reply->send(numbered(1));
    for (RawClient& one : clients)
        EXPECT_TRUE(one.ended());
}

// After cancel nothing is served or answered: a refused request in a burst, whose handler even tries to reply.
TEST(ListenerFrame, CancelEndsTheConnectionWithoutReply) {
    ListenerWorld world;
    world.start([](PeerConnection& connection, ServiceEvent& event) {
        if (event.request == numbered(2))
            connection.cancel();
        event.reply->send(event.request);
    });
    RawClient client = world.connect();
    ASSERT_TRUE(client.send(burstOf(6)));
    EXPECT_TRUE(client.receives(0, numbered(0)));
    EXPECT_TRUE(client.receives(1, numbered(1)));
    EXPECT_TRUE(client.ended());
    EXPECT_TRUE(world.isAtRest());
    EXPECT_EQ(world.counts.messages, 3);
    EXPECT_EQ(world.counts.invalids, 1);
    EXPECT_EQ(world.counts.others, 0);
}

} // namespace
} // namespace zor::platform
