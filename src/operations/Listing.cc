// SPDX-License-Identifier: Apache-2.0
#include "operations/Listing.h"

namespace zor {

namespace {

std::vector<ListedContainer> listed(const std::vector<ZORContainerCache::Record>& records) {
    std::vector<ListedContainer> containers;
    containers.reserve(records.size());
    for (const auto& record : records)
        containers.push_back({.identifier = record->identifier(), .uuid = record->uuid()});
    return containers;
}

} // namespace

Result<void> Listing::checkListedClass(std::uint32_t userId, ContainerClass containerClass) {
    if (isValidClass(containerClass))
        return {};
    return Reporter(needs_.log, "containersForUser")
        .error(ErrorCode::invalidObject, "Can't act on an invalid container-userId: %u, class: %ld", userId,
               static_cast<long>(containerClass));
}

Result<std::vector<ListedContainer>> Listing::containersForUser(std::uint32_t userId, ContainerClass containerClass,
                                                                bool transient) {
    return needs_.boundary.run(ZOR_HERE, [&]() -> Result<std::vector<ListedContainer>> {
        TRY(checkListedClass(userId, containerClass));
        return needs_.replaces.undisturbed([&]() -> Result<std::vector<ListedContainer>> {
            needs_.cache.prepare(userId, containerClass, transient);
            const AllIdentifiersLock lock(needs_.locks, LockMode::reading);
            TRY(needs_.replaces.refuseIfUnderWay(userId, containerClass));
            return listed(TRY(needs_.cache.allContainersForUser(userId, containerClass, transient)));
        });
    });
}

Result<ListedPage> Listing::containersForUser(std::uint32_t userId, ContainerClass containerClass, bool transient,
                                              const std::string& after) {
    return needs_.boundary.run(ZOR_HERE, [&]() -> Result<ListedPage> {
        TRY(checkListedClass(userId, containerClass));
        return needs_.replaces.undisturbed([&]() -> Result<ListedPage> {
            needs_.cache.prepare(userId, containerClass, transient);
            const AllIdentifiersLock lock(needs_.locks, LockMode::reading);
            TRY(needs_.replaces.refuseIfUnderWay(userId, containerClass));
            auto page = TRY(needs_.cache.pageOfContainersForUser(userId, containerClass, transient,
                                                                 {after, needs_.limits.listPageMax}));
            return ListedPage{.containers = listed(page.records), .next = std::move(page.next)};
        });
    });
}

} // namespace zor
