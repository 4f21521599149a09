// SPDX-License-Identifier: Apache-2.0
// How much clients may leave behind in the daemon's memory, and how a listing is cut into pages. Everything left behind
// is found again at the next start, so nothing of it may grow without bound.
//
// Shares count by the user whose containers they are, and bind every client but the owners of the root: users share
// what belongs to the bundles' and the system's owner, and the installer, an owner of the root, is not kept out by
// them. Tests make these smaller.
#pragma once

#include <cstddef>

namespace zor {

struct StoreLimits {
    /// Containers of one user, transient ones and groups among them. A record takes some hundred bytes, 1.4 KB with the
    /// longest identifier, so the ten users and the two owners stay below 2 GB at the very worst.
    std::size_t containersMaxPerUser = 100'000;
    /// Bytes of memory of the info values of one user's containers: those of one container may take a megabyte.
    std::size_t infoBytesMaxPerUser = std::size_t{64} << 20;
    /// Changes of protection that have begun and not ended: while the device is locked each takes some hundred bytes.
    std::size_t protectionChangesMax = 10'000;
    /// Containers in one page of a listing. With the longest identifiers that is 11 MB, of the 64 MB that a connection
    /// may have unread.
    std::size_t listPageMax = 10'000;
};

} // namespace zor
