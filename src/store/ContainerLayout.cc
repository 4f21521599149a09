// SPDX-License-Identifier: Apache-2.0
#include "store/ContainerLayout.h"

#include "base/Assert.h"
#include "store/Names.h"

namespace zor {

namespace {
constexpr const char* dataSubdirectories[] = {"Documents", "Library", "Library/Caches", "Library/Preferences",
                                              names::containerTemporary};
constexpr const char* groupSubdirectories[] = {"Library", "Library/Caches"};
} // namespace

ContainerLayout layoutOf(ContainerClass containerClass, std::uint32_t userId) {
    ZOR_ASSERT(isValidClass(containerClass));
    ContainerLayout layout;
    if (isBundleClass(containerClass)) {
        layout.topLevelOwner = userId;
        return layout;
    }
    const bool group =
        containerClass == ContainerClass::sharedAppGroup || containerClass == ContainerClass::sharedSystemGroup;
    layout.subdirectories =
        group ? std::span<const char* const>(groupSubdirectories) : std::span<const char* const>(dataSubdirectories);
    if (isSystemClass(containerClass)) {
        layout.subdirectoryMode = 0777; // services of several users work in them
    } else {
        layout.subdirectoryOwner = userId;
        layout.topLevelOwner = userId;
    }
    return layout;
}

std::optional<std::uint32_t> topLevelOwnerOf(ContainerClass containerClass, std::uint32_t userId) {
    const std::uint32_t owner = layoutOf(containerClass, userId).topLevelOwner;
    return owner == ownerUnchanged ? std::nullopt : std::optional(owner);
}

} // namespace zor
