// SPDX-License-Identifier: Apache-2.0
// The named service: connections, frames, replies. What a message means is the handler's business.
#pragma once

#include "platform/PeerIdentity.h"
#include "plist/Value.h"

#include <cstdint>
#include <functional>
#include <memory>

namespace zor::platform {

/// Where the reply to one request goes. Copies share the destination; the first send counts. Any thread.
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

class ServiceListener {
public:
    virtual ~ServiceListener() = default;
    /// Begins to accept and serve. False when the service cannot be made.
    virtual bool resume(ServiceHandler handler) = 0;
    /// Stops accepting, ends every connection and joins the threads.
    virtual void stop() = 0;
};

} // namespace zor::platform
