// SPDX-License-Identifier: Apache-2.0
// What the tests of the listener stand on: a listener over its own socket with a handler that the test gives, peers
// that are what the kernel says, and raw clients that may send any bytes.
#pragma once

#include "ipc/Frame.h"
#include "platform/FileDescriptor.h"
#include "platform/linux/LinuxServiceListener.h"
#include "plist/Value.h"

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace zor::platform::test {

/// Peers as SO_PEERCRED tells them.
class KernelIdentity final : public PeerIdentity {
public:
    std::unique_ptr<Peer> peerOfSocket(int socket) override;
    bool ownsRoot(uid_t) const override { return everybodyOwnsRoot; }

    bool everybodyOwnsRoot = true;
    std::atomic<bool> knowsPeers{true};
    /// Peers that exist; each connection has one until it has ended.
    std::atomic<int> peers{0};
};

/// One whole frame.
plist::Data frameOf(const plist::Dictionary& message, std::uint64_t id, std::uint32_t flags = ipc::frameExpectsReply);
plist::Data frameOf(std::uint32_t length, std::uint32_t flags, std::uint64_t id, const plist::Data& payload);
/// A request that the echo handler answers with "Number".
plist::Dictionary numbered(std::uint64_t number);

struct Reply {
    std::uint64_t id = 0;
    plist::Dictionary message;
};

/// A client that knows nothing of what is right. Its calls give up after ten seconds.
class RawClient {
public:
    explicit RawClient(const std::string& socketPath);

    int socket() const { return socket_.get(); }
    /// False when the daemon's side has closed.
    bool send(const plist::Data& bytes);
    bool send(const plist::Dictionary& message, std::uint64_t id) { return send(frameOf(message, id)); }
    /// nullopt at the end of the stream, on a reset, or when nothing comes.
    std::optional<Reply> receive();
    /// The same, when something comes within a few milliseconds.
    std::optional<Reply> receiveIfAny();
    /// Waits for the end of the stream or a reset; false when anything else comes, or nothing.
    bool ended();
    /// A request that comes back, so the listener is alive for this client.
    bool isServed();
    void close() { socket_.reset(); }

private:
    bool receiveExactly(std::uint8_t* bytes, std::size_t count);
    FileDescriptor socket_;
};

/// Counts the events that a handler gets.
struct EventCounts {
    std::atomic<int> messages{0};
    std::atomic<int> others{0};
    std::atomic<int> invalids{0};
};

class ListenerWorld {
public:
    using MessageHandler = std::function<void(PeerConnection&, ServiceEvent&)>;

    ListenerWorld();
    ~ListenerWorld();

    /// Starts; `onMessage` gets the messages (the request comes back when it is empty), `counts` all events. That a
    /// connection has one event at a time is checked for every one.
    void start(MessageHandler onMessage = {});
    void stop();
    /// Where everything was given back: no connection, no byte, no peer. Waits up to ten seconds for it.
    bool isAtRest();

    const std::string& socketPath() const { return socketPath_; }
    LinuxServiceListener& listener() { return *listener_; }
    std::vector<std::string> reports();

    ListenerLimits limits;
    KernelIdentity identity;
    EventCounts counts;

private:
    void handle(PeerConnection& connection, ServiceEvent& event);

    std::string directory_;
    FileDescriptor directoryDescriptor_;
    std::string socketPath_;
    MessageHandler onMessage_;
    std::mutex mutex_;
    std::set<const PeerConnection*> inHandler_;
    std::vector<std::string> reports_;
    std::unique_ptr<LinuxServiceListener> listener_;
};

/// Waits up to ten seconds.
bool eventually(const std::function<bool()>& condition);

} // namespace zor::platform::test
