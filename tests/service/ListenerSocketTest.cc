// SPDX-License-Identifier: Apache-2.0
#include "os/EpollRunLoop.h"
#include "service/ListenerWorld.h"
#include "service/PassedSockets.h"
#include "service/StatusSocket.h"
#include "support/FewDescriptors.h"
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

// Goal: a listener that cannot start lets nobody in to wait for ever. Method: a passed socket with a client, and no
// descriptor for anything else.
TEST(ListenerSocket, ASocketThatCannotBeServedIsClosed) {
    const support::TemporaryDirectory directory("/tmp");
    const FileDescriptor opened(::open(directory.path().c_str(), O_PATH | O_CLOEXEC));
    auto made = makeListenerSocket({.directory = opened.get(), .directoryPath = directory.path(), .name = "s"},
                                   SOCK_STREAM, 0666);
    ASSERT_TRUE(made);
    RawClient client(directory.path() + "/s");
    KernelIdentity identity;
    ListenerOptions options;
    options.passed = std::move(*made);
    LinuxServiceListener listener(identity, std::move(options));
    {
        const support::FewDescriptors none(0);
        EXPECT_FALSE(listener.resume([](PeerConnection&, ServiceEvent&) {}));
    }
    EXPECT_TRUE(client.ended());
}

// Sockets are taken only when they are meant for this process, by name, and none is inherited or left open.
TEST(PassedSockets, AreTakenByName) {
    const std::string self = std::to_string(::getpid());
    constexpr int first = 200;
    const auto pass = [&](int count) {
        for (int i = 0; i < count; ++i)
            ASSERT_EQ(::fcntl(0, F_DUPFD, first + i), first + i);
    };
    pass(3);
    {
        auto passed = PassedSockets::of({.pid = self, .count = "3", .names = "upcall:other:ipsi"}, first);
        const FileDescriptor service = passed.take("ipsi");
        EXPECT_EQ(service.get(), first + 2);
        EXPECT_EQ(::fcntl(service.get(), F_GETFD), FD_CLOEXEC);
        EXPECT_EQ(passed.take("upcall").get(), first);
        EXPECT_FALSE(passed.take("ipsi").valid());
        EXPECT_FALSE(passed.take("absent").valid());
    }
    for (int i = 0; i < 3; ++i)
        EXPECT_EQ(::fcntl(first + i, F_GETFD), -1);
    const PassedSockets::Variables meaningless[] = {
        {.pid = std::to_string(::getppid()), .count = "1", .names = "ipsi"},
        {.pid = "", .count = "1", .names = "ipsi"},
        {.pid = self + "x", .count = "1", .names = "ipsi"},
        {.pid = self, .count = "-1", .names = "ipsi"},
        {.pid = self, .count = "1000000000", .names = "ipsi"},
        {.pid = self, .count = "", .names = "ipsi"},
    };
    pass(1);
    for (const auto& variables : meaningless)
        EXPECT_FALSE(PassedSockets::of(variables, first).take("ipsi").valid()) << variables.pid << variables.count;
    EXPECT_EQ(::close(first), 0) << "what is another's is left alone";
    EXPECT_FALSE(PassedSockets::of({.pid = self, .count = "1", .names = "ipsi"}, first).take("ipsi").valid());
}

} // namespace
} // namespace zor::platform
