// SPDX-License-Identifier: Apache-2.0
// The containers of a process as the daemon tells them, judged before anything is done with them.
//
// The daemon is trusted to name containers, but a launcher that runs as root mounts nothing on the word of bytes alone:
// each path has to lie below the root, in the place of its class, and to be of a container that was asked for. Pure
// functions.
#pragma once

#include "upcall/packbuff/UpcallMessage.h"

#include <cstdint>
#include <expected>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace zorvanerun {

/// The containers that a process is to get besides its data container.
struct WantedContainers {
    std::set<std::string> applicationGroups;
    std::set<std::string> systemGroups;
    bool systemContainer = false;
};

/// Absolute paths without "." or "..", none of them inside another; groups by identifier.
struct ToldContainers {
    std::string home; // of the user; nothing but the place where the user's containers lie
    std::string data;
    std::string temporary;
    std::map<std::string, std::string> applicationGroups;
    std::optional<std::string> systemContainer;
    std::map<std::string, std::string> systemGroups;
};

/// The packed buffer that asks; empty without memory, or when an identifier holds a NUL.
[[nodiscard]] std::vector<std::uint8_t> packRequest(const std::string& identifier, std::uint32_t user,
                                                    const WantedContainers& wanted);

/// The containers that a packed reply tells, or in words why it is not believed. `root` is canonical.
[[nodiscard]] std::expected<ToldContainers, std::string>
readReply(zor::upcall::Bytes buffer, const WantedContainers& wanted, const std::string& root);

/// Whether `path` is absolute and made of plain names: no empty one, no "." or "..", no control character.
[[nodiscard]] bool isPlainPath(const std::string& path);
/// Whether `inner` is `outer` or lies below it. Both are plain.
[[nodiscard]] bool isAtOrBelow(const std::string& inner, const std::string& outer);

} // namespace zorvanerun
