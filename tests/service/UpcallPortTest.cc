// SPDX-License-Identifier: Apache-2.0
#include "os/EpollRunLoop.h"
#include "os/Names.h"
#include "service/ListenerWorld.h"
#include "service/SeqpacketUpcallPort.h"
#include "support/TestRoot.h"

#include <sys/wait.h>

namespace zor::platform {
namespace {

using support::TestRoot;

/// A port that is served on a thread of its own. Each reply is text: the packet's length, the sender's pid and uid.
class ServedPort {
public:
    ServedPort() {
        EXPECT_EQ(port_.checkIn(), 0) << port_.checkInCallName();
        EXPECT_TRUE(port_.serve(loop_, [this](const UpcallPacket& packet) { return answer(packet); }));
        thread_ = std::thread([this] { loop_.run(); });
    }
    ~ServedPort() {
        loop_.stop();
        thread_.join();
    }
    [[nodiscard]] const TestRoot& test() const { return test_; }
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

    TestRoot test_;
    EpollRunLoop loop_;
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
    struct stat status{};
    ASSERT_EQ(::stat(port.test().path("run/zorvane/com.veltra.zorvaned.upcall").c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & ALLPERMS, 0600U);
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

// A stale socket is replaced, and a passed one must be of the right type.
TEST(UpcallPort, TakesOnlyASocketOfItsOwn) {
    const TestRoot test;
    KernelIdentity identity;
    SeqpacketUpcallPort first(test.root(), identity);
    SeqpacketUpcallPort second(test.root(), identity);
    EXPECT_EQ(first.checkIn(), 0);
    EXPECT_EQ(second.checkIn(), 0) << "the socket of a daemon that was killed is in nobody's way";
    SeqpacketUpcallPort wrongType(test.root(), identity, FileDescriptor(::socket(AF_UNIX, SOCK_STREAM, 0)));
    EXPECT_EQ(wrongType.checkIn(), EINVAL);
}

} // namespace
} // namespace zor::platform
