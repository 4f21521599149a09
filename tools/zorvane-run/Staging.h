// SPDX-License-Identifier: Apache-2.0
// Gives the sandbox's maker, which takes paths, what this program holds as descriptors.
//
// A tree that was opened and checked is mounted, by its descriptor, in a directory that exists in a mount namespace of
// the caller alone. Nobody else sees that directory or can change what its names lead to, and no path of a container
// is ever resolved again. All of it goes with the last process of the namespace.
#pragma once

#include "Mounts.h"

#include <array>

namespace zorvanerun {

/// The sandbox's files in memory, which several processes of the program share.
inline constexpr std::array<const char*, 2> memoryPlaces = {"/dev/shm", "/tmp"};

/// The place of the mount with this index, after stage().
[[nodiscard]] std::string stagedPath(std::size_t index);

/// The place of the memory with this index, empty and bounded.
[[nodiscard]] std::string stagedMemoryPath(std::size_t index);

/// The place for a socket that the program is to find.
[[nodiscard]] std::string stagedSocketPath();

/// Moves this process into a mount namespace of its own, with everything that has a descriptor in its place there.
/// nullptr, or the name of the call that failed (errno says why).
[[nodiscard]] const char* stage(const std::vector<Mount>& mounts);

} // namespace zorvanerun
