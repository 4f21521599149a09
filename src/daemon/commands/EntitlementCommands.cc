// SPDX-License-Identifier: Apache-2.0
// How a process finds the containers it shares, and how an installer registers what an identifier is entitled to.
#include "base/ContainerClass.h"
#include "daemon/commands/Commands.h"

#include <algorithm>

namespace zor::commands {

namespace keys = ipc::keys;

namespace {

void replyWithGroupPaths(CommandContext& context, std::uint32_t userId) {
    const std::string* identifier = ownIdentifierByDefault(context);
    if (!mayAskFor(context, identifier))
        return;
    context.client->setAllowGroupIdLookup(true);
    const auto paths =
        context.operations.groups.groupContainerPathsForUser(userId, context.client->caller(), identifier);
    if (!paths) {
        context.error = paths.error().replyCode();
        return;
    }
    std::vector<plist::Dictionary::Entry> entries;
    for (const auto& [group, path] : *paths)
        entries.emplace_back(group, path);
    context.reply.set(keys::replyGroupContainerDict, plist::Dictionary::fromUnsorted(std::move(entries)));
}

/// The path of a group that the client is entitled to; nullopt when it cannot be had.
std::optional<std::string> entitledGroupPath(CommandContext& context, const std::string& group) {
    context.client->setAllowGroupIdLookup(true);
    const auto paths = context.operations.groups.groupContainerPathsForUser(
        context.operations.configuration.users().system, context.client->caller(), ownIdentifierByDefault(context));
    if (!paths)
        return std::nullopt;
    const auto found = paths->find(group);
    return found == paths->end() ? std::nullopt : std::optional(found->second);
}

std::optional<std::string> wellKnownGroupPath(CommandContext& context, const std::string& group) {
    context.client->setAllowGroupIdLookup(true);
    const auto found =
        context.client->createOrLookupContainerForUser(context.operations.configuration.users().system, &group,
                                                       ContainerClass::sharedSystemGroup, {.createIfNecessary = true});
    return found ? std::optional(found->path) : std::nullopt;
}

bool isEntitledTo(CommandContext& context, const std::string& group) {
    const auto& own = context.client->clientBundleIdentifier();
    const auto groups = own ? context.operations.entitlements.systemGroupIdentifiersForIdentifier(*own) : std::nullopt;
    return groups && std::ranges::find(*groups, group) != groups->end();
}

/// A property-list argument that has to be a dictionary: absent is fine, anything else is not.
bool isDictionaryOrAbsent(CommandContext& context, std::string_view key) {
    const plist::Value* value = context.request.find(key);
    if (!value || value->asDictionary())
        return true;
    // Taken for absent it would remove what is stored.
    Reporter(context.log, "processEntitlements")
        .error(ErrorCode::invalidObject, "Can't act on an invalid object: %s: %s", std::string(key).c_str(),
               plist::describe(value).c_str());
    context.error = ErrorCode::invalidObject;
    return false;
}

} // namespace

void getGroupContainerPaths(CommandContext& context) {
    const auto user = userOf(context, keys::userId, ContainerClass::sharedAppGroup);
    if (!user)
        return;
    replyWithGroupPaths(context, *user);
    // The launcher asks with this command, before it starts a program of the identifier.
    const std::string* identifier = ownIdentifierByDefault(context);
    if (context.error == ErrorCode::success && context.request.isTrue(keys::passedSockets))
        context.reply.set(keys::replyPassedSockets,
                          identifier && context.operations.peers.allowsPassedSockets(*identifier));
}

void getGroupContainerIdentifiers(CommandContext& context) {
    const auto user = userOf(context, keys::userId, ContainerClass::sharedAppGroup);
    const std::string* identifier = ownIdentifierByDefault(context);
    if (!user || !mayAskFor(context, identifier))
        return;
    const auto groups = context.operations.groups.groupContainerIdentifiersForUser(*user, identifier);
    if (!groups) {
        context.error = groups.error().replyCode();
        return;
    }
    context.reply.set(keys::replyGroupIdentifiersArray, plist::Array(groups->begin(), groups->end()));
}

void getSystemContainerPath(CommandContext& context) {
    const std::string* identifier = ownIdentifierByDefault(context);
    const auto& own = context.client->clientBundleIdentifier();
    const bool isOwn = identifier && own && *identifier == *own;
    if (!isOwn && identifier && !context.client->allowOtherIdLookup() &&
        context.operations.whitelist.systemContainerIdIsWellknown(*identifier))
        context.client->setAllowOtherIdLookup(true);
    const auto found =
        context.client->createOrLookupContainerForUser(context.operations.configuration.users().system, identifier,
                                                       ContainerClass::dataSystem, {.createIfNecessary = true});
    if (found)
        context.reply.set(keys::replyPath, found->path);
    else
        context.error = found.error().replyCode();
}

void getSystemGroupContainerPaths(CommandContext& context) {
    replyWithGroupPaths(context, context.operations.configuration.users().system);
}

void getSystemGroupContainerPath(CommandContext& context) {
    const Reporter report(context.log, "systemGroupContainerPath");
    const std::string* group = context.request.string(keys::groupIdentifier);
    std::optional<std::string> path;
    if (group && isEntitledTo(context, *group)) {
        path = entitledGroupPath(context, *group);
    } else if (group && context.operations.whitelist.systemGroupContainerIdIsWellknown(*group)) {
        path = wellKnownGroupPath(context, *group);
    } else {
        report.write(logLevelError, "%s is not entitled for system group identifier: %s",
                     ZOR_SHOWN(context.client->clientBundleIdentifier()), ZOR_SHOWN(group));
        context.error = ErrorCode::notEntitled;
        return;
    }
    if (path) {
        context.reply.set(keys::replyPath, std::move(*path));
        return;
    }
    report.write(logLevelError, "Did not find system group container with identifier: %s for %s", ZOR_SHOWN(*group),
                 ZOR_SHOWN(ownIdentifierByDefault(context)));
    context.error = ErrorCode::notFound;
}

void processEntitlements(CommandContext& context) {
    if (!isDictionaryOrAbsent(context, keys::entitlements) || !isDictionaryOrAbsent(context, keys::optionsDictionary))
        return;
    context.error = context.operations.entitlementChange.processEntitlements(
        context.request.dictionary(keys::entitlements), context.request.string(keys::identifier),
        context.request.dictionary(keys::optionsDictionary));
}

} // namespace zor::commands
