// SPDX-License-Identifier: Apache-2.0
// Changing the data-protection class of a container. It replies itself, when the change has ended.
#include "daemon/commands/Commands.h"
#include "daemon/commands/Request.h"

namespace zor::commands {

namespace keys = ipc::keys;

namespace {

/// The low 32 bits of a signed number; what is missing or of another type reads as 0.
std::int32_t protectionClassIn(const plist::Dictionary& request) {
    const plist::Value* value = request.find(keys::dataProtectionClass);
    return static_cast<std::int32_t>(value ? value->asSigned().value_or(0) : 0);
}

} // namespace

void setDataProtection(CommandContext& context) {
    const auto reply = [channel = context.channel](ErrorCode code) {
        channel->send({{std::string(keys::replyError), static_cast<std::uint64_t>(code)}});
    };
    const ContainerClass containerClass = classOf(context.request, keys::containerClass);
    const auto user = userOf(context, keys::userId, containerClass);
    if (!user) {
        reply(context.error);
        return;
    }
    context.operations.dataProtection.setDataProtectionOnDataContainerForUser(
        {.userId = *user,
         .identifier = stringIn(context.request, keys::identifier),
         .containerClass = containerClass,
         .dataProtectionClass = protectionClassIn(context.request),
         .isSecondOrThirdPartyApp = context.request.isTrue(keys::isThirdParty),
         .retryIfLocked = context.request.isTrue(keys::retryIfLocked),
         .byOwner = context.client->ownsRoot()},
        reply);
}

} // namespace zor::commands
