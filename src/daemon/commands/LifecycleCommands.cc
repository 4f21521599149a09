// SPDX-License-Identifier: Apache-2.0
// Replacing, repairing, wiping, measuring and deleting containers.
#include "base/ContainerClass.h"
#include "daemon/commands/Commands.h"
#include "ipc/Identifiers.h"

#include <algorithm>

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

namespace keys = ipc::keys;

namespace {

const plist::Array& arrayOf(const plist::Dictionary& request, std::string_view key) {
    static const plist::Array none;
    const plist::Array* array = request.array(key);
    return array ? *array : none;
}

/// Classes and UUIDs are of the right types, and there is a class for every user. Else the context has its error.
bool listsAreUsable(CommandContext& context, const plist::Array& classes, const plist::Array& uuids) {
    const std::size_t users = arrayOf(context.request, keys::userIdsArray).size();
    const auto isUnsigned = [](const plist::Value& element) { return element.asUnsigned().has_value(); };
    const auto isUuid = [](const plist::Value& element) { return UUID::of(&element).has_value(); };
    if (users <= classes.size() && std::ranges::all_of(classes, isUnsigned) && std::ranges::all_of(uuids, isUuid))
        return true;
    Reporter(context.log, "stageContainerForDelete")
        .error(ErrorCode::invalidObject,
               "Can't act on an invalid input: user count: %ld, class count: %ld, or an element of another type",
               static_cast<long>(users), static_cast<long>(classes.size()));
    context.error = ErrorCode::invalidObject;
    return false;
}

/// The users of the list, each resolved for the class beside it. Without all of them the context has its error.
std::optional<std::vector<std::uint32_t>> usersOf(CommandContext& context, const plist::Array& classes) {
    std::vector<std::uint32_t> users;
    for (const plist::Value& element : arrayOf(context.request, keys::userIdsArray)) {
        const auto containerClass = static_cast<ContainerClass>(classes[users.size()].asUnsigned().value_or(0));
        const auto user = validatedUser(context, element.asUnsigned().value_or(0), containerClass);
        if (!user)
            return std::nullopt;
        users.push_back(*user);
    }
    return users;
}

} // namespace

void stageContainersForDelete(CommandContext& context) {
    const plist::Array& classes = arrayOf(context.request, keys::containerClassesArray);
    const plist::Array& uuids = arrayOf(context.request, keys::uuidsArray);
    if (!listsAreUsable(context, classes, uuids))
        return;
    auto users = usersOf(context, classes);
    if (!users)
        return;
    ZORClientConnection::DeletionBatch batch{.users = std::move(*users)};
    for (const plist::Value& element : classes)
        batch.classes.emplace_back(element.asUnsigned().value_or(0));
    for (const plist::Value& element : uuids)
        batch.uuids.emplace_back(*UUID::of(&element));
    const plist::Array* identifiers = context.request.array(keys::identifiersArray);
    if (!identifiers)
        context.log.write(logLevelError, "stageContainerForDelete", "Got non-Array input for the identifiers array");
    else
        for (const plist::Value& element : *identifiers) {
            const std::string* identifier = element.asString();
            batch.identifiers.push_back(identifier ? std::optional(*identifier) : std::nullopt);
        }
    storeError(context, context.client->stageForDeleteContainersWithUsers(batch, UseLocking::yes));
}

void deleteContainer(CommandContext& context) {
    const ContainerClass containerClass = classOf(context.request, keys::containerClass);
    const auto user = userOf(context, keys::userId, containerClass);
    if (!user)
        return;
    storeError(context,
               context.client->deleteContainerForUser(*user, context.request.string(keys::identifier), containerClass,
                                                      context.request.isTrue(keys::transient)));
}

} // namespace zor::commands
