// SPDX-License-Identifier: Apache-2.0
// The two ways in, requests of clients and upcalls of the kernel, and the program at the other end of a connection, as
// the kernel and the identity registry vouch for it.
#pragma once

#include "platform/Errno.h"
#include "platform/Process.h"
#include "plist/Value.h"

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <sys/types.h>
#include <vector>

namespace zor::platform::entitlementKeys {

// The entitlements that give power over what belongs to others. The dispatcher judges by them, and the identity
// registry fences whoever is granted one of them; both take the names from here.

/// Boolean: every command.
inline constexpr std::string_view allowed = "com.veltra.private.Zorvane.allowed";
/// Boolean: look up containers of other identifiers.
inline constexpr std::string_view otherIdLookup = "com.veltra.private.Zorvane.otherIdLookup";
/// Array of strings: the identifiers whose containers may be wiped.
inline constexpr std::string_view wipeContainer = "com.veltra.private.Zorvane.wipeContainer";

} // namespace zor::platform::entitlementKeys

namespace zor::platform {

/// A number that somebody leaves on an object which others share, to know it again: no part of the object's value, so a
/// copy begins without one. 0 until it is left. Any thread.
class LeftNumber {
public:
    LeftNumber() = default;
    LeftNumber(const LeftNumber&) {}
    LeftNumber& operator=(const LeftNumber&) { return *this; }
    ~LeftNumber() = default;
    [[nodiscard]] std::uint64_t get() const { return number_.load(std::memory_order_acquire); }
    void leave(std::uint64_t number) { number_.store(number, std::memory_order_release); }

private:
    std::atomic<std::uint64_t> number_{0};
};

/// The powers that the registry grants to one executable. Immutable and shared: a peer's dictionary is handed out by
/// pointer, never copied, and two messages of an unchanged peer get the very same object.
struct IdentityGrant {
    std::optional<std::string> identifier;
    std::optional<plist::Dictionary> entitlements;
    bool kernelAgent = false;
    /// The peer may ask for its own identifier only.
    bool onlyOwnIdentifier = false;
    /// The entitlements of all entries of the identifier together; absent where this is its only entry. Stored for the
    /// identifier, and no power.
    std::optional<plist::Dictionary> identifierEntitlements;
    /// The generation of the entitlement map in which nothing of the grant was left to be registered.
    mutable LeftNumber registeredGeneration{};
};

/// The answer for one message.
struct Identity {
    pid_t pid = 0;
    /// As reported: on a root that is not owned by root its owner is 0.
    std::uint32_t effectiveUserId = 0;
    /// nullptr when the executable matches no entry.
    std::shared_ptr<const IdentityGrant> grant;
    /// In words, for people: why there is no grant, or which entry gave it.
    std::string explanation;
};

/// One connected peer, made when its connection is accepted. One thread at a time.
class Peer {
public:
    virtual ~Peer() = default;
    /// The peer as it is now. Checked against the kernel on every call: a peer that has executed another program, or
    /// has exited, stops being what it was. Cheap when nothing changed: no allocation, and `explanation` is left empty
    /// unless asked for.
    enum class Explain { no, yes };
    [[nodiscard]] virtual Identity identify(Explain explain) = 0;
    [[nodiscard]] virtual pid_t pid() const = 0;
    /// The uid that the kernel reports, for limits by uid.
    [[nodiscard]] virtual uid_t kernelUserId() const = 0;
};

class PeerIdentity {
public:
    virtual ~PeerIdentity() = default;
    /// Pins the peer of a connected socket. nullptr when the kernel does not tell who it is, or there is no descriptor
    /// or no memory to pin it with: errno says which. Any thread.
    [[nodiscard]] virtual std::unique_ptr<Peer> peerOfSocket(int socket) = 0;
    /// Whether this kernel uid counts as the owner of the root: root, or the daemon's own user.
    [[nodiscard]] virtual bool ownsRoot(uid_t uid) const = 0;
    /// Whether programs of the identifier may be given sockets that a service manager opened. Any thread.
    [[nodiscard]] virtual bool allowsPassedSockets(std::string_view identifier) = 0;
};

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
