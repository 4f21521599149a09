// SPDX-License-Identifier: Apache-2.0
// The ground of the tests of sockets: a listener over its own socket with a handler that the test gives, peers that are
// what the kernel says, and raw clients that may send any bytes.
#pragma once

#include "base/Mutex.h"
#include "plist/Codec.h"
#include "service/ServiceListener.h"
#include "support/FewDescriptors.h"
#include "support/FileTree.h"
#include "support/Files.h"
#include "support/Frames.h"
#include "support/ProcessResources.h"
#include "support/Waiting.h"

#include <algorithm>
#include <atomic>
#include <gtest/gtest.h>
#include <mutex>
#include <random>
#include <semaphore>
#include <sys/syscall.h>

namespace zor::platform {

using support::addressOf;
using support::bindTo;
using support::connectTo;
using support::eventually;
using support::frameOf;
using support::inThreads;
using support::limitWaiting;
using support::sendWithDescriptor;

/// Peers as SO_PEERCRED tells them.
class KernelIdentity final : public PeerIdentity {
public:
    std::unique_ptr<Peer> peerOfSocket(int socket) override {
        ucred credentials = {};
        socklen_t length = sizeof credentials;
        if (!knowsPeers || ::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0)
            return nullptr;
        return std::make_unique<KernelPeer>(*this, credentials);
    }
    bool ownsRoot(uid_t uid) const override { return !owner || uid == *owner; }
    bool allowsPassedSockets(std::string_view) override { return false; }

    /// Everybody when there is none.
    std::optional<uid_t> owner;
    std::atomic<bool> knowsPeers{true};
    /// The grant that every peer gets.
    std::atomic<bool> kernelAgent{false};
    /// Peers that exist; each connection has one until it has ended.
    std::atomic<int> peers{0};

private:
    class KernelPeer final : public Peer {
    public:
        KernelPeer(KernelIdentity& owner, const ucred& credentials) : owner_(owner), credentials_(credentials) {
            ++owner_.peers;
        }
        ~KernelPeer() override { --owner_.peers; }
        Identity identify(Explain) override {
            return {.pid = credentials_.pid,
                    .effectiveUserId = credentials_.uid,
                    .grant = std::make_shared<IdentityGrant>(IdentityGrant{.kernelAgent = owner_.kernelAgent}),
                    .explanation = {}};
        }
        pid_t pid() const override { return credentials_.pid; }
        uid_t kernelUserId() const override { return credentials_.uid; }

    private:
        KernelIdentity& owner_;
        const ucred credentials_;
    };
};

/// A directory for a socket, which has a path of so many bytes there.
class SocketDirectory {
public:
    explicit SocketDirectory(std::size_t pathBytes = 50) {
        path_.resize(pathBytes - 2, 'd');
        support::makeDirectory(AT_FDCWD, path_);
        descriptor_ = support::openDirectory(path_);
    }
    ListenerAddress address() const { return {.directory = descriptor_.get(), .directoryPath = path_, .name = "s"}; }
    /// A path that fits an address, whatever the directory's does.
    std::string socketPath() const { return "/proc/self/fd/" + std::to_string(descriptor_.get()) + "/s"; }
    /// 0 when there is none.
    mode_t modeOfSocket() const {
        struct stat status = {};
        return ::fstatat(descriptor_.get(), "s", &status, AT_SYMLINK_NOFOLLOW) == 0 ? status.st_mode : 0;
    }

private:
    const support::TemporaryDirectory base_{"/tmp"};
    std::string path_ = base_.path() + "/";
    FileDescriptor descriptor_;
};

inline void append(plist::Data& bytes, const plist::Data& more) {
    bytes.insert(bytes.end(), more.begin(), more.end());
}

inline plist::Data partOf(const plist::Data& bytes, std::size_t begin, std::size_t end) {
    return {bytes.data() + begin, bytes.data() + end};
}

/// A request with a number in it.
inline plist::Dictionary numbered(std::uint64_t number) {
    return {{"Number", number}};
}

/// The request of a client that wants to know whether it is served.
inline const plist::Dictionary ordinaryRequest = {{"Question", true}};

/// As many frames as that, numbered from 0 on, which are also their ids.
inline plist::Data burstOf(std::uint64_t count, std::uint32_t flags = ipc::frameExpectsReply) {
    plist::Data burst;
    for (std::uint64_t i = 0; i < count; ++i)
        append(burst, frameOf(numbered(i), i, flags));
    return burst;
}

struct Reply {
    std::uint64_t id = 0;
    plist::Dictionary message;
};

/// A client that knows nothing of what is right. Its calls give up after ten seconds.
class RawClient {
public:
    explicit RawClient(const std::string& socketPath) : socket_(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
        EXPECT_TRUE(connectTo(socket_.get(), socketPath)) << errno;
        limitWaiting(socket_.get());
    }
    int socket() const { return socket_.get(); }
    /// False when the daemon's side has closed.
    bool send(const plist::Data& bytes) { return support::sendAll(socket_.get(), bytes); }
    bool send(const plist::Dictionary& message, std::uint64_t id) { return send(frameOf(message, id)); }
    /// nullopt at the end of the stream, on a reset, or when nothing comes.
    std::optional<Reply> receive() {
        const auto frame = support::receiveFrame(socket_.get());
        if (!frame)
            return {};
        EXPECT_TRUE(frame->header.isValidReply());
        return Reply{.id = frame->header.id, .message = frame->message()};
    }
    /// Whether this is the next reply.
    bool receives(std::uint64_t id, const plist::Dictionary& message) {
        const std::optional<Reply> reply = receive();
        return reply && reply->id == id && reply->message == message;
    }
    /// Waits for the end of the stream or a reset; false when anything else comes, or nothing.
    bool ended() {
        std::uint8_t byte = 0;
        const ssize_t received = ::recv(socket_.get(), &byte, 1, 0);
        return received == 0 || (received < 0 && errno == ECONNRESET);
    }
    /// A request that comes back, so the listener is alive for this client.
    bool isServed() { return send(ordinaryRequest, 4711) && receives(4711, ordinaryRequest); }
    void close() { socket_.reset(); }

private:
    FileDescriptor socket_;
};

/// The ways to answer that a handler keeps for later. Any thread.
class KeptReplies {
public:
    void keep(const ServiceEvent& event) {
        const std::lock_guard lock(mutex_);
        kept_.push_back(event.reply);
    }
    /// Waits for so many and takes them.
    std::vector<std::shared_ptr<ReplyChannel>> take(std::size_t count) {
        EXPECT_TRUE(eventually([&] {
            const std::lock_guard lock(mutex_);
            return kept_.size() >= count;
        }));
        const std::lock_guard lock(mutex_);
        return std::exchange(kept_, {});
    }

private:
    std::mutex mutex_;
    std::vector<std::shared_ptr<ReplyChannel>> kept_;
};

class ListenerWorld {
public:
    using MessageHandler = std::function<void(PeerConnection&, ServiceEvent&)>;

    ~ListenerWorld() { stop(); }

    /// Starts; `onMessage` gets the messages (the request comes back when it is empty), `counts` all events. That a
    /// connection has one event at a time is checked for every one. A socket that is `passed` takes the place of its
    /// own.
    void start(MessageHandler onMessage = {}, FileDescriptor passed = FileDescriptor()) {
        onMessage_ = std::move(onMessage);
        ListenerOptions options;
        options.address = directory_.address();
        options.passed = std::move(passed);
        options.limits = limits;
        options.report = [this](std::string_view line) {
            const std::lock_guard lock(mutex_);
            reports_.emplace_back(line);
        };
        listener_ = std::make_unique<ServiceListener>(identity, std::move(options));
        EXPECT_TRUE(listener_->resume([this](PeerConnection& connection, ServiceEvent& event) {
            {
                const std::lock_guard lock(mutex_);
                EXPECT_TRUE(inHandler_.insert(&connection).second) << "two events of one connection at once";
            }
            const auto leave = [&](const void*) {
                const std::lock_guard lock(mutex_);
                inHandler_.erase(&connection);
            };
            const std::unique_ptr<const void, decltype(leave)> inside(&connection, leave);
            handle(connection, event);
        })) << errno;
    }
    void stop() {
        if (listener_)
            listener_->stop();
    }
    /// Whether everything was given back: no connection, no byte, no peer. Waits up to ten seconds for that.
    bool isAtRest() {
        return eventually([this] {
            const ListenerCounters now = counters();
            return now.connections == 0 && now.inputBytes == 0 && now.outputBytes == 0 && identity.peers == 0;
        });
    }
    std::string socketPath() const { return directory_.socketPath(); }
    RawClient connect() const { return RawClient(socketPath()); }
    /// As another user, when the test is root: the kernel tells the effective uid of the thread that connects.
    RawClient connectAs(uid_t uid) const {
        (void)::syscall(SYS_setresuid, -1, uid, -1);
        RawClient client(socketPath());
        (void)::syscall(SYS_setresuid, -1, 0, -1);
        return client;
    }
    std::vector<RawClient> connect(std::size_t count) const {
        std::vector<RawClient> clients;
        while (clients.size() < count)
            clients.push_back(connect());
        return clients;
    }
    ListenerCounters counters() const { return listener_->counters(); }
    /// Waits until a report has these words.
    bool reports(std::string_view words) {
        return eventually([&] {
            const std::lock_guard lock(mutex_);
            return std::ranges::any_of(reports_, [&](const std::string& line) { return line.contains(words); });
        });
    }

    ListenerLimits limits;
    KernelIdentity identity;
    /// The events that the handler got.
    struct {
        std::atomic<int> messages{0};
        std::atomic<int> others{0};
        std::atomic<int> invalids{0};
    } counts;

private:
    void handle(PeerConnection& connection, ServiceEvent& event) {
        if (event.kind == ServiceEvent::Kind::invalid) {
            ++counts.invalids;
        } else if (event.kind == ServiceEvent::Kind::other) {
            ++counts.others;
            EXPECT_EQ(event.reply, nullptr);
        } else {
            ++counts.messages;
            if (onMessage_)
                onMessage_(connection, event);
            else if (event.reply)
                event.reply->send(event.request);
        }
    }

    const SocketDirectory directory_;
    MessageHandler onMessage_;
    std::mutex mutex_;
    std::set<const PeerConnection*> inHandler_;
    std::vector<std::string> reports_;
    std::unique_ptr<ServiceListener> listener_;
};

} // namespace zor::platform
