// SPDX-License-Identifier: Apache-2.0
// One container that is known by its UUID: how a request names it, and the record that stands for it.
//
// The lock of such a container is the identifier lock of its UUID's string. An absent UUID or identifier is an error.
#pragma once

#include "base/ContainerClass.h"
#include "base/ZORError.h"
#include "base/ZORLocks.h"
#include "ipc/UUID.h"
#include "store/ZORContainerCache.h"

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

namespace zor {

struct ContainerAddress {
    std::uint32_t userId = 0;
    std::optional<UUID> uuid;
    std::optional<std::string> identifier;
    ContainerClass containerClass = ContainerClass::undefined;

    /// The container of an address that has been checked.
    [[nodiscard]] std::string lockName() const { return uuid->string(); }
};

/// Error 11, logged under `function`.
Result<void> checkAddress(const Log& log, const char* function, const ContainerAddress& address);
/// The cache's record of a checked address, whose lock is `held`. Error 21, logged under `function`, or 38.
Result<std::shared_ptr<ZORMetadata>> knownContainer(const Log& log, ZORContainerCache& cache, const char* function,
                                                    const ContainerAddress& address, const IdentifierLock& held);

} // namespace zor
