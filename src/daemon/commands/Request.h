// SPDX-License-Identifier: Apache-2.0
// Reading a request: what is missing or of another type is absent.
#pragma once

#include "daemon/CommandTable.h"

#include <cstdint>
#include <optional>
#include <string>

namespace zor::commands {

[[nodiscard]] inline ContainerClass classOf(const plist::Dictionary& request, std::string_view key) {
    return static_cast<ContainerClass>(request.unsignedInteger(key).value_or(0));
}

/// "Identifier", or the client's own when the request has none. nullptr when neither is there.
[[nodiscard]] inline const std::string* ownIdentifierByDefault(const CommandContext& context) {
    if (const std::string* identifier = context.request.string(ipc::keys::identifier))
        return identifier;
    const auto& own = context.client->clientBundleIdentifier();
    return own ? &*own : nullptr;
}

/// The user that the request acts on. Without one the context has its error.
[[nodiscard]] inline std::optional<std::uint32_t> userOf(CommandContext& context, std::string_view key,
                                                         ContainerClass containerClass) {
    const auto requested = static_cast<std::uint32_t>(context.request.unsignedInteger(key).value_or(0));
    const auto resolved = context.users.validateUserId(requested, containerClass, context.client->clientUserId());
    if (resolved)
        return *resolved;
    context.error = resolved.error().replyCode();
    return std::nullopt;
}

} // namespace zor::commands
