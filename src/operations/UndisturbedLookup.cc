// SPDX-License-Identifier: Apache-2.0
#include "operations/UndisturbedLookup.h"

namespace zor {

std::optional<ZORContainerCache::LiveContainer> lookUpUndisturbed(ZORLocks& locks, ZORContainerCache& cache,
                                                                  std::uint32_t userId, ContainerClass containerClass,
                                                                  const std::string& identifier) {
    if (const auto before = locks.quietGeneration()) {
        auto live = cache.liveContainerForUser(userId, containerClass, identifier);
        if (locks.quietGeneration() == before)
            return live;
    }
    cache.prepare(userId, containerClass, false);
    // A reader counts as no disturbance: lookups that meet a writer do not slow one another down when it is done.
    const AllIdentifiersLock lock(locks, LockMode::reading);
    return cache.liveContainerForUser(userId, containerClass, identifier);
}

} // namespace zor
