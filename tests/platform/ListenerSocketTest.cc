// SPDX-License-Identifier: Apache-2.0
#include "platform/ListenerWorld.h"

#include "platform/linux/EpollRunLoop.h"
#include "platform/linux/StatusSocket.h"
#include "support/ProcessResources.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <thread>
#include <unistd.h>

namespace zor::platform::test {
namespace {

/// A directory whose path is as long as asked for.
class LongDirectory {
public:
    explicit LongDirectory(std::size_t nameLength) : base_("/tmp/zorvane-socket-XXXXXX") {
        ::mkdtemp(base_.data());
        path_ = base_ + "/" + std::string(nameLength, 'd');
        ::mkdir(path_.c_str(), 0755);
        descriptor_.reset(::open(path_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    }
    ~LongDirectory() {
        ::unlinkat(descriptor_.get(), "s", 0);
        ::rmdir(path_.c_str());
        ::rmdir(base_.c_str());
    }
    ListenerAddress address() const { return {.directory = descriptor_.get(), .directoryPath = path_, .name = "s"}; }
    /// A path that fits an address, whatever the directory's does.
    std::string shortPath() const { return "/proc/self/fd/" + std::to_string(descriptor_.get()) + "/s"; }
    mode_t modeOfSocket() const {
        struct stat status = {};
        return ::fstatat(descriptor_.get(), "s", &status, AT_SYMLINK_NOFOLLOW) == 0 ? status.st_mode : 0;
    }

private:
    std::string base_;
    std::string path_;
    FileDescriptor descriptor_;
};

// Goal: a socket is made at any path length, with its mode whatever the umask, in the place of a left-over one, and
// goes with its listener. Method: paths that fit and do not fit an address; each is connected to and served.
TEST(ListenerSocket, IsMadeAtAnyPathWithItsMode) {
    const mode_t umaskBefore = ::umask(077);
    for (const std::size_t length : {5U, 79U, 80U, 81U, 82U, 83U, 200U}) {
        SCOPED_TRACE(length);
        const LongDirectory directory(length);
        KernelIdentity identity;
        // Made and left behind, as by a daemon that was killed.
        ASSERT_TRUE(makeListenerSocket(directory.address(), SOCK_STREAM, 0600));
        EXPECT_EQ(directory.modeOfSocket(), static_cast<mode_t>(S_IFSOCK | 0600));
        ListenerOptions options;
        options.address = directory.address();
        LinuxServiceListener listener(identity, std::move(options));
        ASSERT_TRUE(listener.resume([](PeerConnection&, ServiceEvent& event) {
            if (event.reply)
                event.reply->send(event.request);
        }));
        EXPECT_EQ(directory.modeOfSocket(), static_cast<mode_t>(S_IFSOCK | 0666));
        EXPECT_TRUE(RawClient(directory.shortPath()).isServed());
        listener.stop();
        EXPECT_EQ(directory.modeOfSocket(), 0U);
    }
    ::umask(umaskBefore);
}

// Goal: only a listening stream socket is taken over from the service manager, and such a one is served with the sender
// check and left in place. Method: a table of descriptors.
TEST(ListenerSocket, PassedSocketsAreCheckedAndServed) {
    const LongDirectory directory(5);
    KernelIdentity identity;
    const auto resume = [&](FileDescriptor passed) {
        ListenerOptions options;
        options.passed = std::move(passed);
        LinuxServiceListener listener(identity, std::move(options));
        return listener.resume([](PeerConnection&, ServiceEvent&) {});
    };
    EXPECT_FALSE(resume(FileDescriptor(::open("/dev/null", O_RDWR | O_CLOEXEC))));
    EXPECT_FALSE(resume(FileDescriptor(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0))));
    EXPECT_FALSE(resume(FileDescriptor(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0))));
    auto packets = makeListenerSocket(directory.address(), SOCK_SEQPACKET, 0666);
    EXPECT_FALSE(resume(std::move(*packets)));

    auto made = makeListenerSocket(directory.address(), SOCK_STREAM, 0666);
    // As the service manager passes it: blocking, and inherited.
    ASSERT_EQ(::fcntl(made->get(), F_SETFL, 0), 0);
    ASSERT_EQ(::fcntl(made->get(), F_SETFD, 0), 0);
    std::atomic<int> messages{0};
    ListenerOptions options;
    options.passed = std::move(*made);
    LinuxServiceListener listener(identity, std::move(options));
    ASSERT_TRUE(listener.resume([&](PeerConnection&, ServiceEvent& event) {
        messages += event.kind == ServiceEvent::Kind::message;
        if (event.reply)
            event.reply->send(event.request);
    }));
    RawClient client(directory.shortPath());
    EXPECT_TRUE(client.isServed());
    listener.stop();
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
    const LongDirectory directory{120};

private:
    EpollRunLoop loop_;
    StatusSocket status_;
    std::thread thread_;
};

// Goal: whoever connects gets one frame about itself and the end, whatever it sends or does not read, and nothing is
// left open. Method: clients that are silent, send rubbish, vanish at once, or leave a large reply unread.
TEST(ListenerStatus, EveryPeerGetsOneReplyAndTheEnd) {
    const support::ProcessResources before;
    {
        StatusWorld world([](Peer& peer, StatusSocket::Detail) -> plist::Dictionary {
            return {{"Peer", plist::Dictionary{{"PID", static_cast<std::uint64_t>(peer.pid())}}},
                    {"Padding", plist::Data(300'000, 1)}};
        });
        std::vector<std::unique_ptr<RawClient>> unread;
        for (int i = 0; i < 50; ++i) {
            unread.push_back(std::make_unique<RawClient>(world.directory.shortPath()));
            RawClient vanished(world.directory.shortPath());
            vanished.close();
            RawClient client(world.directory.shortPath());
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

// Goal: what does not fit into a socket's buffer costs a peer the details, not the answer. Method: a full form larger
// than a frame may be.
TEST(ListenerStatus, TooMuchIsToldBriefly) {
    StatusWorld world([](Peer&, StatusSocket::Detail detail) -> plist::Dictionary {
        if (detail == StatusSocket::Detail::brief)
            return {{"Brief", true}};
        return {{"Padding", plist::Data(std::size_t{17} << 20, 1)}};
    });
    RawClient client(world.directory.shortPath());
    const std::optional<Reply> reply = client.receive();
    ASSERT_TRUE(reply);
    EXPECT_TRUE(reply->message.isTrue("Brief"));
    EXPECT_TRUE(client.ended());
}

} // namespace
} // namespace zor::platform::test
