// SPDX-License-Identifier: Apache-2.0
// Finding many containers: those of a class, or of every class and user.
#pragma once

#include "Commands.h"

#include <optional>
#include <string>
#include <vector>

namespace zorvanectl {

struct FoundContainer {
    zorvane::Client::Address address;
    /// The place where they were asked for.
    std::string path;
    std::uint64_t bytes = 0;
};
/// A class of a user's that could not be looked at, such as one whose home is not mounted.
struct UnreadClass {
    std::uint64_t containerClass = 0;
    std::uint32_t user = 0;
    zorvane::Error error;
};
struct FoundContainers {
    /// In the order that was asked for.
    std::vector<FoundContainer> containers;
    std::vector<UnreadClass> unread;
};

/// Those that are there; one that goes meanwhile is left out. An error where the one class that was asked for could not
/// be looked at, or none of all.
[[nodiscard]] zorvane::Result<FoundContainers> findContainers(zorvane::Client& client, const std::string& root,
                                                              const Target& target, const Listing& listing);

} // namespace zorvanectl
