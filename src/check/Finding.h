// SPDX-License-Identifier: Apache-2.0
// One thing that is wrong with a store, as a check found it.
#pragma once

#include "base/ContainerClass.h"
#include "base/UUID.h"
#include "check/FindingCode.h"

#include <cstdint>
#include <optional>
#include <string>

namespace zor::check {

struct Finding {
    FindingCode code{};
    /// Below the root, without a leading slash; absolute when it lies outside. Names that others chose: bytes.
    std::string path;
    /// One sentence without a full stop. May quote names.
    std::string what;
    std::optional<ContainerClass> containerClass;
    std::optional<std::uint32_t> user;
    /// Empty when it is not known.
    std::string identifier;
    bool transient = false;
    /// The container's identity, when its metadata was believed.
    std::optional<UUID> uuid;
    /// Of metadata that is not valid: the rule that it breaks, a short word.
    std::string rule;
    Mender mender = Mender::person;
    /// What a person may type; empty when nothing helps.
    std::string command;

    /// Whether two looks have seen the same.
    [[nodiscard]] bool isSameAs(const Finding& other) const {
        return code == other.code && path == other.path && identifier == other.identifier && user == other.user &&
               rule == other.rule;
    }
};

} // namespace zor::check
