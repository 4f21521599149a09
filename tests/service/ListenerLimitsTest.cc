// SPDX-License-Identifier: Apache-2.0
#include "service/ListenerPool.h"
#include "service/ListenerShares.h"
#include "service/ListenerWorld.h"
#include "support/Allocations.h"

#include <future>

namespace zor::platform {
namespace {

// Shares by user hold and balance: the charges alone, with users that no test can be.
TEST(ListenerLimits, SharesByUser) {
    const ListenerLimits limits{.connectionsMax = 10,
                                .connectionsMaxPerUser = 3,
                                .connectionsKeptForOwners = 2,
                                .inputBytesMax = 1000,
                                .inputBytesMaxPerUser = 400,
                                .inputBytesKeptForOwners = 200,
                                .outputBytesMaxPerUser = 500,
                                .outputBytesMaxOfOthers = 700};
    ListenerCharges charges(limits);
    std::vector<ListenerCharges::Account*> accounts;
    const auto open = [&](uid_t uid, bool ownsRoot) {
        ListenerCharges::Account* account = charges.openConnection(uid, ownsRoot);
        if (account)
            accounts.push_back(account);
        return account != nullptr;
    };
    // One user has three, and so have all that the system does not know; together they leave two to the owners.
    const std::pair<uid_t, int> users[] = {{501, 3}, {100000, 3}, {165535, 0}, {502, 2}, {503, 0}, {0, 2}};
    for (const auto& [uid, mayHave] : users) {
        for (int i = 0; i < mayHave; ++i)
            EXPECT_TRUE(open(uid, uid == 0)) << uid;
        EXPECT_FALSE(open(uid, uid == 0)) << uid;
    }
    ASSERT_EQ(accounts.size(), 10U);
    struct Step {
        ListenerCharges::Account& who;
        std::size_t from;
        std::size_t to;
        bool allowed;
    };
    ListenerCharges::Account& user = *accounts[0];
    ListenerCharges::Account& other = *accounts[3];
    ListenerCharges::Account& third = *accounts[6];
    ListenerCharges::Account& owner = *accounts.back();
    // Others cannot fill what is kept for the owners.
    const Step input[] = {
        {user, 0, 300, true},  {user, 0, 101, false}, {user, 0, 100, true},     {user, 100, 101, false},
        {owner, 0, 600, true}, {other, 0, 1, false},  {owner, 600, 601, false}, {owner, 600, 0, true},
        {other, 0, 399, true}, {third, 0, 2, false},  {third, 0, 1, true},      {owner, 0, 200, true},
        {owner, 200, 0, true}, {third, 1, 0, true},   {other, 399, 0, true},    {user, 400, 0, true}};
    for (const Step& step : input)
        EXPECT_EQ(charges.changeInput(step.who, step.from, step.to), step.allowed) << step.from << " " << step.to;
    const Step output[] = {{user, 0, 500, true},  {user, 0, 1, false},   {other, 0, 201, false},
                           {other, 0, 200, true}, {other, 200, 0, true}, {owner, 0, 5000, true},
                           {user, 500, 0, true},  {owner, 5000, 0, true}};
    for (const Step& step : output)
        EXPECT_EQ(charges.changeOutput(step.who, step.from, step.to), step.allowed) << step.from << " " << step.to;
    for (ListenerCharges::Account* account : accounts)
        charges.closeConnection(*account);
    EXPECT_EQ(charges.totals().connections, 0U);
}

// In the running listener: what is over a user's share, and whom the kernel does not tell, is refused or dropped; the
// others go on.
TEST(ListenerLimits, AUserOverItsShareIsRefused) {
    ListenerWorld world;
    world.identity.owner = static_cast<uid_t>(-1);
    world.limits.connectionsMaxPerUser = 3;
    world.limits.inputBytesMaxPerUser = 300'000;
    world.start();
    std::vector<RawClient> clients = world.connect(3);
    for (RawClient& client : clients)
        ASSERT_TRUE(client.isServed());
    EXPECT_TRUE(world.connect().ended());
    ASSERT_TRUE(clients[0].send(frameOf(200'000, 1, 1, plist::Data(190'000, 'x'))));
    ASSERT_TRUE(eventually([&] { return world.counters().inputBytes >= 190'000; }));
    clients[1].send(frameOf(200'000, 1, 1, plist::Data(190'000, 'x')));
    EXPECT_TRUE(clients[1].ended());
    EXPECT_EQ(world.counters().connectionsDropped, 1U);
    world.identity.knowsPeers = false;
    EXPECT_TRUE(world.connect().ended());
    EXPECT_TRUE(world.reports("Connection refused, the kernel does not tell the peer: errno "));
    EXPECT_TRUE(clients[2].isServed());
}

// A peer that never reads large replies makes the daemon neither work nor hold much, others are served, and when it
// reads at last nothing is lost.
TEST(ListenerLimits, APeerThatNeverReadsIsNotReadFrom) {
    ListenerWorld world;
    const plist::Dictionary large = {{"Payload", plist::Data(300'000, 7)}};
    std::atomic<int> largeServed{0};
    world.start([&](PeerConnection&, ServiceEvent& event) {
        const bool isLarge = event.request != ordinaryRequest;
        largeServed += isLarge ? 1 : 0;
        event.reply->send(isLarge ? large : event.request);
    });
    RawClient idle = world.connect();
    RawClient other = world.connect();
    ASSERT_TRUE(idle.send(burstOf(60)));
    ASSERT_TRUE(eventually([&] { return world.counters().outputBytes >= world.limits.outputBytesPaused; }));
    for (int i = 0; i < 100; ++i)
        ASSERT_TRUE(other.isServed());
    const int served = largeServed;
    EXPECT_LT(served, 10);
    EXPECT_LT(world.counters().outputBytes, world.limits.outputBytesPaused + 400'000);
    for (std::uint64_t i = 0; i < 60; ++i)
        ASSERT_TRUE(idle.receives(i, large)) << i;
    EXPECT_TRUE(idle.isServed());
    idle.close();
    other.close();
    EXPECT_TRUE(world.isAtRest());
}

// A connection whose unread replies pass the limit is dropped, whichever thread they come from, and a peer that closes
// while it is not read from is noticed.
TEST(ListenerLimits, TooManyUnreadRepliesDropTheConnection) {
    ListenerWorld world;
    world.limits.outputBytesMax = 3'000'000;
    KeptReplies kept;
    world.start([&](PeerConnection&, ServiceEvent& event) { kept.keep(event); });
    const plist::Dictionary large = {{"Payload", plist::Data(400'000, 7)}};
    const auto answerAtOnce = [&](RawClient& client, std::size_t count) {
        EXPECT_TRUE(client.send(burstOf(count)));
        for (const auto& reply : kept.take(count))
            reply->send(large);
    };
    // Replies that came while nobody served the connection arrive all the same when the peer reads at last.
    RawClient patient = world.connect();
    answerAtOnce(patient, 6);
    for (std::uint64_t i = 0; i < 6; ++i)
        ASSERT_TRUE(patient.receives(i, large)) << i;
    patient.close();
    ASSERT_TRUE(world.isAtRest());

    RawClient dropped = world.connect();
    answerAtOnce(dropped, 20);
    EXPECT_TRUE(eventually([&] { return world.counts.invalids == 2; }));
    EXPECT_EQ(world.counters().connectionsDropped, 1U);
    EXPECT_TRUE(world.isAtRest());

    // This one keeps within the limit, and goes.
    RawClient leaves = world.connect();
    answerAtOnce(leaves, 6);
    EXPECT_GT(world.counters().outputBytes, world.limits.outputBytesPaused);
    leaves.close();
    EXPECT_TRUE(eventually([&] { return world.counts.invalids == 3; }));
    EXPECT_TRUE(world.isAtRest());
}

// Without descriptors connections are refused with a line, the listener does not spin, and it recovers by itself: first
// its reserve can be used, then nothing.
TEST(ListenerLimits, OutOfDescriptorsItNeitherSpinsNorDies) {
    ListenerWorld world;
    world.start();
    RawClient before = world.connect();
    ASSERT_TRUE(before.isServed());
    std::vector<FileDescriptor> late;
    for (int i = 0; i < 6; ++i)
        late.emplace_back(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    const support::FewDescriptors descriptors(0);
    for (std::size_t i = 0; i < 3; ++i) {
        ASSERT_TRUE(connectTo(late[i].get(), world.socketPath()));
        limitWaiting(late[i].get());
        char byte = 0;
        EXPECT_EQ(::recv(late[i].get(), &byte, 1, 0), 0);
    }
    EXPECT_TRUE(eventually([&] { return world.counters().connectionsRefused == 3; }));
    EXPECT_TRUE(before.isServed());
    // Not even the reserve's own number may be used again.
    ASSERT_TRUE(descriptors.set(3));
    for (std::size_t i = 3; i < 6; ++i)
        ASSERT_TRUE(connectTo(late[i].get(), world.socketPath()));
    ASSERT_TRUE(eventually([&] { return world.counters().connectionsRefused >= 4; }));
    EXPECT_TRUE(world.reports("Connection refused, out of descriptors or memory: errno 24"));
    const std::uint64_t triedBefore = world.counters().connectionsRefused;
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    EXPECT_LE(world.counters().connectionsRefused - triedBefore, 4U);
    EXPECT_TRUE(before.isServed());
    ASSERT_TRUE(descriptors.set(descriptors.hard()));
    EXPECT_TRUE(world.connect().isServed());
}

using support::NothingLarge;

// Goal: where memory runs out for a request or its reply, or a reply cannot be written, one connection ends, charges
// balance, and others are served. Method: a handler that throws, a request and replies that are too large or no text,
// and replies that pile up unread.
TEST(WantOfMemory, EndsOneConnection) {
    if (!support::allocationsCanFail())
        GTEST_SKIP() << "the sanitizer's allocations do not fail";
    constexpr std::size_t large = 100'000;
    ListenerWorld world;
    world.start([](PeerConnection&, ServiceEvent& event) {
        const std::uint64_t asked = event.request.unsignedInteger("Number").value_or(0);
        if (asked == 1)
            throw std::bad_alloc();
        if (asked == 2)
            return event.reply->send({{"text", "\xff"}});
        if (asked == 0)
            return event.reply->send(event.request);
        const plist::Dictionary reply{{"Data", plist::Data(asked)}};
        const NothingLarge limit(large);
        event.reply->send(reply);
    });
    const auto asks = [](std::uint64_t number) { return [=](RawClient& client) { client.send(numbered(number), 1); }; };
    const std::function<void(RawClient&)> acts[] = {
        asks(1), asks(2), asks(3 * large),
        [](RawClient& client) {
            for (std::uint64_t i = 0; i < 100 && client.send(numbered(large / 2), i); ++i)
                ;
            ::usleep(100'000);
            while (client.receive()) {
            }
        },
        [](RawClient& client) {
            const plist::Data half = frameOf(3 * large, ipc::frameExpectsReply, 1, plist::Data(2 * large));
            const NothingLarge limit(large);
            EXPECT_TRUE(client.send(half) && client.ended());
        }};
    RawClient bystander = world.connect();
    for (const auto& act : acts) {
        RawClient client = world.connect();
        act(client);
        EXPECT_TRUE(client.ended());
        EXPECT_TRUE(bystander.isServed());
    }
    EXPECT_EQ(world.counters().connectionsDropped, std::size(acts));
    EXPECT_TRUE(world.reports("A reply could not be written: uid " + std::to_string(::geteuid()) + ", request 1"));
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
