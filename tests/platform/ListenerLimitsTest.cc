// SPDX-License-Identifier: Apache-2.0
#include "platform/ListenerWorld.h"
#include "service/ListenerCharges.h"
#include "support/ProcessResources.h"

#include <algorithm>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/wait.h>

namespace zor::platform {
namespace {

/// The soft limit on descriptors, put back at the end.
class DescriptorLimit {
public:
    DescriptorLimit() { ::getrlimit(RLIMIT_NOFILE, &before_); }
    ~DescriptorLimit() { ::setrlimit(RLIMIT_NOFILE, &before_); }
    bool set(rlim_t count) const {
        const rlimit limit = {.rlim_cur = count, .rlim_max = before_.rlim_max};
        return ::setrlimit(RLIMIT_NOFILE, &limit) == 0;
    }
    rlim_t hard() const { return before_.rlim_max; }

private:
    rlimit before_ = {};
};

// The listener holds 4,096 connections, each with half a request that is served afterwards, refuses the next at once,
// and has room again when one goes.
TEST(ListenerLimits, FourThousandNinetySixConnections) {
    const DescriptorLimit descriptors;
    if (!descriptors.set(8'400))
        GTEST_SKIP() << "needs 8,400 descriptors, the hard limit is " << descriptors.hard();
    ListenerWorld world;
    ASSERT_EQ(world.limits.connectionsMax, 4096U);
    world.start();
    const plist::Data frame = frameOf(numbered(5), 5);
    std::vector<RawClient> clients = world.connect(4096);
    for (RawClient& client : clients)
        ASSERT_TRUE(client.send(partOf(frame, 0, 20)));
    ASSERT_TRUE(eventually([&] { return world.counters().inputBytes >= 4096 * 20; }));
    EXPECT_EQ(world.counters().connections, 4096U);
    EXPECT_TRUE(world.connect().ended());
    clients.pop_back();
    ASSERT_TRUE(eventually([&] { return world.counters().connections == 4095; }));
    EXPECT_TRUE(world.connect().isServed());
    for (RawClient& client : clients)
        ASSERT_TRUE(client.send(partOf(frame, 20, frame.size())));
    for (RawClient& client : clients)
        ASSERT_TRUE(client.receive());
    // Accepting waits now and then, when the kernel enlarges the table of descriptors.
    EXPECT_LE(world.counters().threadsMost, std::max(2U, std::thread::hardware_concurrency()) + 4);
    clients.clear();
    EXPECT_TRUE(world.isAtRest());
}

// A reply that no bytes can hold and a peer that nobody knows are refused with a line, the next client is served, and a
// kind's lines come now and then with the count of those left out.
TEST(ListenerLimits, RefusalsAreSaidNowAndThen) {
    ListenerWorld world;
    world.limits.incidentLineEvery = std::chrono::seconds(1);
    world.start([](PeerConnection&, ServiceEvent& event) { event.reply->send({{"text", "\xff"}}); });
    const auto fails = [&] {
        RawClient client = world.connect();
        EXPECT_TRUE(client.send(numbered(1), 1) && client.ended());
    };
    for (int i = 0; i < 5; ++i)
        fails();
    EXPECT_TRUE(world.reports("A reply could not be written: uid " + std::to_string(::geteuid())));
    std::this_thread::sleep_for(std::chrono::milliseconds(1100));
    fails();
    EXPECT_TRUE(world.reports(" more before)"));

    world.identity.knowsPeers = false;
    EXPECT_TRUE(world.connect().ended());
    EXPECT_TRUE(world.reports("Connection refused, the kernel does not tell the peer: errno "));
    world.identity.knowsPeers = true;
    fails();
    EXPECT_TRUE(world.isAtRest());
}

// Shares by user hold and balance: the charges alone, with users that no test can be.
TEST(ListenerLimits, SharesByUser) {
    ListenerLimits limits;
    limits.connectionsMax = 10;
    limits.connectionsMaxPerUser = 3;
    limits.connectionsKeptForOwners = 2;
    limits.inputBytesMax = 1000;
    limits.inputBytesMaxPerUser = 400;
    limits.inputBytesKeptForOwners = 200;
    limits.outputBytesMaxPerUser = 500;
    limits.outputBytesMaxOfOthers = 700;
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
    ListenerCharges::Account& user = *accounts[0];
    ListenerCharges::Account& other = *accounts[3];
    ListenerCharges::Account& owner = *accounts.back();
    EXPECT_TRUE(charges.changeInput(user, 0, 300));
    EXPECT_FALSE(charges.changeInput(user, 0, 101));
    EXPECT_TRUE(charges.changeInput(user, 0, 100));
    EXPECT_FALSE(charges.changeInput(user, 100, 101));
    EXPECT_TRUE(charges.changeInput(owner, 0, 600));
    EXPECT_FALSE(charges.changeInput(other, 0, 1));
    EXPECT_FALSE(charges.changeInput(owner, 600, 601));
    EXPECT_TRUE(charges.changeInput(owner, 600, 0));
    // Others cannot fill what is kept for the owners.
    ListenerCharges::Account& third = *accounts[6];
    EXPECT_TRUE(charges.changeInput(other, 0, 399));
    EXPECT_FALSE(charges.changeInput(third, 0, 2));
    EXPECT_TRUE(charges.changeInput(third, 0, 1));
    EXPECT_TRUE(charges.changeInput(owner, 0, 200));
    EXPECT_TRUE(charges.changeInput(owner, 200, 0));
    EXPECT_TRUE(charges.changeInput(third, 1, 0));
    EXPECT_TRUE(charges.changeInput(other, 399, 0));
    EXPECT_TRUE(charges.changeInput(user, 300, 0));
    EXPECT_TRUE(charges.changeInput(user, 100, 0));
    EXPECT_TRUE(charges.changeOutput(user, 0, 500));
    EXPECT_FALSE(charges.changeOutput(user, 0, 1));
    EXPECT_FALSE(charges.changeOutput(other, 0, 201));
    EXPECT_TRUE(charges.changeOutput(other, 0, 200));
    EXPECT_TRUE(charges.changeOutput(other, 200, 0));
    EXPECT_TRUE(charges.changeOutput(owner, 0, 5000));
    EXPECT_TRUE(charges.changeOutput(user, 500, 0));
    EXPECT_TRUE(charges.changeOutput(owner, 5000, 0));
    for (ListenerCharges::Account* account : accounts)
        charges.closeConnection(*account);
    EXPECT_EQ(charges.totals().connections, 0U);
}

// In the running listener: what is over a user's share is refused or dropped, and said once; the others go on.
TEST(ListenerLimits, AUserOverItsShareIsRefused) {
    ListenerWorld world;
    world.identity.everybodyOwnsRoot = false;
    world.limits.connectionsMax = 100;
    world.limits.connectionsMaxPerUser = 5;
    world.limits.inputBytesMaxPerUser = 300'000;
    world.start();
    std::vector<RawClient> clients = world.connect(5);
    for (RawClient& client : clients)
        ASSERT_TRUE(client.isServed());
    EXPECT_TRUE(world.connect().ended());
    // Four unfinished requests fit; the fifth does not.
    const plist::Data half = frameOf(200'000, 1, 1, plist::Data(60'000, 'x'));
    for (std::size_t i = 0; i < 4; ++i)
        ASSERT_TRUE(clients[i].send(half));
    ASSERT_TRUE(eventually([&] { return world.counters().inputBytes >= 240'000; }));
    clients[4].send(frameOf(200'000, 1, 1, plist::Data(150'000, 'x')));
    EXPECT_TRUE(clients[4].ended());
    EXPECT_EQ(world.counters().connectionsDropped, 1U);
    EXPECT_LE(world.counters().inputBytes, 300'000U);
    ASSERT_TRUE(eventually([&] { return world.counters().connections == 4; }));
    EXPECT_TRUE(world.connect().isServed());
    clients.clear();
    EXPECT_TRUE(world.isAtRest());
}

// A peer that never reads large replies makes the daemon neither work nor hold much, others are served, and when it
// reads at last nothing is lost.
TEST(ListenerLimits, APeerThatNeverReadsIsNotReadFrom) {
    ListenerWorld world;
    const plist::Dictionary large = {{"Payload", plist::Data(300'000, 7)}};
    std::atomic<int> largeServed{0};
    world.start([&](PeerConnection&, ServiceEvent& event) {
        const bool isLarge = event.request != numbered(77);
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

// Nothing that another process sends over a socket it was given is served: a whole request, and the second half of one.
TEST(ListenerLimits, ASocketPassedToAnotherProcessIsNotThePeer) {
    ListenerWorld world;
    world.start();
    const plist::Data frame = frameOf(numbered(1), 1);
    for (const std::size_t own : {std::size_t{0}, std::size_t{20}}) {
        SCOPED_TRACE(own);
        RawClient client = world.connect();
        EXPECT_TRUE(client.isServed());
        const int before = world.counts.messages;
        ASSERT_TRUE(client.send(partOf(frame, 0, own)));
        const plist::Data rest = partOf(frame, own, frame.size());
        const pid_t child = ::fork();
        ASSERT_GE(child, 0);
        if (child == 0)
            ::_exit(client.send(rest) ? 0 : 1);
        int status = 0;
        ASSERT_EQ(::waitpid(child, &status, 0), child);
        ASSERT_EQ(status, 0);
        EXPECT_TRUE(client.ended());
        EXPECT_EQ(world.counts.messages, before);
    }
    EXPECT_EQ(world.counts.others, 2);
    EXPECT_EQ(world.counters().foreignSenders, 2U);
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
    const DescriptorLimit descriptors;
    const int highest = ::fcntl(0, F_DUPFD_CLOEXEC, 0);
    ::close(highest);
    // No number below the limit is free.
    ASSERT_TRUE(descriptors.set(static_cast<rlim_t>(highest)));
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

} // namespace
} // namespace zor::platform
