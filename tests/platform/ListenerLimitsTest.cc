// SPDX-License-Identifier: Apache-2.0
#include "platform/ListenerWorld.h"

#include "platform/linux/ListenerCharges.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

namespace zor::platform::test {
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

std::size_t openDescriptors() {
    std::size_t count = 0;
    DIR* directory = ::opendir("/proc/self/fd");
    while (::readdir(directory))
        ++count;
    ::closedir(directory);
    return count;
}

/// Sends a byte string with a descriptor attached, as one message.
bool sendDescriptor(int socket, const plist::Data& bytes, int descriptor) {
    iovec part = {.iov_base = const_cast<std::uint8_t*>(bytes.data()), .iov_len = bytes.size()};
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))] = {};
    msghdr message = {};
    message.msg_iov = &part;
    message.msg_iovlen = 1;
    message.msg_control = control;
    message.msg_controllen = sizeof control;
    cmsghdr* header = CMSG_FIRSTHDR(&message);
    header->cmsg_level = SOL_SOCKET;
    header->cmsg_type = SCM_RIGHTS;
    header->cmsg_len = CMSG_LEN(sizeof(int));
    std::memcpy(CMSG_DATA(header), &descriptor, sizeof descriptor);
    return ::sendmsg(socket, &message, MSG_NOSIGNAL) == static_cast<ssize_t>(bytes.size());
}

// Goal: the listener holds 4,096 connections, refuses the next at once, and has room again when one goes. Method: real
// connections, each with half a request buffered, all of which are served afterwards.
TEST(ListenerLimits, FourThousandNinetySixConnections) {
    const DescriptorLimit descriptors;
    if (!descriptors.set(8'400))
        GTEST_SKIP() << "needs 8,400 descriptors, the hard limit is " << descriptors.hard();
    ListenerWorld world;
    ASSERT_EQ(world.limits.connectionsMax, 4096U);
    world.start();
    const plist::Data frame = frameOf(numbered(5), 5);
    std::vector<std::unique_ptr<RawClient>> clients;
    for (int i = 0; i < 4096; ++i) {
        clients.push_back(std::make_unique<RawClient>(world.socketPath()));
        ASSERT_TRUE(clients.back()->send(plist::Data(frame.begin(), frame.begin() + 20)));
    }
    ASSERT_TRUE(eventually([&] { return world.listener().counters().inputBytes >= 4096 * 20; }));
    EXPECT_EQ(world.listener().counters().connections, 4096U);
    RawClient refused(world.socketPath());
    EXPECT_TRUE(refused.ended());
    EXPECT_TRUE(eventually([&] { return world.reports().size() == 1; }));
    EXPECT_EQ(world.listener().counters().connectionsRefused, 1U);
    clients.back()->close();
    ASSERT_TRUE(eventually([&] { return world.listener().counters().connections == 4095; }));
    EXPECT_TRUE(RawClient(world.socketPath()).isServed());
    clients.pop_back();
    for (const auto& client : clients)
        ASSERT_TRUE(client->send(plist::Data(frame.begin() + 20, frame.end())));
    for (const auto& client : clients)
        ASSERT_TRUE(client->receive());
    // Accepting waits now and then, when the kernel enlarges the table of descriptors.
    EXPECT_LE(world.listener().counters().threadsMost, std::max(2U, std::thread::hardware_concurrency()) + 4);
    clients.clear();
    EXPECT_TRUE(world.isAtRest());
}

// Goal: whoever cannot be served is refused with a line, the next is served, and a kind's lines come once a second with
// the count of those left out. Method: no descriptor to accept with, a peer that nobody knows, replies that no bytes
// can hold.
TEST(ListenerLimits, EachRefusalIsSaidOnceASecond) {
    ListenerWorld world;
    world.start([](PeerConnection&, ServiceEvent& event) { event.reply->send({{"text", "\xff"}}); });
    const auto says = [&](const std::string& words) {
        return eventually([&] {
            return std::ranges::any_of(world.reports(), [&](const std::string& line) { return line.contains(words); });
        });
    };
    const auto fails = [&] {
        RawClient client(world.socketPath());
        EXPECT_TRUE(client.send(numbered(1), 1));
        EXPECT_TRUE(client.ended());
    };
    for (int i = 0; i < 5; ++i)
        fails();
    EXPECT_TRUE(says("A reply could not be written: uid " + std::to_string(::geteuid())));
    std::this_thread::sleep_for(std::chrono::milliseconds(1100));
    fails();
    EXPECT_TRUE(says(" more before)"));

    world.identity.knowsPeers = false;
    EXPECT_TRUE(RawClient(world.socketPath()).ended());
    EXPECT_TRUE(says("Connection refused, the kernel does not tell the peer: errno "));
    world.identity.knowsPeers = true;

    FileDescriptor socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{.sun_family = AF_UNIX, .sun_path = {}};
    world.socketPath().copy(address.sun_path, sizeof address.sun_path - 1);
    {
        const DescriptorLimit descriptors;
        ASSERT_TRUE(descriptors.set(3));
        ASSERT_EQ(::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
        EXPECT_TRUE(says("Connection refused, out of descriptors or memory: errno 24"));
    }
    fails();
    socket.reset();
    EXPECT_TRUE(world.isAtRest());
}

// Goal: shares by user hold and balance. Method: the charges alone, with users that no test can be.
TEST(ListenerLimits, SharesByUser) {
    ListenerLimits limits;
    limits.connectionsMax = 10;
    limits.connectionsMaxPerUser = 3;
    limits.connectionsKeptForOwners = 2;
    limits.inputBytesMax = 1000;
    limits.inputBytesMaxPerUser = 400;
    limits.outputBytesMaxPerUser = 500;
    ListenerCharges charges(limits);
    std::vector<ListenerCharges::Account*> accounts;
    const auto open = [&](uid_t uid, bool ownsRoot) {
        ListenerCharges::Account* account = charges.openConnection(uid, ownsRoot);
        if (account)
            accounts.push_back(account);
        return account;
    };
    // One user has three; all others together leave two to the owners.
    for (const uid_t uid : {1000U, 1001U})
        for (int i = 0; i < 3; ++i)
            ASSERT_TRUE(open(uid, false));
    EXPECT_FALSE(open(1000, false));
    EXPECT_TRUE(open(1002, false));
    EXPECT_TRUE(open(1002, false));
    EXPECT_FALSE(open(1003, false));
    EXPECT_TRUE(open(0, true));
    EXPECT_TRUE(open(0, true));
    EXPECT_FALSE(open(0, true));

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
    EXPECT_TRUE(charges.changeInput(user, 300, 0));
    EXPECT_TRUE(charges.changeInput(user, 100, 0));
    EXPECT_TRUE(charges.changeOutput(user, 0, 500));
    EXPECT_FALSE(charges.changeOutput(user, 0, 1));
    EXPECT_TRUE(charges.changeOutput(owner, 0, 5000));
    EXPECT_TRUE(charges.changeOutput(user, 500, 0));
    EXPECT_TRUE(charges.changeOutput(owner, 5000, 0));
    for (ListenerCharges::Account* account : accounts)
        charges.closeConnection(*account);
    EXPECT_EQ(charges.totals().connections, 0U);
}

TEST(ListenerLimits, UnbalancedChargesStopTheProcess) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(
        {
            ListenerCharges charges(ListenerLimits{});
            ListenerCharges::Account* account = charges.openConnection(1, false);
            if (account && charges.changeInput(*account, 0, 7))
                charges.closeConnection(*account);
        },
        "input bytes do not balance");
}

// Goal: one user's connections and unfinished requests are bounded in the running listener. Method: small limits; the
// connection over them is refused or dropped, and said once; the others go on.
TEST(ListenerLimits, AUserOverItsShareIsRefused) {
    ListenerWorld world;
    world.identity.everybodyOwnsRoot = false;
    world.limits.connectionsMax = 100;
    world.limits.connectionsMaxPerUser = 5;
    world.limits.inputBytesMaxPerUser = 300'000;
    world.start();
    std::vector<std::unique_ptr<RawClient>> clients;
    for (int i = 0; i < 5; ++i) {
        clients.push_back(std::make_unique<RawClient>(world.socketPath()));
        ASSERT_TRUE(clients.back()->isServed());
    }
    for (int i = 0; i < 20; ++i)
        EXPECT_TRUE(RawClient(world.socketPath()).ended());
    EXPECT_TRUE(eventually([&] { return world.listener().counters().connectionsRefused == 20; }));
    EXPECT_LE(world.reports().size(), 3U);

    // Four unfinished requests fit; the fifth does not.
    const plist::Data half = frameOf(200'000, 1, 1, plist::Data(60'000, 'x'));
    for (int i = 0; i < 4; ++i)
        ASSERT_TRUE(clients[static_cast<std::size_t>(i)]->send(half));
    ASSERT_TRUE(eventually([&] { return world.listener().counters().inputBytes >= 240'000; }));
    clients[4]->send(frameOf(200'000, 1, 1, plist::Data(150'000, 'x')));
    EXPECT_TRUE(clients[4]->ended());
    EXPECT_EQ(world.listener().counters().connectionsDropped, 1U);
    EXPECT_LE(world.listener().counters().inputBytes, 300'000U);
    ASSERT_TRUE(eventually([&] { return world.listener().counters().connections == 4; }));
    EXPECT_TRUE(RawClient(world.socketPath()).isServed());
    clients.clear();
    EXPECT_TRUE(world.isAtRest());
}

// Goal: clients that send a byte now and then hold no thread and little memory. Method: a hundred of them, bytes in
// turns, and one client that is served at once all the time; buffered bytes stay about what was sent.
TEST(ListenerLimits, SlowSendersHoldNothing) {
    ListenerWorld world;
    world.limits.threadsRunning = 2;
    world.start();
    const plist::Data frame = frameOf({{"Payload", plist::Data(50, 1)}}, 3);
    std::vector<std::unique_ptr<RawClient>> slow;
    for (int i = 0; i < 100; ++i)
        slow.push_back(std::make_unique<RawClient>(world.socketPath()));
    RawClient quick(world.socketPath());
    for (std::size_t at = 0; at < frame.size(); ++at) {
        for (const auto& client : slow)
            ASSERT_TRUE(client->send(plist::Data{frame[at]}));
        ASSERT_TRUE(quick.isServed());
        EXPECT_LE(world.listener().counters().inputBytes, slow.size() * (at + 1));
    }
    for (const auto& client : slow)
        EXPECT_TRUE(client->receive());
    EXPECT_EQ(world.listener().counters().threadsMost, 2U);
}

// Goal: a peer that never reads makes the daemon neither work nor hold much, others are served, and when it reads at
// last nothing is lost. Method: many requests for large replies; the handler's calls and the kept bytes stop growing.
TEST(ListenerLimits, APeerThatNeverReadsIsNotReadFrom) {
    ListenerWorld world;
    const plist::Dictionary large = {{"Payload", plist::Data(300'000, 7)}};
    std::atomic<int> largeServed{0};
    world.start([&](PeerConnection&, ServiceEvent& event) {
        if (event.request != numbered(77)) {
            ++largeServed;
            event.reply->send(large);
        } else {
            event.reply->send(event.request);
        }
    });
    RawClient idle(world.socketPath());
    RawClient other(world.socketPath());
    constexpr std::uint64_t count = 60;
    for (std::uint64_t i = 0; i < count; ++i)
        ASSERT_TRUE(idle.send(numbered(i), i));
    ASSERT_TRUE(eventually([&] { return world.listener().counters().outputBytes >= world.limits.outputBytesPaused; }));
    for (int i = 0; i < 100; ++i)
        ASSERT_TRUE(other.isServed());
    const int served = largeServed;
    EXPECT_LT(served, 10);
    EXPECT_LT(world.listener().counters().outputBytes, world.limits.outputBytesPaused + 400'000);
    for (std::uint64_t i = 0; i < count; ++i) {
        const std::optional<Reply> reply = idle.receive();
        ASSERT_TRUE(reply) << i;
        EXPECT_EQ(reply->id, i);
        EXPECT_TRUE(reply->message == large);
    }
    EXPECT_TRUE(idle.isServed());
    idle.close();
    other.close();
    EXPECT_TRUE(world.isAtRest());
}

// Goal: a connection whose unread replies pass the limit is dropped, from whichever thread they come, and a peer that
// closes while it is not read from is noticed. Method: kept channels are all answered at once while nobody reads.
TEST(ListenerLimits, TooManyUnreadRepliesDropTheConnection) {
    ListenerWorld world;
    world.limits.outputBytesMax = 3'000'000;
    std::mutex mutex;
    std::vector<std::shared_ptr<ReplyChannel>> kept;
    world.start([&](PeerConnection&, ServiceEvent& event) {
        const std::lock_guard lock(mutex);
        kept.push_back(event.reply);
    });
    const plist::Dictionary large = {{"Payload", plist::Data(400'000, 7)}};
    const auto keepReplies = [&](RawClient& client, std::size_t count) {
        const std::lock_guard lock(mutex);
        kept.clear();
        for (std::uint64_t i = 0; i < count; ++i)
            ASSERT_TRUE(client.send(numbered(i), i));
    };
    const auto keptCount = [&] {
        const std::lock_guard lock(mutex);
        return kept.size();
    };
    // Replies that came while nobody served the connection arrive all the same when the peer reads at last.
    RawClient patient(world.socketPath());
    keepReplies(patient, 6);
    ASSERT_TRUE(eventually([&] { return keptCount() == 6; }));
    for (const auto& reply : kept)
        reply->send(large);
    for (std::uint64_t i = 0; i < 6; ++i) {
        const std::optional<Reply> reply = patient.receive();
        ASSERT_TRUE(reply) << i;
        EXPECT_TRUE(reply->message == large);
    }
    patient.close();
    ASSERT_TRUE(world.isAtRest());

    RawClient dropped(world.socketPath());
    keepReplies(dropped, 20);
    ASSERT_TRUE(eventually([&] { return keptCount() == 20; }));
    for (const auto& reply : kept)
        reply->send(large);
    EXPECT_TRUE(eventually([&] { return world.counts.invalids == 2; }));
    EXPECT_EQ(world.listener().counters().connectionsDropped, 1U);
    EXPECT_TRUE(world.isAtRest());

    // This one keeps within the limit, and goes.
    {
        RawClient leaves(world.socketPath());
        keepReplies(leaves, 6);
        ASSERT_TRUE(eventually([&] { return keptCount() == 6; }));
        for (const auto& reply : kept)
            reply->send(large);
        EXPECT_GT(world.listener().counters().outputBytes, world.limits.outputBytesPaused);
    }
    EXPECT_TRUE(eventually([&] { return world.counts.invalids == 3; }));
    EXPECT_TRUE(world.isAtRest());
}

// Goal: bytes that another process sends over a socket it was given are not the peer's: no request of it is served.
// Method: a child sends a whole request, and the second half of one, over this process's connection.
TEST(ListenerLimits, ASocketPassedToAnotherProcessIsNotThePeer) {
    ListenerWorld world;
    world.start();
    const plist::Data frame = frameOf(numbered(1), 1);
    for (const std::size_t own : {std::size_t{0}, std::size_t{20}}) {
        SCOPED_TRACE(own);
        RawClient client(world.socketPath());
        EXPECT_TRUE(client.isServed());
        const int before = world.counts.messages;
        if (own > 0) {
            ASSERT_TRUE(client.send(plist::Data(frame.begin(), frame.begin() + 20)));
        }
        const pid_t child = ::fork();
        ASSERT_GE(child, 0);
        if (child == 0) {
            const ssize_t sent = ::send(client.socket(), frame.data() + own, frame.size() - own, MSG_NOSIGNAL);
            ::_exit(sent == static_cast<ssize_t>(frame.size() - own) ? 0 : 1);
        }
        int status = 0;
        ASSERT_EQ(::waitpid(child, &status, 0), child);
        ASSERT_EQ(status, 0);
        EXPECT_TRUE(client.ended());
        EXPECT_EQ(world.counts.messages, before);
    }
    EXPECT_EQ(world.counts.others, 2);
    EXPECT_EQ(world.listener().counters().foreignSenders, 2U);
    EXPECT_TRUE(world.isAtRest());
}

// Goal: descriptors that a client sends along never become the daemon's. Method: a hundred requests with one each; this
// process, which is both sides, has as many open as before.
TEST(ListenerLimits, DescriptorsThatAClientSendsAreDropped) {
    ListenerWorld world;
    world.start();
    RawClient client(world.socketPath());
    EXPECT_TRUE(client.isServed());
    const std::size_t before = openDescriptors();
    for (std::uint64_t i = 0; i < 100; ++i) {
        ASSERT_TRUE(sendDescriptor(client.socket(), frameOf(numbered(i), i), 0));
        ASSERT_TRUE(client.receive());
    }
    EXPECT_EQ(openDescriptors(), before);
}

/// A socket that connects later, when there is no descriptor left to make one.
class LateClient {
public:
    LateClient() : socket_(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {}
    bool connect(const std::string& path) const {
        sockaddr_un address = {};
        address.sun_family = AF_UNIX;
        std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
        return ::connect(socket_.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) == 0;
    }
    bool hasEnded(int milliseconds) const {
        const timeval timeout = {.tv_sec = milliseconds / 1000, .tv_usec = milliseconds % 1000 * 1000};
        ::setsockopt(socket_.get(), SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
        char byte = 0;
        return ::recv(socket_.get(), &byte, 1, 0) == 0;
    }

private:
    FileDescriptor socket_;
};

// Goal: without descriptors connections are refused, the listener does not spin, and it recovers by itself. Method: the
// limit is lowered below what is open, first so that the reserve can be used, then so that nothing can.
TEST(ListenerLimits, OutOfDescriptorsItNeitherSpinsNorDies) {
    ListenerWorld world;
    world.start();
    RawClient before(world.socketPath());
    ASSERT_TRUE(before.isServed());
    std::vector<LateClient> late(6);
    const DescriptorLimit descriptors;
    const int highest = ::fcntl(0, F_DUPFD_CLOEXEC, 0);
    ::close(highest);
    // No number below the limit is free.
    ASSERT_TRUE(descriptors.set(static_cast<rlim_t>(highest)));
    for (std::size_t i = 0; i < 3; ++i) {
        ASSERT_TRUE(late[i].connect(world.socketPath()));
        EXPECT_TRUE(late[i].hasEnded(5000));
    }
    EXPECT_TRUE(eventually([&] { return world.listener().counters().connectionsRefused == 3; }));
    EXPECT_TRUE(before.isServed());
    // Not even the reserve's own number may be used again.
    ASSERT_TRUE(descriptors.set(3));
    for (std::size_t i = 3; i < 6; ++i)
        ASSERT_TRUE(late[i].connect(world.socketPath()));
    ASSERT_TRUE(eventually([&] { return world.listener().counters().connectionsRefused >= 4; }));
    const std::uint64_t triedBefore = world.listener().counters().connectionsRefused;
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    EXPECT_LE(world.listener().counters().connectionsRefused - triedBefore, 4U);
    EXPECT_TRUE(before.isServed());
    ASSERT_TRUE(descriptors.set(descriptors.hard()));
    EXPECT_TRUE(RawClient(world.socketPath()).isServed());
}

} // namespace
} // namespace zor::platform::test
