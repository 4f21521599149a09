// SPDX-License-Identifier: Apache-2.0
// Finding a live container while nobody writes: without the all-identifiers lock, and without making or changing
// anything. Most lookups end here. Why such a lookup never answers from the middle of a writer stands in
// docs/decisions/0008-lookups-without-the-lock.md.
#pragma once

#include "base/ZORLocks.h"
#include "store/ZORContainerCache.h"

#include <cstdint>
#include <optional>
#include <string>

namespace zor {

/// The container as it is, on the disk and in the cache at one moment; nullopt when it is not there, or when anything
/// about it is out of the ordinary: then only the lookup under the lock can tell. The caller holds no identifier lock.
/// Waits for writers that are under way, for no reader. Any thread.
[[nodiscard]] std::optional<ZORContainerCache::LiveContainer>
lookUpUndisturbed(ZORLocks& locks, ZORContainerCache& cache, std::uint32_t userId, ContainerClass containerClass,
                  const std::string& identifier);

} // namespace zor
