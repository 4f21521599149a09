// SPDX-License-Identifier: Apache-2.0
// Replacing, repairing, wiping and measuring containers.
#include "base/ContainerClass.h"
#include "daemon/commands/Commands.h"

namespace zor::commands {

namespace keys = ipc::keys;

namespace {

void wipe(CommandContext& context, ContainerClass containerClass) {
    if (const auto user = userOf(context, keys::userId, containerClass))
        storeError(context, context.client->deleteDataContainerContentForUser(
                                *user, context.request.string(keys::identifier), containerClass));
}

} // namespace

void replaceContainer(CommandContext& context) {
    const plist::Dictionary& request = context.request;
    ZORClientConnection::ReplaceRequest replace;
    replace.oldUuid = UUID::of(request, keys::oldContainerUUID);
    if (replace.oldUuid) {
        replace.classOld = classOf(request, keys::oldContainerClass);
        replace.identifierOld = stringIn(request, keys::oldIdentifier);
        const auto user = userOf(context, keys::oldContainerUserId, replace.classOld);
        if (!user)
            return;
        replace.userIdOld = *user;
    }
    replace.classNew = classOf(request, keys::newContainerClass);
    const auto user = userOf(context, keys::newContainerUserId, replace.classNew);
    if (!user)
        return;
    replace.userIdNew = *user;
    replace.newUuid = UUID::of(request, keys::newContainerUUID);
    replace.identifierNew = stringIn(request, keys::newIdentifier);
    storeError(context, context.client->replaceContainer(replace, StartDeletionThread::no));
}

void recreateDefaultStructure(CommandContext& context) {
    if (const auto address = addressIn(context))
        storeError(context, context.client->recreateDefaultStructureForUser(*address));
}

void regenerateDirectoryUUID(CommandContext& context) {
    if (const auto address = addressIn(context))
        storeError(context, context.client->regenerateDirectoryUUIDForUser(*address));
}

void wipeEntitledPluginDataContainer(CommandContext& context) {
    context.client->setAllowOtherIdLookup(false);
    wipe(context, ContainerClass::dataKolvexPlugin);
}

void wipeDataContainerContent(CommandContext& context) {
    wipe(context, classOf(context.request, keys::containerClass));
}

void getDiskUsage(CommandContext& context) {
    const auto address = addressIn(context);
    if (!address)
        return;
    const auto usage = context.client->diskUsageForUserId(*address);
    context.reply.set(keys::replyDiskUsage, usage.bytes);
    context.error = usage.error;
}

void retryTest(CommandContext& context) {
    if (!context.operations.internalBuild.isInternalBuild()) {
        context.log.write(logLevelError, __func__, "People really shouldn't be calling this on non-internal installs!");
        return;
    }
    if (const auto user = userOf(context, keys::userId, ContainerClass::dataApplication))
        storeError(context, context.client->retryTestForUser(
                                *user, context.request.unsignedInteger(keys::numRetryCrashes).value_or(0)));
}

} // namespace zor::commands
