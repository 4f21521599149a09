// SPDX-License-Identifier: Apache-2.0
#include "service/ListenerLimits.h"

#include <algorithm>

namespace zor::platform {

namespace {

/// The socket, the directory of the process in /proc, and its address space.
constexpr std::size_t descriptorsPerConnection = 3;
/// Not for connections: a quarter, which is more than the threads that run at once take for their walks, and at least
/// what an idle daemon and all upcall connections take, unless that is more than half.
constexpr std::size_t shareOfOwn = 4;
constexpr std::size_t ownLeast = 256;

} // namespace

ListenerLimits ListenerLimits::forDescriptors(std::size_t descriptorsMax) {
    ListenerLimits limits;
    const std::size_t own = std::max(descriptorsMax / shareOfOwn, std::min(ownLeast, descriptorsMax / 2));
    const std::size_t connections = (descriptorsMax - own) / descriptorsPerConnection;
    if (connections >= limits.connectionsMax)
        return limits;
    limits.connectionsMax = connections;
    limits.connectionsMaxPerUser = connections / 4;
    limits.connectionsKeptForOwners = std::min(limits.connectionsKeptForOwners, connections / 4);
    return limits;
}

ListenerLimits ListenerLimits::forUsers(const ipc::UserNumbers& owners) const {
    ListenerLimits limits = *this;
    limits.users = owners;
    if (owners.mobileUsers() > users.mobileUsers())
        limits.threadsMax += threadsMaxPerUser * (owners.mobileUsers() - users.mobileUsers());
    return limits;
}

} // namespace zor::platform
