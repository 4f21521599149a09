// SPDX-License-Identifier: Apache-2.0
// The program at the other end of a connection, as the kernel and the identity registry vouch for it.
#pragma once

#include "plist/Value.h"

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <sys/types.h>

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
};

} // namespace zor::platform
