// SPDX-License-Identifier: Apache-2.0
#include "KnownContainer.h"

#include "base/ContainerClass.h"
#include "platform/Errno.h"

#include <algorithm>

namespace zorvanectl {

std::uint32_t userOf(const Target& target) {
    return target.user.value_or(zorvane::defaultUserOfClass(target.containerClass, target.root));
}

zorvane::Result<zorvane::Client::Address> find(zorvane::Client& client, const Target& target, bool transient) {
    const auto containers = TRY(client.list(target.containerClass, userOf(target), transient));
    const auto found = std::ranges::find(containers, target.identifier, &zorvane::ListedContainer::identifier);
    if (found == containers.end())
        return std::unexpected(zorvane::Error{.kind = zorvane::Error::Kind::daemon,
                                              .code = codeNotFound,
                                              .message = std::string("there is no ") +
                                                         (transient ? "transient" : "live") +
                                                         " container of this identifier"});
    return zorvane::Client::Address{.containerClass = target.containerClass,
                                    .user = userOf(target),
                                    .identifier = target.identifier,
                                    .uuid = found->uuid};
}

content::MountFence::Kind fenceKind(std::uint64_t containerClass) {
    return zor::isPerUserClass(static_cast<zor::ContainerClass>(containerClass))
               ? content::MountFence::Kind::home
               : content::MountFence::Kind::systemPlace;
}

std::optional<std::uint64_t> measured(const zorvane::ConnectOptions& connect,
                                      std::span<const zorvane::Client::Address> containers) {
    auto client = zorvane::Client::connect(connect);
    if (!client)
        return std::nullopt;
    std::uint64_t sum = 0;
    for (const auto& container : containers) {
        const auto bytes = client->diskUsage(container);
        if (!bytes)
            return std::nullopt;
        sum += *bytes;
    }
    return sum;
}

std::string lossQuestion(const std::string& verb, const std::optional<std::uint64_t>& bytes,
                         const std::string& identifier, const std::string& also) {
    return verb + " " + shownBytes(bytes) + " of " + printable(identifier) + (also.empty() ? "" : ", with " + also) +
           "?";
}

} // namespace zorvanectl
