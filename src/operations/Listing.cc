// SPDX-License-Identifier: Apache-2.0
// Listing the containers of a class. Changes nothing.
#include "operations/StoreServices.h"
#include "operations/ZORClientConnection.h"

namespace zor {

namespace {

std::vector<ZORClientConnection::ListedContainer> listed(const std::vector<ZORContainerCache::Record>& records) {
    std::vector<ZORClientConnection::ListedContainer> containers;
    containers.reserve(records.size());
    for (const auto& record : records)
        containers.push_back({.identifier = record->identifier(), .uuid = record->uuid()});
    return containers;
}

} // namespace

Result<void> ZORClientConnection::checkListedClass(std::uint32_t userId, ContainerClass containerClass) {
    if (isValidClass(containerClass))
        return {};
    return makeError(services_.log, {"containersForUser", __LINE__}, ErrorCode::invalidObject, nullptr, LogFlag::yes,
                     "Can't act on an invalid container-userId: %u, class: %ld", userId,
                     static_cast<long>(containerClass));
}

Result<std::vector<ZORClientConnection::ListedContainer>>
ZORClientConnection::containersForUser(std::uint32_t userId, ContainerClass containerClass, bool transient) {
    return services_.boundary.run(ZOR_HERE, [&]() -> Result<std::vector<ListedContainer>> {
        TRY(checkListedClass(userId, containerClass));
        const AllIdentifiersLock lock(services_.locks, LockMode::reading);
        return listed(TRY(services_.cache.allContainersForUser(userId, containerClass, transient)));
    });
}

Result<ZORClientConnection::ListedPage> ZORClientConnection::containersForUser(std::uint32_t userId,
                                                                               ContainerClass containerClass,
                                                                               bool transient,
                                                                               const std::string& after) {
    return services_.boundary.run(ZOR_HERE, [&]() -> Result<ListedPage> {
        TRY(checkListedClass(userId, containerClass));
        const AllIdentifiersLock lock(services_.locks, LockMode::reading);
        auto page = TRY(services_.cache.pageOfContainersForUser(userId, containerClass, transient,
                                                                {after, services_.limits.listPageMax}));
        return ListedPage{.containers = listed(page.records), .next = std::move(page.next)};
    });
}

} // namespace zor
