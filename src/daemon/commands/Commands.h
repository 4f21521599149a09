// SPDX-License-Identifier: Apache-2.0
// The command handlers. Each reads its arguments, has the user resolved, calls one container operation and fills the
// reply. Any thread of the listener; one message of a connection at a time.
#pragma once

#include "base/ContainerClass.h"
#include "daemon/Operations.h"
#include "daemon/ZORClientConnection.h"
#include "ipc/Identifiers.h"
#include "ipc/Protocol.h"
#include "platform/Service.h"

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace zor {

/// The things that a handler works with. `request` and `reply` live as long as the call; a handler that replies later
/// keeps `channel` and what it needs of the rest.
struct CommandContext {
    const plist::Dictionary& request;
    plist::Dictionary& reply;
    const std::shared_ptr<ZORClientConnection>& client;
    const std::shared_ptr<platform::ReplyChannel>& channel;
    UserIdentity& users;
    Operations& operations;
    const Log& log;
    /// Success when the handler is entered; a handler that fails stores its code here.
    ErrorCode& error;
};

} // namespace zor

namespace zor::commands {

// Reading a request: what is missing or of another type is absent.

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

/// Whether the client, which may be fenced in to its own identifier, may ask for this one. False, logged: the context
/// has its error.
[[nodiscard]] inline bool mayAskFor(CommandContext& context, const std::string* identifier) {
    const auto& own = context.client->clientBundleIdentifier();
    if (!context.client->onlyOwnIdentifier() || !identifier || (own && *identifier == *own))
        return true;
    Reporter(context.log, __func__)
        .error(ErrorCode::notEntitled,
               "%s may ask for its own identifier only, not for %s (\"OnlyOwnIdentifier\" in its registry entry)",
               ZOR_SHOWN(own), ZOR_SHOWN(*identifier));
    context.error = ErrorCode::notEntitled;
    return false;
}

/// The user that stands for `requested` (its low 32 bits count). Without one the context has its error.
[[nodiscard]] inline std::optional<std::uint32_t> validatedUser(CommandContext& context, std::uint64_t requested,
                                                                ContainerClass containerClass) {
    const auto resolved = context.users.validateUserId(static_cast<std::uint32_t>(requested), containerClass,
                                                       context.client->clientUserId());
    if (resolved && isPerUserClass(containerClass) && !context.operations.configuration.homeAnswers(*resolved)) {
        // Before the request takes any lock. A home that would stop it there would stop everybody.
        context.error = ErrorCode::cacheNotRebuilt;
        return std::nullopt;
    }
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

[[nodiscard]] inline std::optional<std::string> stringIn(const plist::Dictionary& request, std::string_view key) {
    const std::string* text = request.string(key);
    return text ? std::optional(*text) : std::nullopt;
}

/// The one container that the request names by its UUID. Without a valid user the context has its error.
[[nodiscard]] inline std::optional<ZORClientConnection::ContainerAddress> addressIn(CommandContext& context) {
    const ContainerClass containerClass = classOf(context.request, ipc::keys::containerClass);
    const auto user = userOf(context, ipc::keys::userId, containerClass);
    if (!user)
        return std::nullopt;
    return ZORClientConnection::ContainerAddress{.userId = *user,
                                                 .uuid = UUID::of(context.request, ipc::keys::uuid),
                                                 .identifier = stringIn(context.request, ipc::keys::identifier),
                                                 .containerClass = containerClass};
}

/// For operations that give nothing but success or an error.
inline void storeError(CommandContext& context, const Result<void>& result) {
    if (!result)
        context.error = result.error().replyCode();
}

// ContainerCommands.cc
void createOrLookupContainer(CommandContext& context);
void listContainers(CommandContext& context);
void deleteContainersOnDeathRow(CommandContext& context);
void setInfoValue(CommandContext& context);
void getInfoValue(CommandContext& context);
void getMetadata(CommandContext& context);
void setDataProtection(CommandContext& context);

// LifecycleCommands.cc
void stageContainersForDelete(CommandContext& context);
void deleteContainer(CommandContext& context);
void replaceContainer(CommandContext& context);
void recreateDefaultStructure(CommandContext& context);
void regenerateDirectoryUUID(CommandContext& context);
void wipeEntitledPluginDataContainer(CommandContext& context);
void wipeDataContainerContent(CommandContext& context);
void getDiskUsage(CommandContext& context);
void retryTest(CommandContext& context);

// EntitlementCommands.cc
void getGroupContainerPaths(CommandContext& context);
void getGroupContainerIdentifiers(CommandContext& context);
void getSystemContainerPath(CommandContext& context);
void getSystemGroupContainerPaths(CommandContext& context);
void getSystemGroupContainerPath(CommandContext& context);
void processEntitlements(CommandContext& context);

} // namespace zor::commands
