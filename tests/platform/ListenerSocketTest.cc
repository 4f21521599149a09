// SPDX-License-Identifier: Apache-2.0
#include "os/EpollRunLoop.h"
#include "platform/ListenerWorld.h"
#include "service/StatusSocket.h"
#include "support/ProcessResources.h"

#include <sys/socket.h>

namespace zor::platform {
namespace {

void echo(PeerConnection&, ServiceEvent& event) {
    if (event.reply)
        event.reply->send(event.request);
}

// A socket is made at paths that fit and do not fit an address, with its mode whatever the umask, in the place of a
// left-over one, and goes with its listener.
TEST(ListenerSocket, IsMadeAtAnyPathWithItsMode) {
    const mode_t umaskBefore = ::umask(077);
    for (const std::size_t pathBytes : {50U, 106U, 107U, 108U, 109U, 110U, 250U}) {
        SCOPED_TRACE(pathBytes);
        const SocketDirectory directory(pathBytes);
        KernelIdentity identity;
        // Made and left behind, as by a daemon that was killed.
        ASSERT_TRUE(makeListenerSocket(directory.address(), SOCK_STREAM, 0600));
        EXPECT_EQ(directory.modeOfSocket(), static_cast<mode_t>(S_IFSOCK | 0600));
        ListenerOptions options;
        options.address = directory.address();
        LinuxServiceListener listener(identity, std::move(options));
        ASSERT_TRUE(listener.resume(echo));
        EXPECT_EQ(directory.modeOfSocket(), static_cast<mode_t>(S_IFSOCK | 0666));
        EXPECT_TRUE(RawClient(directory.socketPath()).isServed());
        listener.stop();
        EXPECT_EQ(directory.modeOfSocket(), 0U);
    }
    ::umask(umaskBefore);
}

// Only a listening stream socket is taken over from the service manager; it is served with the sender check and stays.
TEST(ListenerSocket, PassedSocketsAreCheckedAndServed) {
    const SocketDirectory directory;
    KernelIdentity identity;
    const auto listenerWith = [&](int passed) {
        ListenerOptions options;
        options.passed.reset(passed);
        return std::make_unique<LinuxServiceListener>(identity, std::move(options));
    };
    for (const int wrong : {
             ::open("/dev/null", O_RDWR | O_CLOEXEC),
             ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0),
             ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0),
             makeListenerSocket(directory.address(), SOCK_SEQPACKET, 0666)->release(),
         })
        EXPECT_FALSE(listenerWith(wrong)->resume(echo));

    const int made = makeListenerSocket(directory.address(), SOCK_STREAM, 0666)->release();
    // As the service manager passes it: blocking, and inherited.
    ASSERT_EQ(::fcntl(made, F_SETFL, 0), 0);
    ASSERT_EQ(::fcntl(made, F_SETFD, 0), 0);
    const auto listener = listenerWith(made);
    ASSERT_TRUE(listener->resume(echo));
    RawClient client(directory.socketPath());
    EXPECT_TRUE(client.isServed());
    listener->stop();
    EXPECT_NE(directory.modeOfSocket(), 0U);
}

/// A status socket on a run loop of its own.
class StatusWorld {
public:
    explicit StatusWorld(StatusSocket::Build build) : status_(identity, loop_, std::move(build)) {
        EXPECT_EQ(status_.open(directory.address()), 0);
        thread_ = std::thread([this] { loop_.run(); });
    }
    ~StatusWorld() {
        loop_.stop();
        thread_.join();
        status_.close();
        EXPECT_EQ(directory.modeOfSocket(), 0U);
    }
    KernelIdentity identity;
    const SocketDirectory directory{150};

private:
    EpollRunLoop loop_;
    StatusSocket status_;
    std::thread thread_;
};

// Clients that are silent, send rubbish, vanish at once or leave a large reply unread: each gets one frame about itself
// and the end, and nothing is left open.
TEST(ListenerStatus, EveryPeerGetsOneReplyAndTheEnd) {
    const support::ProcessResources before;
    {
        StatusWorld world([](Peer& peer, StatusSocket::Detail) -> plist::Dictionary {
            return {{"Peer", plist::Dictionary{{"PID", static_cast<std::uint64_t>(peer.pid())}}},
                    {"Padding", plist::Data(300'000, 1)}};
        });
        std::vector<RawClient> unread;
        for (int i = 0; i < 50; ++i) {
            unread.emplace_back(world.directory.socketPath());
            RawClient(world.directory.socketPath()).close();
            RawClient client(world.directory.socketPath());
            if (i % 2 == 0)
                client.send(plist::Data(100, 0xFF));
            const std::optional<Reply> reply = client.receive();
            ASSERT_TRUE(reply);
            EXPECT_EQ(reply->id, 0U);
            EXPECT_EQ(reply->message.dictionary("Peer")->unsignedInteger("PID"),
                      static_cast<std::uint64_t>(::getpid()));
            EXPECT_TRUE(client.ended());
        }
        EXPECT_TRUE(eventually([&] { return world.identity.peers == 0; }));
    }
    EXPECT_EQ(before.leakedSince(), "");
}

// What does not fit into a socket's buffer costs a peer the details, not the answer.
TEST(ListenerStatus, TooMuchIsToldBriefly) {
    StatusWorld world([](Peer&, StatusSocket::Detail detail) -> plist::Dictionary {
        if (detail == StatusSocket::Detail::brief)
            return {{"Brief", true}};
        return {{"Padding", plist::Data(std::size_t{17} << 20, 1)}};
    });
    RawClient client(world.directory.socketPath());
    EXPECT_TRUE(client.receives(0, {{"Brief", true}}));
    EXPECT_TRUE(client.ended());
}

} // namespace
} // namespace zor::platform
