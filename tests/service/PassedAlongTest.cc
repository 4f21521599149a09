// SPDX-License-Identifier: Apache-2.0
// What peers pass along with their bytes holds no thread: neither one that receives it, nor one that closes the socket
// in which it lies unread. Method: TCP sockets that linger for twenty seconds, because nobody reads at their far end.
// They are sent before the listening socket comes to the listener; after that newer kernels refuse them.
#include "os/EpollRunLoop.h"
#include "service/ListenerWorld.h"
#include "service/StatusSocket.h"
#include "support/FileTree.h"
#include "support/ProcessResources.h"

#include <gtest/gtest.h>

#include <arpa/inet.h>
#include <cerrno>
#include <netinet/in.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

namespace zor::platform {
namespace {

using std::chrono::milliseconds;
using std::chrono::seconds;

struct LingeringSocket {
    LingeringSocket() {
        const FileDescriptor listening(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
        sockaddr_in address = {};
        address.sin_family = AF_INET;
        address.sin_addr.s_addr = ::htonl(INADDR_LOOPBACK);
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
        const sockaddr_un address = addressOf(path());
        EXPECT_EQ(::bind(listening.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
        EXPECT_EQ(::listen(listening.get(), 16), 0);
        while (clients.size() < count) {
            clients.emplace_back(path());
            LingeringSocket lingering;
            EXPECT_TRUE(sendWithDescriptor(clients.back().socket(), frameOf(numbered(1), 1), lingering.near.get()));
            farEnds_.push_back(std::move(lingering.far));
        }
    }
    std::string path() const { return directory_.path() + "/s"; }

    FileDescriptor listening{::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    std::vector<RawClient> clients;

private:
    const support::TemporaryDirectory directory_{"/tmp"};
    std::vector<FileDescriptor> farEnds_;
};

/// Answers each request with itself.
class ListenerOf {
public:
    ListenerOf(EarlyClients& early, const ListenerLimits& limits) : listener_(identity_, optionsOf(early, limits)) {
        identity_.everybodyOwnsRoot = false;
        EXPECT_TRUE(listener_.resume([this](PeerConnection&, ServiceEvent& event) {
            messages += event.kind == ServiceEvent::Kind::message ? 1 : 0;
            if (event.reply)
                event.reply->send(event.request);
        }));
    }
    std::atomic<int> messages{0};

private:
    static ListenerOptions optionsOf(EarlyClients& early, const ListenerLimits& limits) {
        ListenerOptions options;
        options.passed = std::move(early.listening);
        options.limits = limits;
        return options;
    }
    KernelIdentity identity_;
    LinuxServiceListener listener_;
};

// Goal: no thread waits for what lingers, and nothing of it stays open. Method: each way in which a thread can come to
// close it.
TEST(PassedAlong, HoldsNobody) {
    using Act = std::function<void(EarlyClients&)>;
    const std::pair<const char*, Act> rows[] = {
        {"who receives it",
         [](EarlyClients& early) {
             // There can be no more threads.
             const ListenerOf listener(early, {.threadsRunning = 2, .threadsMax = 2});
             for (RawClient& client : early.clients)
                 EXPECT_TRUE(client.receive());
         }},
        {"the stop, while the watcher's ticks are too rare to free a thread",
         [](EarlyClients& early) {
             const ListenerOf listener(early, {.threadsRunning = 2, .threadsMax = 2, .tick = milliseconds(1000)});
             std::this_thread::sleep_for(milliseconds(100));
         }},
        {"the acceptor, which refuses all over the user's share",
         [](EarlyClients& early) {
             const ListenerOf listener(early, {.connectionsMaxPerUser = 1});
             EXPECT_TRUE(early.clients[0].receive());
             for (std::size_t i = 1; i < early.clients.size(); ++i)
                 EXPECT_TRUE(early.clients[i].ended());
             early.clients[0].close();
             EXPECT_TRUE(eventually([&] { return RawClient(early.path()).isServed(); }));
         }},
        {"the status's thread, which reads nothing",
         [](EarlyClients& early) {
             KernelIdentity identity;
             EpollRunLoop loop;
             StatusSocket status(identity, loop, [](Peer&, StatusSocket::Detail) { return plist::Dictionary{}; });
             ASSERT_EQ(status.adopt(std::move(early.listening)), 0);
             std::thread thread([&] { loop.run(); });
             for (RawClient& client : early.clients)
                 EXPECT_TRUE(client.receive());
             loop.stop();
             thread.join();
         }},
    };
    for (const auto& [who, act] : rows) {
        SCOPED_TRACE(who);
        EarlyClients early(4);
        const support::ProcessResources before;
        const auto begin = std::chrono::steady_clock::now();
        act(early);
        EXPECT_LT(std::chrono::steady_clock::now() - begin, seconds(10)) << "it waited for what lingers";
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
            const ListenerOf listener(early, {.threadsRunning = 1, .threadsMax = 1});
            RawClient client = isEarly ? std::move(early.clients[0]) : RawClient(early.path());
            EXPECT_TRUE(isEarly ? client.receive().has_value() : client.isServed());
            const int before = listener.messages;
            ASSERT_TRUE(client.send(partOf(frame, 0, own)));
            const pid_t child = ::fork();
            if (child == 0)
                ::_exit(client.send(partOf(frame, own, frame.size())) ? 0 : 1);
            EXPECT_TRUE(client.ended());
            EXPECT_EQ(listener.messages, before);
            ::waitpid(child, nullptr, 0);
        }
}

// Once the socket is the listener's the kernel refuses at the sender, if it can.
TEST(PassedAlong, IsRefusedAtTheSender) {
    constexpr int passRights = 83;
    EarlyClients early(0);
    const ListenerOf listener(early, {});
    int known = 0;
    socklen_t length = sizeof known;
    RawClient client(early.path());
    if (::getsockopt(client.socket(), SOL_SOCKET, passRights, &known, &length) != 0)
        GTEST_SKIP() << "the kernel cannot";
    EXPECT_FALSE(sendWithDescriptor(client.socket(), frameOf(numbered(1), 1), 0));
    EXPECT_EQ(errno, EPERM);
    EXPECT_TRUE(client.isServed());
}

} // namespace
} // namespace zor::platform
