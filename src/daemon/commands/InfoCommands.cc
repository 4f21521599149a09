// SPDX-License-Identifier: Apache-2.0
// What is attached to one container: its info values and its record.
#include "daemon/commands/Commands.h"
#include "daemon/commands/Request.h"

namespace zor::commands {

namespace keys = ipc::keys;

void setInfoValue(CommandContext& context) {
    if (const auto address = addressIn(context))
        storeError(context, context.client->setInfoValue(context.request.find(keys::value),
                                                         context.request.string(keys::key), *address, UseLocking::yes));
}

void getInfoValue(CommandContext& context) {
    const auto address = addressIn(context);
    if (!address)
        return;
    auto value = context.client->infoValueForKey(context.request.string(keys::key), *address, UseLocking::yes);
    if (value)
        context.reply.set(keys::replyInfoValue, std::move(*value));
    else
        context.error = value.error().replyCode();
}

void getMetadata(CommandContext& context) {
    const auto address = addressIn(context);
    if (!address)
        return;
    const auto metadata = context.client->metadataForUser(*address);
    if (!metadata) {
        context.error = metadata.error().replyCode();
        return;
    }
    context.reply.set(keys::replyPath, metadata->path);
    context.reply.set(keys::replyTransient, metadata->transient);
    if (context.request.isTrue(keys::infoDictRequested) && metadata->info)
        context.reply.set(keys::replyInfoDictionary, *metadata->info);
}

} // namespace zor::commands
