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

/// The user that stands for `requested` (its low 32 bits count). Without one the context has its error.
[[nodiscard]] inline std::optional<std::uint32_t> validatedUser(CommandContext& context, std::uint64_t requested,
                                                                ContainerClass containerClass) {
    const auto resolved = context.users.validateUserId(static_cast<std::uint32_t>(requested), containerClass,
                                                       context.client->clientUserId());
    if (resolved)
        return *resolved;
    context.error = resolved.error().replyCode();
    return std::nullopt;
}

/// The user that the request acts on. Without one the context has its error.
[[nodiscard]] inline std::optional<std::uint32_t> userOf(CommandContext& context, std::string_view key,
                                                         ContainerClass containerClass) {
    return validatedUser(context, context.request.unsignedInteger(key).value_or(0), containerClass);
}

/// For operations that give nothing but success or an error.
inline void storeError(CommandContext& context, const Result<void>& result) {
    if (!result)
        context.error = result.error().replyCode();
}

} // namespace zor::commands
