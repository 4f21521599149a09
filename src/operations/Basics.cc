// SPDX-License-Identifier: Apache-2.0
#include "operations/Basics.h"

#include "base/Assert.h"

namespace zor {

Result<void> checkAddress(const Log& log, const char* function, const ContainerAddress& address) {
    if (address.uuid && isValidClass(address.containerClass))
        return {};
    return Reporter(log, function)
        .error(ErrorCode::invalidObject, "Can't act on an invalid object: userId: %u, UUID: %s, Class: %ld",
               address.userId, address.uuid ? address.uuid->string().c_str() : "(null)",
               static_cast<long>(address.containerClass));
}

Result<std::shared_ptr<ZORMetadata>> knownContainer(const Log& log, ZORContainerCache& cache, const char* function,
                                                    const ContainerAddress& address, const IdentifierLock& held) {
    const std::string uuid = address.uuid->string();
    ZOR_ASSERT(held.identifier() == uuid);
    auto record = TRY(cache.containerForUser(address.userId, address.containerClass,
                                             address.identifier ? &*address.identifier : nullptr, uuid));
    if (record)
        return record;
    return Reporter(log, function)
        .error(ErrorCode::notFound, "No Container with userId: %u UUID: %s, identifier: %s, Class: %ld", address.userId,
               uuid.c_str(), ZOR_SHOWN(address.identifier), static_cast<long>(address.containerClass));
}

} // namespace zor
