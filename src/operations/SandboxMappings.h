// SPDX-License-Identifier: Apache-2.0
// Telling the sandbox where a user's data and group containers are. A stop between the removal of a mapping and its new
// setting leaves none; the operation that sets it is repeated or rolled back by its own recovery. Any thread.
#pragma once

#include "base/ContainerClass.h"
#include "base/FileURL.h"
#include "base/Log.h"
#include "platform/Device.h"

#include <cstdint>
#include <optional>
#include <string>

namespace zor {

class SandboxMappings {
public:
    SandboxMappings(const Log& log, platform::SandboxUserState& sandbox) : log_(log), sandbox_(sandbox) {}

    /// Removes the mapping, then sets it when there is a URL. False, logged, on failure.
    bool _setSandboxContainerMappingForUser(std::uint32_t userId, const std::string& identifier,
                                            ContainerClass containerClass, const std::optional<FileURL>& url);

private:
    const Log& log_;
    platform::SandboxUserState& sandbox_;
};

} // namespace zor
