// SPDX-License-Identifier: Apache-2.0
// Creating or finding a container, listing a class, emptying death row.
// Reading and changing what is attached to one container: its info values and its record.
// Changing the data-protection class of a container. It replies itself, when the change has ended.

#include "daemon/commands/Commands.h"
#include "ipc/Identifiers.h"

namespace zor::commands {

namespace keys = ipc::keys;

namespace {

/// How many the reply to a lookup has.
constexpr std::size_t replyEntries = 5;

/// A transient container that is asked for again is thrown away, and those of the installer and of the system belong to
/// no client: what somebody is just installing is in one. False, logged: the context has its error.
bool mayAskForTransient(CommandContext& context, const std::string* identifier, ContainerClass containerClass) {
    if (isPerUserClass(containerClass) || context.client->allowOtherIdLookup())
        return true;
    Reporter(context.log, __func__)
        .error(ErrorCode::notEntitled,
               "%s may not ask for the transient container of %s in class %ld: it is the installer's or the system's",
               ZOR_SHOWN(context.client->clientBundleIdentifier()), ZOR_SHOWN(identifier),
               static_cast<long>(containerClass));
    context.error = ErrorCode::notEntitled;
    return false;
}

void replyWithList(CommandContext& context, const std::vector<ZORClientConnection::ListedContainer>& containers) {
    plist::Array identifiers;
    plist::Array uuids;
    identifiers.reserve(containers.size());
    uuids.reserve(containers.size());
    for (const auto& container : containers) {
        identifiers.emplace_back(container.identifier);
        uuids.push_back(container.uuid.value());
    }
    context.reply.set(keys::replyIdsArray, std::move(identifiers));
    context.reply.set(keys::replyUUIDsArray, std::move(uuids));
}

} // namespace

void createOrLookupContainer(CommandContext& context) {
    const ContainerClass containerClass = classOf(context.request, keys::containerClass);
    const auto user = userOf(context, keys::userId, containerClass);
    const std::string* identifier = ownIdentifierByDefault(context);
    const bool transient = context.request.isTrue(keys::transient);
    if (!user || !mayAskFor(context, identifier) ||
        (transient && !mayAskForTransient(context, identifier, containerClass)))
        return;
    auto found = context.client->createOrLookupContainerForUser(
        *user, identifier, containerClass,
        {.createIfNecessary = context.request.isTrue(keys::createIfNecessary), .transient = transient});
    if (!found) {
        context.error = found.error().replyCode();
        return;
    }
    // In the order of the keys and without a copy: most requests end here.
    std::vector<plist::Dictionary::Entry> reply;
    reply.reserve(replyEntries);
    reply.emplace_back(keys::replyError, static_cast<std::uint64_t>(ErrorCode::success));
    reply.emplace_back(keys::replyExisted, found->existed);
    reply.emplace_back(keys::replyIdentifier, found->record->identifier());
    reply.emplace_back(keys::replyPath, std::move(found->path));
    reply.emplace_back(keys::replyUUID, found->uuid.value());
    context.reply = plist::Dictionary::fromUnsorted(std::move(reply));
}

void listContainers(CommandContext& context) {
    const ContainerClass containerClass = classOf(context.request, keys::containerClass);
    const auto user = userOf(context, keys::userId, containerClass);
    if (!user)
        return;
    const bool transient = context.request.isTrue(keys::transient);
    const std::string* after = context.request.string(keys::pageAfter);
    if (!after) {
        const auto all = context.client->containersForUser(*user, containerClass, transient);
        if (all)
            replyWithList(context, *all);
        else
            context.error = all.error().replyCode();
        return;
    }
    const auto page = context.client->containersForUser(*user, containerClass, transient, *after);
    if (!page) {
        context.error = page.error().replyCode();
        return;
    }
    replyWithList(context, page->containers);
    if (page->next)
        context.reply.set(keys::replyNextPage, *page->next);
}

void deleteContainersOnDeathRow(CommandContext& context) {
    context.client->deleteContainersOnDeathRowWithCompletion([channel = context.channel](ErrorCode code) {
        channel->send({{std::string(keys::replyError), static_cast<std::uint64_t>(code)}});
    });
}

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
