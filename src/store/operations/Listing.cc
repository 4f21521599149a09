// SPDX-License-Identifier: Apache-2.0
// Listing the containers of a class. Changes nothing.
#include "daemon/ZORClientConnection.h"
#include "store/StoreServices.h"

namespace zor {

Result<std::vector<ZORClientConnection::ListedContainer>>
ZORClientConnection::containersForUser(std::uint32_t userId, ContainerClass containerClass, bool transient) {
    return services_.boundary.run(ZOR_HERE, [&]() -> Result<std::vector<ListedContainer>> {
        if (!isValidClass(containerClass))
            return makeError(services_.log, {"containersForUser", __LINE__}, ErrorCode::invalidObject, nullptr,
                             LogFlag::yes, "Can't act on an invalid container-userId: %u, class: %ld", userId,
                             static_cast<long>(containerClass));
        const AllIdentifiersLock lock(services_.locks, LockMode::reading);
        const auto records = TRY(services_.cache.allContainersForUser(userId, containerClass, transient));
        std::vector<ListedContainer> listed;
        listed.reserve(records.size());
        for (const auto& record : records)
            listed.push_back({.identifier = record->identifier(), .uuid = record->uuid()});
        return listed;
    });
}

} // namespace zor
