// SPDX-License-Identifier: Apache-2.0
// The two ways in: requests of clients, and upcalls of the kernel.
#pragma once

#include "platform/Errno.h"
#include "platform/PeerIdentity.h"
#include "platform/WorkQueue.h"
#include "plist/Value.h"

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

namespace zor::platform {

class RunLoop;

// The named service: connections, frames, replies. The meaning of a message is the handler's business.

/// The destination of the reply to one request. Copies share the destination; the first send counts. Any thread.
class ReplyChannel {
public:
    virtual ~ReplyChannel() = default;
    /// Sends the one reply. Never blocks: what the peer does not take is kept until it does, or until too much is kept.
    virtual void send(const plist::Dictionary& reply) = 0;
};

/// One event on a connection.
struct ServiceEvent {
    enum class Kind {
        message,
        /// Something arrived that is no message: a header that is broken, a payload that is no dictionary. It has no
        /// reply.
        other,
        /// The connection has ended. The last event of a connection.
        invalid,
    };
    Kind kind = Kind::message;
    /// The request; empty unless kind is message.
    plist::Dictionary request;
    /// nullptr when the request cannot have a reply.
    std::shared_ptr<ReplyChannel> reply;
    /// The number that the client gave the request, and finds in the reply; 0 unless kind is message.
    std::uint64_t requestId = 0;
};

/// A peer connection as its handler sees it. Used only inside the handler's call.
class PeerConnection {
public:
    virtual ~PeerConnection() = default;
    virtual Peer& peer() = 0;
    /// Ends the connection: nothing more is read from it, and no reply is sent for the message being handled.
    virtual void cancel() = 0;
};

/// Called for each event of each connection: one at a time for one connection, in parallel for different ones.
using ServiceHandler = std::function<void(PeerConnection&, ServiceEvent&)>;

// The kernel's port: packets with the sender's credentials, and replies.

struct UpcallPacket {
    std::span<const std::uint8_t> bytes;
    /// Absent when the kernel vouched for no credentials.
    std::optional<pid_t> senderPid;
    std::optional<uid_t> senderUserId;
};

class UpcallPort {
public:
    virtual ~UpcallPort() = default;
    /// Binds the port under its service name. After an error `checkInCallName` names the call that failed.
    virtual Errno checkIn() = 0;
    [[nodiscard]] virtual const char* checkInCallName() const = 0;
    /// Serves packets on the loop: the handler returns the reply packet, empty for none. False when no source can be
    /// made; `sourceCallName` then names the call.
    virtual bool serve(RunLoop& loop, std::function<std::vector<std::uint8_t>(const UpcallPacket&)> handler) = 0;
    [[nodiscard]] virtual const char* sourceCallName() const = 0;
    /// The longest reply packet that the port can send; known once it is checked in. A longer one is dropped.
    [[nodiscard]] virtual std::size_t replyBytesMax() const { return std::size_t{1} << 20; }
};

} // namespace zor::platform
