// SPDX-License-Identifier: Apache-2.0
// The inside of a container of each class: its standard subdirectories, their mode and owner.
#pragma once

#include "base/ContainerClass.h"
#include "base/UserIdentity.h"
#include "fs/ZORFileManager.h"

#include <optional>
#include <span>

namespace zor {

struct ContainerLayout {
    /// Relative to the container, parents before children; NUL-terminated.
    std::span<const char* const> subdirectories;
    mode_t subdirectoryMode = 0755;
    std::uint32_t subdirectoryOwner = ownerUnchanged;
    mode_t topLevelMode = 0755;
    std::uint32_t topLevelOwner = ownerUnchanged;
    int topLevelProtectionClass = 0;
};

/// The layout of a valid class for a container of `userId`.
[[nodiscard]] ContainerLayout layoutOf(ContainerClass containerClass, std::uint32_t userId);

/// The user whose a container's directory is. Absent: nobody but root can put anything in its place.
[[nodiscard]] std::optional<std::uint32_t> topLevelOwnerOf(ContainerClass containerClass, std::uint32_t userId);

} // namespace zor
