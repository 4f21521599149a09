// SPDX-License-Identifier: Apache-2.0
// Finding the container that a command names by its identifier.
#pragma once

#include "Commands.h"
#include "content/ContainerDirectory.h"

#include <span>

namespace zorvanectl {

/// The daemon's code for a container that is not there.
inline constexpr std::uint64_t codeNotFound = 21;

[[nodiscard]] std::uint32_t userOf(const Target& target);

/// The address of a container. Asking for it otherwise would discard a transient one.
[[nodiscard]] zorvane::Result<zorvane::Client::Address> find(zorvane::Client& client, const Target& target,
                                                             bool transient);

/// How the directory of such a container is to be opened.
[[nodiscard]] content::MountFence::Kind fenceKind(std::uint64_t containerClass);

/// Bytes that containers take together; nothing when that cannot be told. On a connection of its own: one whose time
/// ran out over it would be of no more use for what follows.
[[nodiscard]] std::optional<std::uint64_t> measured(const zorvane::ConnectOptions& connect,
                                                    std::span<const zorvane::Client::Address> containers);

/// Whether so much of an identifier's is to go for good, and what else, where there is something.
[[nodiscard]] std::string lossQuestion(const std::string& verb, const std::optional<std::uint64_t>& bytes,
                                       const std::string& identifier, const std::string& also = {});

/// Connects, finds the container, and does with it what is to be done.
template <typename Body>
int withContainer(const zorvane::ConnectOptions& connect, const Output& output, const Target& target,
                  const std::string& what, Body&& body) {
    auto client = zorvane::Client::connect(connect);
    if (!client)
        return output.error(client.error(), what);
    const auto address = find(*client, target, target.transient);
    if (!address)
        return output.error(address.error(), what);
    return body(*client, *address);
}

} // namespace zorvanectl
