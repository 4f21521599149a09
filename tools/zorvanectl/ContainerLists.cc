// SPDX-License-Identifier: Apache-2.0
#include "ContainerLists.h"

#include "KnownContainer.h"
#include "Users.h"
#include "platform/Errno.h"

#include <algorithm>
#include <tuple>

namespace zorvanectl {

namespace {

using zorvane::Client;
using zorvane::Error;

bool isOver(const Error& error) {
    return error.kind != Error::Kind::daemon;
}

zorvane::Result<void> addClass(Client& client, std::uint64_t containerClass, std::uint32_t user, const Target& target,
                               std::vector<FoundContainer>& found) {
    const auto listed = TRY(client.list(containerClass, user, target.transient));
    for (const zorvane::ListedContainer& container : listed)
        if (target.identifier.empty() || container.identifier == target.identifier)
            found.push_back({.address = {.containerClass = containerClass,
                                         .user = user,
                                         .identifier = container.identifier,
                                         .uuid = container.uuid},
                             .path = {}});
    return {};
}

zorvane::Result<FoundContainers> findAll(Client& client, const std::string& root, const Target& target) {
    FoundContainers found;
    bool anyRead = false;
    for (std::uint64_t number = 1; number <= zorvane::containerClassMax; ++number)
        for (const NamedUser& user : ownersOfClass(root, number)) {
            const auto added = addClass(client, number, user.number, target, found.containers);
            if (!added && isOver(added.error()))
                return std::unexpected(added.error());
            if (!added)
                found.unread.push_back({.containerClass = number, .user = user.number, .error = added.error()});
            anyRead = anyRead || added;
        }
    if (!anyRead && !found.unread.empty())
        return std::unexpected(found.unread.front().error);
    return found;
}

/// Nothing for one that has gone.
zorvane::Result<bool> addDetails(Client& client, const Listing& listing, FoundContainer& container) {
    const auto gone = [](const Error& error) {
        return error.kind == Error::Kind::daemon && error.code == codeNotFound;
    };
    if (listing.withPath) {
        auto metadata = client.metadata(container.address);
        if (!metadata)
            return gone(metadata.error()) ? zorvane::Result<bool>(false) : std::unexpected(metadata.error());
        container.path = std::move(metadata->path);
    }
    if (listing.withSize) {
        const auto bytes = client.diskUsage(container.address);
        if (!bytes)
            return gone(bytes.error()) ? zorvane::Result<bool>(false) : std::unexpected(bytes.error());
        container.bytes = *bytes;
    }
    return true;
}

void sort(std::vector<FoundContainer>& containers, const std::string& order) {
    const auto key = [&](const FoundContainer& container) {
        const Client::Address& address = container.address;
        const bool byClass = order.empty() || order == "class";
        return std::tuple(order == "size" ? ~container.bytes : 0, byClass ? address.containerClass : 0,
                          byClass || order == "user" ? address.user : 0, std::string_view(address.identifier),
                          address.containerClass, address.user);
    };
    std::ranges::sort(containers, {}, key);
}

} // namespace

zorvane::Result<FoundContainers> findContainers(Client& client, const std::string& root, const Target& target,
                                                const Listing& listing) {
    FoundContainers found;
    if (listing.all)
        found = TRY(findAll(client, root, target));
    else
        TRY(addClass(client, target.containerClass, userOf(target), target, found.containers));
    std::vector<FoundContainer> whole;
    for (FoundContainer& container : found.containers)
        if (TRY(addDetails(client, listing, container)))
            whole.push_back(std::move(container));
    found.containers = std::move(whole);
    sort(found.containers, listing.order);
    return found;
}

} // namespace zorvanectl
