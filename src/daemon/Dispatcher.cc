// SPDX-License-Identifier: Apache-2.0
#include "daemon/Dispatcher.h"

#include "base/Log.h"
#include "daemon/commands/Commands.h"
#include "ipc/Identifiers.h"
#include "platform/Service.h"

#include <algorithm>

namespace zor {

namespace powers = platform::entitlementKeys;

namespace {

using ipc::Command;

constexpr std::string_view none = noEntitlementRequired;
constexpr ReplyFlag now = ReplyFlag::dispatcherReplies;
constexpr ReplyFlag later = ReplyFlag::handlerReplies;

constexpr std::array<ZORCommandTableRow, ipc::commandCount> rows = {{
    {Command::createOrLookupContainer, commands::createOrLookupContainer, none, now},
    {Command::listContainers, commands::listContainers, powers::allowed, now},
    {Command::replaceContainer, commands::replaceContainer, powers::allowed, now},
    {Command::stageContainersForDelete, commands::stageContainersForDelete, powers::allowed, now},
    {Command::deleteContainersOnDeathRow, commands::deleteContainersOnDeathRow, powers::allowed, later},
    {Command::setInfoValue, commands::setInfoValue, powers::allowed, now},
    {Command::getInfoValue, commands::getInfoValue, powers::allowed, now},
    {Command::getMetadata, commands::getMetadata, powers::allowed, now},
    {Command::recreateDefaultStructure, commands::recreateDefaultStructure, powers::allowed, now},
    {Command::regenerateDirectoryUUID, commands::regenerateDirectoryUUID, powers::allowed, now},
    {Command::deleteContainer, commands::deleteContainer, powers::allowed, now},
    {Command::wipeEntitledPluginDataContainer, commands::wipeEntitledPluginDataContainer, powers::wipeContainer, now},
    {Command::wipeDataContainerContent, commands::wipeDataContainerContent, powers::allowed, now},
    {Command::getGroupContainerPaths, commands::getGroupContainerPaths, none, now},
    {Command::getGroupContainerIdentifiers, commands::getGroupContainerIdentifiers, powers::allowed, now},
    {Command::getSystemContainerPath, commands::getSystemContainerPath, none, now},
    {Command::getSystemGroupContainerPaths, commands::getSystemGroupContainerPaths, none, now},
    {Command::getSystemGroupContainerPath, commands::getSystemGroupContainerPath, none, now},
    {Command::processEntitlements, commands::processEntitlements, powers::allowed, now},
    {Command::setDataProtection, commands::setDataProtection, powers::allowed, later},
    {Command::recreateDefaultStructure2, commands::recreateDefaultStructure, powers::allowed, now},
    {Command::getDiskUsage, commands::getDiskUsage, powers::allowed, now},
    {Command::retryTest, commands::retryTest, powers::allowed, now},
}};

constexpr bool everyRowIsItsCommand() {
    for (std::size_t i = 0; i < rows.size(); ++i)
        if (static_cast<std::size_t>(rows[i].command) != i || rows[i].handler == nullptr)
            return false;
    return true;
}
static_assert(everyRowIsItsCommand());

} // namespace

const std::array<ZORCommandTableRow, ipc::commandCount> commandTable = rows;

namespace {

/// The name under which lines of the per-message handler are written, whichever function writes them.
constexpr const char* handlerName = "ZORProcessIpsiEvent";

const std::string* identifierOf(const platform::Identity& identity) {
    return identity.grant && identity.grant->identifier ? &*identity.grant->identifier : nullptr;
}

/// The strings of an array; anything else in it names nothing.
std::vector<std::string> stringsIn(const plist::Array& array) {
    std::vector<std::string> strings;
    for (const plist::Value& element : array)
        if (const std::string* text = element.asString())
            strings.push_back(*text);
    return strings;
}

bool isIdentifierOrNoString(const plist::Value* value) {
    const std::string* text = value ? value->asString() : nullptr;
    return !text || ipc::isIdentifier(*text);
}

/// No identifier of the request is longer than one may be, whatever the command makes of it. Else the context has its
/// error.
bool identifiersAreUsable(CommandContext& context) {
    const plist::Dictionary& request = context.request;
    // Hardly any request has something to be looked at by its key.
    if (std::ranges::none_of(request, [](const plist::Dictionary::Entry& entry) {
            return entry.second.asArray() || !isIdentifierOrNoString(&entry.second);
        }))
        return true;
    for (const std::string_view key : {ipc::keys::identifier, ipc::keys::groupIdentifier, ipc::keys::oldIdentifier,
                                       ipc::keys::newIdentifier, ipc::keys::pageAfter, ipc::keys::identifiersArray}) {
        const plist::Value* value = request.find(key);
        const plist::Array* array = value ? value->asArray() : nullptr;
        if (isIdentifierOrNoString(value) &&
            (!array || std::ranges::all_of(*array, isIdentifierOrNoString, [](const plist::Value& v) { return &v; })))
            continue;
        const std::string shown(key);
        context.error = Reporter(context.log, handlerName)
                            .error(ErrorCode::invalidObject,
                                   "Can't act on an invalid object: %s is longer than the %zu bytes of an identifier",
                                   shown.c_str(), ipc::identifierBytesMax)
                            .replyCode();
        return false;
    }
    return true;
}

/// For those who read what the request made the log say.
void describeRequest(const platform::Peer& peer, const platform::ServiceEvent& event, const LogSubject::Take& take) {
    const plist::Dictionary& request = event.request;
    take("ZORVANE_PEER_PID", std::to_string(peer.pid()));
    take("ZORVANE_PEER_UID", std::to_string(peer.kernelUserId()));
    take("ZORVANE_REQUEST", std::to_string(event.requestId));
    take("ZORVANE_COMMAND", std::to_string(request.unsignedInteger(ipc::keys::command).value_or(0)));
    if (const std::string* identifier = request.string(ipc::keys::identifier))
        take("ZORVANE_IDENTIFIER", *identifier);
    if (const auto containerClass = request.unsignedInteger(ipc::keys::containerClass))
        take("ZORVANE_CLASS", std::to_string(*containerClass));
    if (const auto user = request.unsignedInteger(ipc::keys::userId))
        take("ZORVANE_USER", std::to_string(*user));
}

} // namespace

void Dispatcher::ZORProcessIpsiEvent(platform::PeerConnection& connection, platform::ServiceEvent& event) {
    if (event.kind == platform::ServiceEvent::Kind::invalid)
        return;
    const Log::ClientScope provoked(connection.peer().kernelUserId());
    const LogSubject::Describe describe = [&](const LogSubject::Take& take) {
        describeRequest(connection.peer(), event, take);
    };
    const LogRequestScope asked(describe);
    if (serve(connection, event)) {
        served_.fetch_add(1, std::memory_order_relaxed);
    } else {
        refused_.fetch_add(1, std::memory_order_relaxed);
        connection.cancel();
    }
}

bool Dispatcher::serve(platform::PeerConnection& connection, platform::ServiceEvent& event) {
    const Reporter report(log_, handlerName);
    ErrorCode error = ErrorCode::success;
    const std::uint64_t command = event.request.unsignedInteger(ipc::keys::command).value_or(0);
    if (command >= commandTable.size()) {
        report.write(logLevelError, "Invalid command index: %lld", static_cast<long long>(command));
        return false;
    }
    const ZORCommandTableRow& row = commandTable[command];
    if (static_cast<std::uint64_t>(row.command) != command) {
        report.write(logLevelError, "Invalid command at index %llu", static_cast<unsigned long long>(command));
        return false;
    }
    platform::Identity identity = connection.peer().identify(platform::Peer::Explain::no);
    // The words cost a look at the registry: only a peer that is nobody is to be explained.
    if (!identity.grant)
        identity = connection.peer().identify(platform::Peer::Explain::yes);
    const auto client = checkEntitlementsAndInitClientObject(row, identity);
    if (!client)
        return false;
    if (!event.reply) {
        report.write(logLevelError, "Dictionary does not have reply context");
        return false;
    }
    plist::Dictionary reply;
    CommandContext context{.request = event.request,
                           .reply = reply,
                           .client = client,
                           .channel = event.reply,
                           .users = users_,
                           .operations = operations_,
                           .log = log_,
                           .error = error};
    const bool usable = identifiersAreUsable(context);
    if (usable)
        row.handler(context);
    if (!usable || row.replyFlag == ReplyFlag::dispatcherReplies) {
        reply.set(ipc::keys::replyError, static_cast<std::uint64_t>(error));
        event.reply->send(reply);
    }
    return true;
}

std::shared_ptr<ZORClientConnection>
Dispatcher::checkEntitlementsAndInitClientObject(const ZORCommandTableRow& row, const platform::Identity& identity) {
    const std::string* identifier = identifierOf(identity);
    if (!identifier)
        ZOR_LOG(log_, logLevelError, "Failed to copy signing ID for pid %d : %s", identity.pid,
                identity.grant ? "its registry entry has none" : ZOR_SHOWN(identity.explanation));
    const bool noneRequired = row.requiredEntitlement == noEntitlementRequired;
    const plist::Dictionary* entitlements =
        identity.grant && identity.grant->entitlements ? &*identity.grant->entitlements : nullptr;
    if (!entitlements) {
        if (!noneRequired)
            sayMissingEntitlement(row, identity);
        return nullptr;
    }
    const bool allowed = entitlements->isTrue(powers::allowed);
    const bool otherIdLookup = allowed || entitlements->isTrue(powers::otherIdLookup);
    bool admitted = noneRequired || allowed;
    std::optional<std::vector<std::string>> wipeIdentifiers;
    if (row.requiredEntitlement == powers::wipeContainer) {
        if (const plist::Array* array = entitlements->array(powers::wipeContainer)) {
            wipeIdentifiers = stringsIn(*array);
            admitted = true;
        } else {
            ZOR_LOG(log_, logLevelError, "No entitled containers to wipe");
        }
    } else if (!admitted) {
        admitted = entitlements->isTrue(row.requiredEntitlement);
    }
    if (!admitted) {
        sayMissingEntitlement(row, identity);
        return nullptr;
    }
    ZORClientConnection::Client client{.userId = identity.effectiveUserId,
                                       .allowOtherIdLookup = otherIdLookup,
                                       .entitledWipeIdentifiers = std::move(wipeIdentifiers),
                                       .onlyOwnIdentifier = identity.grant->onlyOwnIdentifier};
    if (identifier)
        client.bundleIdentifier = *identifier;
    registerEntitlements(identifier, *identity.grant);
    return std::make_shared<ZORClientConnection>(operations_, std::move(client));
}

void Dispatcher::registerEntitlements(const std::string* identifier, const platform::IdentityGrant& grant) const {
    const std::uint64_t generation =
        operations_.entitlements.generation(identifier ? std::string_view(*identifier) : std::string_view());
    if (grant.registeredGeneration.get() == generation)
        return;
    static const plist::Dictionary byCaller{{std::string(entitlementMapKeys::registeredByCaller), true}};
    const plist::Dictionary& entitlements =
        grant.identifierEntitlements ? *grant.identifierEntitlements : *grant.entitlements;
    if (identifier && !operations_.entitlements.callerRegistrationIsDue(*identifier, entitlements, byCaller))
        return grant.registeredGeneration.leave(generation);
    const ErrorCode code = operations_.entitlementChange.processEntitlements(&entitlements, identifier, &byCaller);
    if (code != ErrorCode::success)
        log_.write(logLevelError, handlerName, "Error processing entitlements for %s : %llu", ZOR_SHOWN(identifier),
                   static_cast<unsigned long long>(code));
}

void Dispatcher::sayMissingEntitlement(const ZORCommandTableRow& row, const platform::Identity& identity) const {
    log_.write(logLevelError, "checkEntitlementsAndInitClientObject",
               "connection attempt from pid %d (%s) missing required entitlement: %s", identity.pid,
               ZOR_SHOWN(identifierOf(identity)), row.requiredEntitlement.data());
}

} // namespace zor
