// SPDX-License-Identifier: Apache-2.0
// The process behind a connected socket: what the kernel recorded when it connected, and the process itself. Any
// thread.
#pragma once

#include "identity/AddressSpace.h"
#include "identity/IdentityRegistry.h"
#include "platform/PeerIdentity.h"

#include <string>
#include <string_view>

namespace zor::platform {

/// The first name in the process's path that is no slice: units of the system manager lie in slices only. So a unit
/// that a user's own manager started, whatever its name, is not it; what lies deeper than a system unit belongs to that
/// unit. Empty when there is none.
[[nodiscard]] std::string systemUnitInCgroups(std::string_view cgroups);

class LinuxPeerIdentity final : public PeerIdentity {
public:
    /// `daemonUserId` is the uid that this process runs under. A daemon that is not root reports its own uid and root's
    /// as 0: on its root it is the owner.
    LinuxPeerIdentity(IdentityRegistry& registry, uid_t daemonUserId)
        : registry_(registry), daemonUserId_(daemonUserId) {}

    /// Whether /proc is of this process's own pid namespace: in another's, numbers are other processes'. A daemon for
    /// which it is not cannot tell its peers apart.
    [[nodiscard]] static bool procIsOurs();

    /// The peer must not outlive this object.
    [[nodiscard]] std::unique_ptr<Peer> peerOfSocket(int socket) override;
    [[nodiscard]] bool ownsRoot(uid_t uid) const override { return uid == 0 || uid == daemonUserId_; }

private:
    IdentityRegistry& registry_;
    const uid_t daemonUserId_;
};

} // namespace zor::platform
