// SPDX-License-Identifier: Apache-2.0
#include "platform/PeerProcess.h"
#include "platform/linux/EpollRunLoop.h"
#include "platform/linux/Names.h"
#include "platform/linux/NotifySocket.h"
#include "platform/linux/PassedSockets.h"
#include "platform/linux/SeqpacketUpcallPort.h"

#include <algorithm>
#include <atomic>

namespace zor::platform {
namespace {

// Goal: sockets are taken only when they are meant for this process, by name, and none is inherited or left open.
TEST(PassedSockets, AreTakenByName) {
    const std::string self = std::to_string(::getpid());
    constexpr int first = 200;
    const auto pass = [&](int count) {
        for (int i = 0; i < count; ++i)
            ASSERT_EQ(::fcntl(0, F_DUPFD, first + i), first + i);
    };
    const auto isOpen = [](int fd) { return ::fcntl(fd, F_GETFD) >= 0; };
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
        EXPECT_FALSE(isOpen(first + i));
    const std::vector<PassedSockets::Variables> meaningless = {
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
    EXPECT_TRUE(isOpen(first)) << "what is another's is left alone";
    ::close(first);
    EXPECT_FALSE(PassedSockets::of({.pid = self, .count = "1", .names = "ipsi"}, first).take("ipsi").valid());
}

TEST(NotifySocket, SendsOneDatagram) {
    const TestRoot test;
    const FileDescriptor socket(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    const std::string path = test.path("notify");
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
    ASSERT_EQ(::bind(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    EXPECT_EQ(NotifySocket(path).send("READY=1"), 0);
    char buffer[64];
    EXPECT_EQ(::recv(socket.get(), buffer, sizeof buffer, MSG_DONTWAIT), 7);
    EXPECT_EQ(NotifySocket("").send("READY=1"), 0);
    EXPECT_EQ(NotifySocket(test.path("absent")).send("READY=1"), ENOENT);
    EXPECT_EQ(NotifySocket("relative").send("READY=1"), EINVAL);
    EXPECT_EQ(NotifySocket("/" + std::string(200, 'x')).send("READY=1"), EINVAL);
}

/// Grants to every peer what the test says.
class FixedIdentity final : public PeerIdentity {
public:
    std::atomic<bool> kernelAgent{false};

    [[nodiscard]] std::unique_ptr<Peer> peerOfSocket(int socket) override {
        ucred credentials{};
        socklen_t length = sizeof credentials;
        EXPECT_EQ(::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &credentials, &length), 0);
        return std::make_unique<FixedPeer>(*this, credentials.pid);
    }
    [[nodiscard]] bool ownsRoot(uid_t) const override { return false; }

private:
    class FixedPeer final : public Peer {
    public:
        FixedPeer(const FixedIdentity& owner, pid_t pid) : owner_(owner), pid_(pid) {}
        [[nodiscard]] Identity identify(Explain) override {
            return {.pid = pid_,
                    .effectiveUserId = 0,
                    .grant = std::make_shared<IdentityGrant>(IdentityGrant{.kernelAgent = owner_.kernelAgent}),
                    .explanation = {}};
        }
        [[nodiscard]] pid_t pid() const override { return pid_; }
        [[nodiscard]] uid_t kernelUserId() const override { return 0; }

    private:
        const FixedIdentity& owner_;
        const pid_t pid_;
    };
};

/// A port that is served on a thread of its own. Each reply is text: the packet's length, the sender's pid and uid.
class ServedPort {
public:
    explicit ServedPort(FileDescriptor passed = {}, std::size_t longName = 0)
        : test_(makeParent(longName)), port_(test_->root(), identity, std::move(passed)) {
        EXPECT_EQ(port_.checkIn(), 0) << port_.checkInCallName();
        EXPECT_TRUE(port_.serve(loop_, [this](const UpcallPacket& packet) { return answer(packet); }));
        thread_ = std::thread([this] { loop_.run(); });
    }
    ~ServedPort() {
        loop_.stop();
        thread_.join();
    }
    [[nodiscard]] const TestRoot& test() const { return *test_; }
    [[nodiscard]] std::size_t replyBytesMax() const { return port_.replyBytesMax(); }
    [[nodiscard]] FileDescriptor connect() const {
        FileDescriptor socket(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
        const FileDescriptor directory(::open(test_->path("run/zorvane").c_str(), O_PATH | O_CLOEXEC));
        const std::string path = "/proc/self/fd/" + std::to_string(directory.get()) + "/" + names::upcallSocket;
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
        if (::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0)
            socket.reset();
        const timeval patience{.tv_sec = 5, .tv_usec = 0};
        (void)::setsockopt(socket.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
        return socket;
    }

    FixedIdentity identity;
    std::atomic<std::size_t> replyBytes{0};
    std::atomic<int> answered{0};

private:
    static std::unique_ptr<TestRoot> makeParent(std::size_t longName) {
        if (longName == 0)
            return std::make_unique<TestRoot>();
        static const support::TemporaryDirectory parent("/tmp");
        const std::string path = parent.path() + "/" + std::string(longName, 'l');
        (void)::mkdir(path.c_str(), 0755);
        return std::make_unique<TestRoot>(path);
    }
    std::vector<std::uint8_t> answer(const UpcallPacket& packet) {
        ++answered;
        std::string text = std::to_string(packet.bytes.size()) + " " +
                           (packet.senderPid ? std::to_string(*packet.senderPid) : "none") + " " +
                           (packet.senderUserId ? std::to_string(*packet.senderUserId) : "none");
        text.resize(std::max(text.size(), replyBytes.load()), '.');
        return {text.begin(), text.end()};
    }

    std::unique_ptr<TestRoot> test_;
    EpollRunLoop loop_;
    SeqpacketUpcallPort port_;
    std::thread thread_;
};

std::string ask(int socket, const std::string& packet) {
    EXPECT_EQ(::send(socket, packet.data(), packet.size(), MSG_NOSIGNAL), static_cast<ssize_t>(packet.size()));
    std::string reply(std::size_t{2} << 20, '\0');
    const ssize_t bytes = ::recv(socket, reply.data(), reply.size(), 0);
    reply.resize(bytes < 0 ? 0 : static_cast<std::size_t>(bytes));
    return reply;
}

TEST(UpcallPort, TellsTheSenderAsTheKernelVouches) {
    ServedPort port;
    struct stat status{};
    ASSERT_EQ(::stat(port.test().path("run/zorvane/com.veltra.zorvaned.upcall").c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & ALLPERMS, 0600U);
    const FileDescriptor socket = port.connect();
    ASSERT_TRUE(socket.valid());
    const std::string ids = std::to_string(::getpid()) + " " + std::to_string(::geteuid());
    EXPECT_EQ(ask(socket.get(), std::string(52, 'x')), "52 " + ids);
    port.identity.kernelAgent = true;
    EXPECT_EQ(ask(socket.get(), "x"), "1 0 " + std::to_string(::geteuid()));
    // The agent's socket in another process: that one keeps its pid.
    const pid_t child = ::fork();
    if (child == 0) {
        (void)!::send(socket.get(), "child", 5, MSG_NOSIGNAL);
        ::_exit(0);
    }
    char reply[64] = {};
    ASSERT_GT(::recv(socket.get(), reply, sizeof reply - 1, 0), 0);
    EXPECT_EQ(std::string(reply), "5 " + std::to_string(child) + " " + std::to_string(::geteuid()));
    ::waitpid(child, nullptr, 0);
}

// Goal: no packet and no peer holds up the port or costs it anything. Method: packets that are too long, empty, or
// carry descriptors; peers that do not read, that are too many, that go.
TEST(UpcallPort, SurvivesHostilePeers) {
    ServedPort port;
    const FileDescriptor socket = port.connect();
    const std::string tooLong(SeqpacketUpcallPort::packetBytesMax + 1, 'x');
    ASSERT_EQ(::send(socket.get(), tooLong.data(), tooLong.size(), 0), static_cast<ssize_t>(tooLong.size()));
    ASSERT_EQ(::send(socket.get(), "", 0, 0), 0);
    EXPECT_TRUE(ask(socket.get(), std::string(SeqpacketUpcallPort::packetBytesMax, 'x')).starts_with("65536 "));
    EXPECT_EQ(port.answered, 1);

    const auto openDescriptors = [] {
        int count = 0;
        for (int fd = 0; fd < 256; ++fd)
            count += ::fcntl(fd, F_GETFD) >= 0 ? 1 : 0;
        return count;
    };
    const int before = openDescriptors();
    for (int i = 0; i < 8; ++i) {
        alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))] = {};
        char byte = 'f';
        iovec part{.iov_base = &byte, .iov_len = 1};
        msghdr message{};
        message.msg_iov = &part;
        message.msg_iovlen = 1;
        message.msg_control = control;
        message.msg_controllen = sizeof control;
        cmsghdr* const header = CMSG_FIRSTHDR(&message);
        header->cmsg_level = SOL_SOCKET;
        header->cmsg_type = SCM_RIGHTS;
        header->cmsg_len = CMSG_LEN(sizeof(int));
        const int given = 0;
        std::memcpy(CMSG_DATA(header), &given, sizeof given);
        ASSERT_EQ(::sendmsg(socket.get(), &message, 0), 1);
        char reply[64];
        ASSERT_GT(::recv(socket.get(), reply, sizeof reply, 0), 0);
    }
    EXPECT_EQ(openDescriptors(), before);

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
    char byte = 0;
    EXPECT_LE(::recv(crowd.back().get(), &byte, 1, 0), 0);
    EXPECT_TRUE(ask(socket.get(), "alive").starts_with("5 "));
    crowd.clear();
    EXPECT_TRUE(eventually([&] {
        const FileDescriptor back = port.connect();
        char reply[64];
        return ::send(back.get(), "back", 4, MSG_NOSIGNAL) == 4 && ::recv(back.get(), reply, sizeof reply, 0) > 0;
    }));
}

// Goal: the longest reply that the port promises arrives whole; one that is longer is dropped and the port lives on.
TEST(UpcallPort, SendsWhatItPromises) {
    ServedPort port;
    EXPECT_GE(port.replyBytesMax(), std::size_t{64} * 1024);
    EXPECT_LE(port.replyBytesMax(), std::size_t{1} << 20);
    const FileDescriptor socket = port.connect();
    port.replyBytes = port.replyBytesMax();
    EXPECT_EQ(ask(socket.get(), "x").size(), port.replyBytesMax());
    port.replyBytes = std::size_t{4} << 20;
    ASSERT_EQ(::send(socket.get(), "x", 1, 0), 1);
    ASSERT_TRUE(eventually([&] { return port.answered == 2; }));
    port.replyBytes = 0;
    EXPECT_TRUE(ask(socket.get(), "xy").starts_with("2 "));
}

// Goal: a path that no socket address holds works, a stale socket is replaced, and a passed socket is used as it is.
TEST(UpcallPort, BindsWhereverTheRootLies) {
    const ServedPort deep({}, 120);
    EXPECT_TRUE(ask(deep.connect().get(), "x").starts_with("1 "));
    {
        const TestRoot test;
        FixedIdentity identity;
        SeqpacketUpcallPort first(test.root(), identity);
        SeqpacketUpcallPort second(test.root(), identity);
        EXPECT_EQ(first.checkIn(), 0);
        EXPECT_EQ(second.checkIn(), 0) << "the socket of a daemon that was killed is in nobody's way";
    }
    PeerServer stream(SOCK_STREAM);
    FixedIdentity identity;
    const TestRoot test;
    SeqpacketUpcallPort wrongType(test.root(), identity, FileDescriptor(::socket(AF_UNIX, SOCK_STREAM, 0)));
    EXPECT_EQ(wrongType.checkIn(), EINVAL);
    EXPECT_STREQ(wrongType.checkInCallName(), "LISTEN_FDS");
}

} // namespace
} // namespace zor::platform
