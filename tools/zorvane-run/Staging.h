// SPDX-License-Identifier: Apache-2.0
// Puts the sandbox's tree together, for the sandbox's maker, which takes paths: out of what this program holds as
// descriptors.
//
// A tree that was opened and checked is mounted, by its descriptor, at its place below a directory that exists in a
// mount namespace of this program alone. Nobody else sees that directory or can change what its names lead to, and no
// path of a container is ever resolved again. The maker gets the whole as one mount, whose parts have their flags
// already. All of it goes with the last process of the namespace.
#pragma once

#include "Mounts.h"

namespace zorvanerun {

/// The sandbox's root, after stage(): everything but /proc, which is empty there.
inline constexpr const char* stagedRoot = "/mnt/root";
/// The sandbox's /dev/shm: memory with a bound, and the mounts whose places are in there.
inline constexpr const char* memoryPlace = "/dev/shm";
/// The place for a socket that the program is to find.
inline constexpr const char* stagedSocket = "/mnt/socket";

/// Moves this process into a mount namespace of its own. nullptr, or the name of the call that failed (errno says why).
[[nodiscard]] const char* leaveMountNamespace();

/// Mounts everything at its place; `mounts` were opened in the namespace that the process has. As above.
[[nodiscard]] const char* stage(const std::vector<Mount>& mounts);

} // namespace zorvanerun
