// SPDX-License-Identifier: Apache-2.0
// The sockets on which peers are met: made, passed on by the service manager, the status's and the upcall's. And the
// descriptors that peers pass along with their bytes: they hold no thread, neither one that receives them, nor one that
// closes the socket in which they lie unread. Method of that: TCP sockets that linger for twenty seconds, because
// nobody reads at their far end; they are sent before the listening socket comes to the listener, for after that newer
// kernels refuse them.
#include "os/RunLoop.h"
#include "os/ServiceManager.h"
#include "service/ListenerWorld.h"
#include "service/SeqpacketUpcallPort.h"
#include "service/StatusSocket.h"
#include "support/TestRoot.h"

#include <arpa/inet.h>
#include <sys/wait.h>

namespace zor::platform {
namespace {

using std::chrono::milliseconds;

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
        ServiceListener listener(identity, std::move(options));
        ASSERT_TRUE(listener.resume(echo));
        EXPECT_EQ(directory.modeOfSocket(), static_cast<mode_t>(S_IFSOCK | 0666));
        EXPECT_TRUE(RawClient(directory.socketPath()).isServed());
        listener.stop();
        EXPECT_EQ(directory.modeOfSocket(), 0U);
    }
    ::umask(umaskBefore);
}

// Only a listening stream socket is taken over from the service manager; it is served and stays.
TEST(ListenerSocket, PassedSocketsAreCheckedAndServed) {
    const SocketDirectory directory;
    KernelIdentity identity;
    const auto listenerWith = [&](int passed) {
        ListenerOptions options;
        options.passed.reset(passed);
        return std::make_unique<ServiceListener>(identity, std::move(options));
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
    RawClient client(directory.socketPath());
    {
        const auto listener = listenerWith(::dup(made));
        ASSERT_TRUE(listener->resume(echo));
        EXPECT_TRUE(client.isServed());
    }
    EXPECT_NE(directory.modeOfSocket(), 0U);
    // One that cannot start lets nobody in to wait for ever.
    RawClient waits(directory.socketPath());
    const auto listener = listenerWith(made);
    {
        const support::FewDescriptors none(0);
        EXPECT_FALSE(listener->resume(echo));
    }
    EXPECT_TRUE(waits.ended());
}

/// A status socket on a run loop of its own.
class StatusWorld {
public:
    explicit StatusWorld(StatusSocket::Build build, FileDescriptor passed = FileDescriptor())
        : status_(identity, loop_, std::move(build)) {
        EXPECT_FALSE(passed.valid() ? status_.adopt(std::move(passed)) : status_.open(directory.address()));
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
    RunLoop loop_;
    StatusSocket status_;
    std::thread thread_{[this] { loop_.run(); }};
};

// Clients that are silent, send rubbish, vanish at once or leave a large reply unread: each gets one frame about itself
// and the end, and nothing is left open. A reply that does not fit into a socket's buffer loses its details alone.
TEST(ListenerStatus, EveryPeerGetsOneReplyAndTheEnd) {
    const support::ProcessResources before;
    {
        std::atomic<bool> tooMuch{false};
        StatusWorld world([&](Peer& peer, StatusSocket::Detail detail) -> plist::Dictionary {
            plist::Dictionary reply = numbered(static_cast<std::uint64_t>(peer.pid()));
            if (detail != StatusSocket::Detail::brief)
                reply.set("Padding", plist::Data(tooMuch ? std::size_t{17} << 20 : 300'000, 1));
            return reply;
        });
        std::vector<RawClient> unread;
        for (int i = 0; i < 51; ++i) {
            tooMuch = i == 50;
            unread.emplace_back(world.directory.socketPath());
            RawClient(world.directory.socketPath()).close();
            RawClient client(world.directory.socketPath());
            if (i % 2 == 0)
                client.send(plist::Data(100, 0xFF));
            const std::optional<Reply> reply = client.receive();
            ASSERT_TRUE(reply);
            EXPECT_EQ(reply->id, 0U);
            EXPECT_EQ(reply->message.unsignedInteger("Number"), static_cast<std::uint64_t>(::getpid()));
            EXPECT_EQ(reply->message.data("Padding") == nullptr, i == 50);
            EXPECT_TRUE(client.ended());
        }
        EXPECT_TRUE(eventually([&] { return world.identity.peers == 0; }));
    }
    EXPECT_EQ(before.leakedSince(), "");
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
    const std::pair<std::string, const char*> meaningless[] = {{std::to_string(::getppid()), "1"},
                                                               {"", "1"},
                                                               {self + "x", "1"},
                                                               {self, "-1"},
                                                               {self, "1000000000"},
                                                               {self, ""}};
    pass(1);
    for (const auto& [pid, count] : meaningless)
        EXPECT_FALSE(PassedSockets::of({.pid = pid, .count = count, .names = "ipsi"}, first).take("ipsi").valid())
            << pid << count;
    EXPECT_EQ(::close(first), 0) << "what is another's is left alone";
    EXPECT_FALSE(PassedSockets::of({.pid = self, .count = "1", .names = "ipsi"}, first).take("ipsi").valid());
}

struct LingeringSocket {
    LingeringSocket() {
        const FileDescriptor listening(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
        sockaddr_in address = {
            .sin_family = AF_INET, .sin_port = 0, .sin_addr = {::htonl(INADDR_LOOPBACK)}, .sin_zero = {}};
        socklen_t length = sizeof address;
        auto* const plain = reinterpret_cast<sockaddr*>(&address);
        EXPECT_EQ(::bind(listening.get(), plain, length) | ::listen(listening.get(), 1), 0);
        EXPECT_EQ(::getsockname(listening.get(), plain, &length) | ::connect(near.get(), plain, length), 0);
        far.reset(::accept4(listening.get(), nullptr, nullptr, SOCK_CLOEXEC));
        const linger lingering = {.l_onoff = 1, .l_linger = 20};
        EXPECT_EQ(::setsockopt(near.get(), SOL_SOCKET, SO_LINGER, &lingering, sizeof lingering), 0);
        const std::vector<char> bytes(1 << 16);
        while (::send(near.get(), bytes.data(), bytes.size(), MSG_DONTWAIT) > 0) {
        }
    }
    FileDescriptor near{::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    FileDescriptor far;
};

/// A listening socket as the service manager passes it, with clients that have sent a request and a lingering socket.
class EarlyClients {
public:
    explicit EarlyClients(std::size_t count) {
        // Not as the listener makes one: the kernel would refuse what is passed along.
        EXPECT_TRUE(bindTo(listening.get(), directory.socketPath()));
        EXPECT_EQ(::listen(listening.get(), 16), 0);
        while (clients.size() < count) {
            clients.emplace_back(directory.socketPath());
            LingeringSocket lingering;
            EXPECT_TRUE(sendWithDescriptor(clients.back().socket(), frameOf(numbered(1), 1), lingering.near.get()));
            farEnds_.push_back(std::move(lingering.far));
        }
    }

    const SocketDirectory directory;
    FileDescriptor listening{::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    std::vector<RawClient> clients;

private:
    std::vector<FileDescriptor> farEnds_;
};

/// Answers each request with itself.
struct Listening {
    Listening(EarlyClients& early, const ListenerLimits& limits) {
        world.identity.owner = static_cast<uid_t>(-1);
        world.limits = limits;
        world.start({}, std::move(early.listening));
    }
    ListenerWorld world;
};

// Goal: no thread waits for what lingers, and nothing of it stays open. Method: each way in which a thread can come to
// close it.
TEST(PassedAlong, HoldsNobody) {
    using Act = std::function<void(EarlyClients&)>;
    const std::pair<const char*, Act> rows[] = {
        {"who receives it",
         [](EarlyClients& early) {
             // There can be no more threads.
             const Listening listening(early, {.threadsRunning = 2, .threadsMax = 2});
             for (RawClient& client : early.clients)
                 EXPECT_TRUE(client.receive());
         }},
        {"the stop, while the watcher's ticks are too rare to free a thread",
         [](EarlyClients& early) {
             const Listening listening(early, {.threadsRunning = 2, .threadsMax = 2, .tick = milliseconds(1000)});
             std::this_thread::sleep_for(milliseconds(100));
         }},
        {"the acceptor, which refuses all over the user's share",
         [](EarlyClients& early) {
             const Listening listening(early, {.connectionsMaxPerUser = 1});
             EXPECT_TRUE(early.clients[0].receive());
             for (std::size_t i = 1; i < early.clients.size(); ++i)
                 EXPECT_TRUE(early.clients[i].ended());
             early.clients[0].close();
             EXPECT_TRUE(eventually([&] { return RawClient(early.directory.socketPath()).isServed(); }));
         }},
        {"the status's thread, which reads nothing",
         [](EarlyClients& early) {
             const StatusWorld status([](Peer&, StatusSocket::Detail) { return numbered(1); },
                                      std::move(early.listening));
             for (RawClient& client : early.clients)
                 EXPECT_TRUE(client.receive());
         }},
    };
    for (const auto& [who, act] : rows) {
        SCOPED_TRACE(who);
        EarlyClients early(4);
        const support::ProcessResources before;
        const auto begin = std::chrono::steady_clock::now();
        act(early);
        EXPECT_LT(std::chrono::steady_clock::now() - begin, milliseconds(10'000)) << "it waited for what lingers";
        EXPECT_EQ(before.leakedSince(), "");
    }
}

// Goal: nothing that another process sends over a socket it was given is served. Method: a whole request and the second
// half of one, on a connection made before the listener had its socket, which has no credentials by itself, and after.
TEST(PassedAlong, ToAnotherProcessIsNotThePeer) {
    const plist::Data frame = frameOf(numbered(2), 2);
    for (const bool isEarly : {true, false})
        for (const std::size_t own : {std::size_t{0}, std::size_t{20}}) {
            SCOPED_TRACE(own);
            EarlyClients early(isEarly ? 1 : 0);
            Listening listening(early, {.threadsRunning = 1, .threadsMax = 1});
            RawClient client = isEarly ? std::move(early.clients[0]) : RawClient(early.directory.socketPath());
            EXPECT_TRUE(isEarly ? client.receive().has_value() : client.isServed());
            // A descriptor is refused at the sender once the socket is the listener's, if the kernel can.
            constexpr int passRights = 83;
            int known = 0;
            socklen_t length = sizeof known;
            if (!isEarly && ::getsockopt(client.socket(), SOL_SOCKET, passRights, &known, &length) == 0) {
                EXPECT_TRUE(!sendWithDescriptor(client.socket(), frame, 0) && errno == EPERM);
            }
            const int before = listening.world.counts.messages;
            ASSERT_TRUE(client.send(partOf(frame, 0, own)));
            const pid_t child = ::fork();
            if (child == 0)
                ::_exit(client.send(partOf(frame, own, frame.size())) ? 0 : 1);
            EXPECT_TRUE(client.ended());
            EXPECT_EQ(listening.world.counts.messages, before);
            ::waitpid(child, nullptr, 0);
        }
}

// Goal: an event that came for several things at once is served to its end. Method: they wait before anybody reads,
// behind bytes at which a receive stops.
TEST(PassedAlong, WhatWaitsBehindItIsNotForgotten) {
    const auto sendFromAnother = [](RawClient& client) {
        const pid_t child = ::fork();
        if (child == 0)
            ::_exit(client.send(numbered(2), 2) ? 0 : 1);
        ::waitpid(child, nullptr, 0);
    };
    const std::pair<const char*, std::function<void(RawClient&)>> rows[] = {
        {"a request", [](RawClient& client) { EXPECT_TRUE(client.send(numbered(2), 2)); }},
        {"the end", [](RawClient& client) { ::shutdown(client.socket(), SHUT_WR); }},
        {"another's request", sendFromAnother},
    };
    for (const auto& [what, act] : rows) {
        SCOPED_TRACE(what);
        EarlyClients early(1);
        RawClient& client = early.clients[0];
        act(client);
        const Listening listening(early, {.threadsRunning = 1, .threadsMax = 1});
        EXPECT_TRUE(client.receives(1, numbered(1)));
        EXPECT_TRUE(&act == &rows[0].second ? client.receives(2, numbered(2)) : client.ended());
    }
}

/// A port that is served on a thread of its own. Each reply is text: the packet's length, the sender's pid and uid.
class ServedPort {
public:
    ServedPort() {
        EXPECT_FALSE(before_.checkIn());
        EXPECT_FALSE(port_.checkIn()) << "the socket of a daemon that was killed is in nobody's way";
        EXPECT_TRUE(port_.serve(loop_, [this](const UpcallPacket& packet) { return answer(packet); }));
        thread_ = std::thread([this] { loop_.run(); });
    }
    ~ServedPort() {
        loop_.stop();
        thread_.join();
    }
    [[nodiscard]] const support::TestRoot& test() const { return test_; }
    [[nodiscard]] FileDescriptor connect() const {
        FileDescriptor socket(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
        if (!connectTo(socket.get(), test_.path("run/zorvane/com.veltra.zorvaned.upcall")))
            socket.reset();
        limitWaiting(socket.get());
        return socket;
    }

    KernelIdentity identity;
    std::atomic<std::size_t> replyBytes{0};
    std::atomic<int> answered{0};

private:
    std::vector<std::uint8_t> answer(const UpcallPacket& packet) {
        ++answered;
        std::string text = std::to_string(packet.bytes.size()) + " " +
                           (packet.senderPid ? std::to_string(*packet.senderPid) : "none") + " " +
                           (packet.senderUserId ? std::to_string(*packet.senderUserId) : "none");
        text.resize(std::max(text.size(), replyBytes.load()), '.');
        return {text.begin(), text.end()};
    }

    support::TestRoot test_;
    RunLoop loop_;
    SeqpacketUpcallPort before_{test_.root(), identity};
    SeqpacketUpcallPort port_{test_.root(), identity};
    std::thread thread_;
};

std::string receive(int socket) {
    std::string reply(std::size_t{2} << 20, '\0');
    const ssize_t bytes = ::recv(socket, reply.data(), reply.size(), 0);
    reply.resize(bytes < 0 ? 0 : static_cast<std::size_t>(bytes));
    return reply;
}

std::string ask(int socket, const std::string& packet) {
    EXPECT_EQ(::send(socket, packet.data(), packet.size(), MSG_NOSIGNAL), static_cast<ssize_t>(packet.size()));
    return receive(socket);
}

TEST(UpcallPort, TellsTheSenderAsTheKernelVouches) {
    ServedPort port;
    SeqpacketUpcallPort wrongType(port.test().root(), port.identity, FileDescriptor(::socket(AF_UNIX, SOCK_STREAM, 0)));
    EXPECT_EQ(wrongType.checkIn().number(), EINVAL);
    EXPECT_TRUE(port.test().item("run/zorvane/com.veltra.zorvaned.upcall").starts_with("other 0600 "));
    const FileDescriptor socket = port.connect();
    ASSERT_TRUE(socket.valid());
    const std::string uid = " " + std::to_string(::geteuid());
    EXPECT_EQ(ask(socket.get(), std::string(52, 'x')), "52 " + std::to_string(::getpid()) + uid);
    port.identity.kernelAgent = true;
    EXPECT_EQ(ask(socket.get(), "x"), "1 0" + uid);
    // The agent's socket in another process: that one keeps its pid.
    const pid_t child = ::fork();
    if (child == 0) {
        (void)!::send(socket.get(), "child", 5, MSG_NOSIGNAL);
        ::_exit(0);
    }
    EXPECT_EQ(receive(socket.get()), "5 " + std::to_string(child) + uid);
    ::waitpid(child, nullptr, 0);
}

// Packets that are too long, empty or carry descriptors, peers that do not read, are too many or go, cost the port
// nothing.
TEST(UpcallPort, SurvivesHostilePeers) {
    ServedPort port;
    const FileDescriptor socket = port.connect();
    const std::string tooLong(SeqpacketUpcallPort::packetBytesMax + 1, 'x');
    ASSERT_EQ(::send(socket.get(), tooLong.data(), tooLong.size(), 0), static_cast<ssize_t>(tooLong.size()));
    ASSERT_EQ(::send(socket.get(), "", 0, 0), 0);
    EXPECT_TRUE(ask(socket.get(), std::string(SeqpacketUpcallPort::packetBytesMax, 'x')).starts_with("65536 "));
    EXPECT_EQ(port.answered, 1);

    const support::ProcessResources before;
    for (int i = 0; i < 8; ++i) {
        if (!sendWithDescriptor(socket.get(), {'f'}, 0)) {
            ASSERT_EQ(errno, EPERM) << "newer kernels refuse it at the sender";
            continue;
        }
        EXPECT_TRUE(receive(socket.get()).starts_with("1 "));
    }
    EXPECT_EQ(before.leakedSince(), "");

    const FileDescriptor silent = port.connect();
    port.replyBytes = 10'000;
    for (int i = 0; i < 1000; ++i)
        (void)!::send(silent.get(), "x", 1, MSG_DONTWAIT);
    port.replyBytes = 0;
    EXPECT_TRUE(ask(socket.get(), "alive").starts_with("5 "));

    std::vector<FileDescriptor> crowd;
    for (std::size_t i = 0; i < SeqpacketUpcallPort::connectionsMax + 10; ++i)
        crowd.push_back(port.connect());
    // The last ones were turned away; the others go on.
    EXPECT_EQ(receive(crowd.back().get()), "");
    EXPECT_TRUE(ask(socket.get(), "alive").starts_with("5 "));
    crowd.clear();
    EXPECT_TRUE(eventually([&] {
        const FileDescriptor back = port.connect();
        return ::send(back.get(), "back", 4, MSG_NOSIGNAL) == 4 && !receive(back.get()).empty();
    }));
}

} // namespace
} // namespace zor::platform
