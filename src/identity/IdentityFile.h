// SPDX-License-Identifier: Apache-2.0
// One file of the identity registry, as a value: which executable it is about, who may be behind it, what it grants.
//
// Reading is strict: a file with a key of the wrong type, or a key that this version does not know, says nothing at
// all. A fence that was misspelled, or that a later version would understand, must not be left out silently. Pure
// functions.
#pragma once

#include "platform/PeerIdentity.h"

#include <cstdint>
#include <expected>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

namespace zor::platform {

struct RegistryEntry {
    std::string executable;
    std::optional<std::vector<std::uint32_t>> userIds;
    std::optional<std::string> unit;
    std::optional<std::string> securityLabel;
    /// Never nullptr.
    std::shared_ptr<const IdentityGrant> grant;

    /// The uid as reported: 0 is the owner of the root.
    [[nodiscard]] bool admitsUser(std::uint32_t reportedUserId) const;
    /// Compares what the files say, not where it lies in memory, nor what other files add to it.
    bool operator==(const RegistryEntry& other) const;
};

/// The entry, or in words what is wrong with the file.
[[nodiscard]] std::expected<RegistryEntry, std::string> parseIdentityFile(std::span<const std::uint8_t> bytes);

} // namespace zor::platform
