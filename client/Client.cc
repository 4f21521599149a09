// SPDX-License-Identifier: Apache-2.0
// The public calls: what each sends and what it expects back.
#include "zorvane/Client.h"

#include "Connection.h"
#include "ipc/Identifiers.h"
#include "ipc/Protocol.h"
#include "platform/Errno.h"

#include <charconv>
#include <iterator>
#include <type_traits>
#include <utility>

namespace zorvane {

namespace ipc = zor::ipc;
namespace keys = zor::ipc::keys;
namespace plist = zor::plist;

namespace {

/// The daemon's code for an identifier that is not entitled to a system container.
constexpr std::uint64_t codeNotEntitled = 55;

plist::Dictionary request(ipc::Command command) {
    return {{std::string(keys::command), static_cast<std::uint64_t>(command)}};
}

std::unexpected<Error> incomplete() {
    return std::unexpected(Error{.kind = Error::Kind::protocol, .code = 0, .message = "the reply is incomplete"});
}

/// A class's name as people type it: "data-application".
std::string typedForm(std::string_view name) {
    std::string typed;
    for (const char character : name) {
        const bool upper = character >= 'A' && character <= 'Z';
        typed += character == '/' ? '-' : static_cast<char>(upper ? character - 'A' + 'a' : character);
    }
    return typed;
}

Value converted(const plist::Value& value);

Map converted(const plist::Dictionary& dictionary) {
    Map map;
    for (const auto& [key, value] : dictionary)
        map.emplace(key, converted(value));
    return map;
}

Value converted(const plist::Value& value) {
    Value made;
    if (const bool* boolean = value.asBoolean()) {
        made.content = *boolean;
    } else if (const auto number = value.asSigned()) {
        made.content = *number;
    } else if (const auto unsignedNumber = value.asUnsigned()) {
        made.content = *unsignedNumber;
    } else if (const double* real = value.asReal()) {
        made.content = *real;
    } else if (const std::string* text = value.asString()) {
        made.content = *text;
    } else if (const plist::Dictionary* dictionary = value.asDictionary()) {
        made.content = converted(*dictionary);
    } else if (const plist::Array* array = value.asArray()) {
        List& list = made.content.emplace<List>();
        for (const plist::Value& element : *array)
            list.push_back(converted(element));
    } else if (const plist::Data* data = value.asData()) {
        made.content = *data;
    } else if (const plist::Date* date = value.asDate()) {
        made.content = Date{date->secondsSinceReference};
    }
    return made;
}

plist::Value unconverted(const Value& value);

plist::Dictionary unconverted(const Map& map) {
    plist::Dictionary dictionary;
    for (const auto& [key, element] : map)
        dictionary.set(key, unconverted(element));
    return dictionary;
}

plist::Value unconverted(const Value& value) {
    return std::visit(
        [](const auto& content) -> plist::Value {
            using Content = std::decay_t<decltype(content)>;
            if constexpr (std::is_same_v<Content, List>) {
                plist::Array array;
                for (const Value& element : content)
                    array.push_back(unconverted(element));
                return array;
            } else if constexpr (std::is_same_v<Content, Map>) {
                return unconverted(content);
            } else if constexpr (std::is_same_v<Content, Date>) {
                return plist::Date{content.seconds};
            } else {
                return plist::Value(content);
            }
        },
        value.content);
}

void setIdentifier(plist::Dictionary& message, const std::string& identifier) {
    if (!identifier.empty())
        message.set(keys::identifier, identifier);
}

plist::Dictionary addressed(ipc::Command command, const Client::Address& address) {
    plist::Dictionary message = request(command);
    message.set(keys::containerClass, address.containerClass);
    message.set(keys::userId, address.user);
    message.set(keys::identifier, address.identifier);
    message.set(keys::uuid, zor::UUID(address.uuid).value());
    return message;
}

Result<void> withoutContent(Result<plist::Dictionary> reply) {
    (void)TRY(std::move(reply));
    return {};
}

Result<std::string> pathIn(Result<plist::Dictionary> answer) {
    const plist::Dictionary reply = TRY(std::move(answer));
    const std::string* path = reply.string(keys::replyPath);
    if (!path)
        return incomplete();
    return *path;
}

/// False when the reply is none to a listing.
bool appendListed(const plist::Dictionary& reply, std::vector<ListedContainer>& containers) {
    const plist::Array* identifiers = reply.array(keys::replyIdsArray);
    const plist::Array* uuids = reply.array(keys::replyUUIDsArray);
    if (!identifiers || !uuids || identifiers->size() != uuids->size())
        return false;
    for (std::size_t i = 0; i < identifiers->size(); ++i) {
        const std::string* identifier = (*identifiers)[i].asString();
        const auto uuid = zor::UUID::of(&(*uuids)[i]);
        if (!identifier || !uuid)
            return false;
        containers.push_back({.uuid = uuid->bytes(), .identifier = *identifier});
    }
    return true;
}

Result<Client::GroupPaths> groupPathsIn(Result<plist::Dictionary> answer) {
    const plist::Dictionary reply = TRY(std::move(answer));
    const plist::Dictionary* groups = reply.dictionary(keys::replyGroupContainerDict);
    if (!groups)
        return incomplete();
    Client::GroupPaths paths;
    for (const auto& [group, path] : *groups) {
        if (!path.asString())
            return incomplete();
        paths.emplace(group, *path.asString());
    }
    return paths;
}

} // namespace

std::optional<std::uint64_t> containerClassOf(std::string_view nameOrNumber) {
    std::uint64_t number = 0;
    const char* end = nameOrNumber.data() + nameOrNumber.size();
    const auto [parsedTo, failure] = std::from_chars(nameOrNumber.data(), end, number);
    if (failure == std::errc() && parsedTo == end)
        return ipc::isContainerClass(number) ? std::optional(number) : std::nullopt;
    const std::string wanted = typedForm(nameOrNumber);
    std::optional<std::uint64_t> found;
    for (std::uint64_t candidate = 1; ipc::isContainerClass(candidate) && !wanted.empty(); ++candidate) {
        const std::string name = typedForm(ipc::containerClassNames[candidate]);
        if (name == wanted)
            return candidate;
        if (!name.starts_with(wanted))
            continue;
        if (found)
            return std::nullopt; // the beginning of two names
        found = candidate;
    }
    return found;
}

std::string_view containerClassName(std::uint64_t number) {
    return ipc::containerClassNames[ipc::isContainerClass(number) ? number : 0];
}

std::string uuidText(const std::array<std::uint8_t, 16>& uuid) {
    return zor::UUID(uuid).string();
}

std::string_view protectionClassInfoKey() {
    return ipc::infoKeys::contentProtectionClass;
}

Client::Client(std::unique_ptr<Connection> connection) : connection_(std::move(connection)) {}
Client::Client(Client&&) noexcept = default;
Client& Client::operator=(Client&&) noexcept = default;
Client::~Client() = default;

Result<Client> Client::connect(const ConnectOptions& options) {
    return Client(std::make_unique<Connection>(TRY(Connection::open(options, Connection::Service::commands))));
}

Result<Container> Client::createOrLookup(const Lookup& lookup) {
    plist::Dictionary message = request(ipc::Command::createOrLookupContainer);
    message.set(keys::containerClass, lookup.containerClass);
    message.set(keys::userId, lookup.user);
    setIdentifier(message, lookup.identifier);
    message.set(keys::createIfNecessary, lookup.create);
    message.set(keys::transient, lookup.transient);
    const plist::Dictionary reply = TRY(connection_->call(message));
    const auto uuid = zor::UUID::of(reply, keys::replyUUID);
    const std::string* identifier = reply.string(keys::replyIdentifier);
    const std::string* path = reply.string(keys::replyPath);
    if (!uuid || !identifier || !path)
        return incomplete();
    return Container{
        .uuid = uuid->bytes(), .identifier = *identifier, .path = *path, .existed = reply.isTrue(keys::replyExisted)};
}

Result<Client::Page> Client::listPage(std::uint64_t containerClass, std::uint32_t user, bool transient,
                                      const std::string& after) {
    plist::Dictionary message = request(ipc::Command::listContainers);
    message.set(keys::containerClass, containerClass);
    message.set(keys::userId, user);
    message.set(keys::transient, transient);
    message.set(keys::pageAfter, after);
    const plist::Dictionary reply = TRY(connection_->call(message));
    Page page;
    if (!appendListed(reply, page.containers))
        return incomplete();
    // A daemon that knows no pages answers with the whole list, and names no next one.
    if (const std::string* next = reply.string(keys::replyNextPage)) {
        if (*next <= after) // the list would never end
            return incomplete();
        page.next = *next;
    }
    return page;
}

Result<std::vector<ListedContainer>> Client::list(std::uint64_t containerClass, std::uint32_t user, bool transient) {
    std::vector<ListedContainer> containers;
    for (std::optional<std::string> after = ""; after;) {
        Page page = TRY(listPage(containerClass, user, transient, *after));
        containers.insert(containers.end(), std::make_move_iterator(page.containers.begin()),
                          std::make_move_iterator(page.containers.end()));
        after = std::move(page.next);
    }
    return containers;
}

Result<void> Client::emptyDeathRow() {
    return withoutContent(connection_->call(request(ipc::Command::deleteContainersOnDeathRow)));
}

Result<void> Client::retryTest(std::uint32_t user, std::uint64_t crashes) {
    plist::Dictionary message = request(ipc::Command::retryTest);
    message.set(keys::userId, user);
    message.set(keys::numRetryCrashes, crashes);
    return withoutContent(connection_->call(message));
}

Result<void> Client::stageForDelete(const std::vector<Address>& containers) {
    plist::Array classes;
    plist::Array users;
    plist::Array identifiers;
    plist::Array uuids;
    for (const Address& container : containers) {
        classes.emplace_back(container.containerClass);
        users.emplace_back(container.user);
        identifiers.emplace_back(container.identifier);
        uuids.push_back(zor::UUID(container.uuid).value());
    }
    plist::Dictionary message = request(ipc::Command::stageContainersForDelete);
    message.set(keys::containerClassesArray, std::move(classes));
    message.set(keys::userIdsArray, std::move(users));
    message.set(keys::identifiersArray, std::move(identifiers));
    message.set(keys::uuidsArray, std::move(uuids));
    return withoutContent(connection_->call(message));
}

Result<void> Client::deleteContainer(std::uint64_t containerClass, std::uint32_t user, const std::string& identifier,
                                     bool transient) {
    plist::Dictionary message = request(ipc::Command::deleteContainer);
    message.set(keys::containerClass, containerClass);
    message.set(keys::userId, user);
    message.set(keys::identifier, identifier);
    message.set(keys::transient, transient);
    return withoutContent(connection_->call(message));
}

Result<void> Client::replace(const std::optional<Address>& old, const Address& fresh) {
    plist::Dictionary message = request(ipc::Command::replaceContainer);
    if (old) {
        message.set(keys::oldContainerClass, old->containerClass);
        message.set(keys::oldContainerUserId, old->user);
        message.set(keys::oldIdentifier, old->identifier);
        message.set(keys::oldContainerUUID, zor::UUID(old->uuid).value());
    }
    message.set(keys::newContainerClass, fresh.containerClass);
    message.set(keys::newContainerUserId, fresh.user);
    message.set(keys::newIdentifier, fresh.identifier);
    message.set(keys::newContainerUUID, zor::UUID(fresh.uuid).value());
    return withoutContent(connection_->call(message));
}

Result<void> Client::wipe(std::uint64_t containerClass, std::uint32_t user, const std::string& identifier) {
    plist::Dictionary message = request(ipc::Command::wipeDataContainerContent);
    message.set(keys::containerClass, containerClass);
    message.set(keys::userId, user);
    message.set(keys::identifier, identifier);
    return withoutContent(connection_->call(message));
}

Result<void> Client::wipePluginData(std::uint32_t user, const std::string& identifier) {
    plist::Dictionary message = request(ipc::Command::wipeEntitledPluginDataContainer);
    message.set(keys::userId, user);
    message.set(keys::identifier, identifier);
    return withoutContent(connection_->call(message));
}

Result<Client::Metadata> Client::metadata(const Address& address) {
    plist::Dictionary message = addressed(ipc::Command::getMetadata, address);
    message.set(keys::infoDictRequested, true);
    const plist::Dictionary reply = TRY(connection_->call(message));
    const std::string* path = reply.string(keys::replyPath);
    if (!path)
        return incomplete();
    const plist::Dictionary* info = reply.dictionary(keys::replyInfoDictionary);
    return Metadata{
        .path = *path, .transient = reply.isTrue(keys::replyTransient), .info = info ? converted(*info) : Map()};
}

Result<Value> Client::infoValue(const Address& address, const std::string& key) {
    plist::Dictionary message = addressed(ipc::Command::getInfoValue, address);
    message.set(keys::key, key);
    const plist::Dictionary reply = TRY(connection_->call(message));
    const plist::Value* value = reply.find(keys::replyInfoValue);
    if (!value)
        return incomplete();
    return converted(*value);
}

Result<void> Client::setInfoValue(const Address& address, const std::string& key, const std::optional<Value>& value) {
    plist::Dictionary message = addressed(ipc::Command::setInfoValue, address);
    message.set(keys::key, key);
    if (value)
        message.set(keys::value, unconverted(*value));
    return withoutContent(connection_->call(message));
}

Result<void> Client::recreateDefaultStructure(const Address& address) {
    return withoutContent(connection_->call(addressed(ipc::Command::recreateDefaultStructure, address)));
}

Result<void> Client::regenerateDirectoryUUID(const Address& address) {
    return withoutContent(connection_->call(addressed(ipc::Command::regenerateDirectoryUUID, address)));
}

Result<void> Client::setDataProtection(const ProtectionChange& change) {
    plist::Dictionary message = request(ipc::Command::setDataProtection);
    message.set(keys::containerClass, change.containerClass);
    message.set(keys::userId, change.user);
    message.set(keys::identifier, change.identifier);
    message.set(keys::dataProtectionClass, change.protectionClass);
    message.set(keys::isThirdParty, change.thirdParty);
    message.set(keys::retryIfLocked, change.retryIfLocked);
    return withoutContent(connection_->call(message));
}

Result<std::uint64_t> Client::diskUsage(const Address& address) {
    const plist::Dictionary reply = TRY(connection_->call(addressed(ipc::Command::getDiskUsage, address)));
    const auto bytes = reply.unsignedInteger(keys::replyDiskUsage);
    if (!bytes)
        return incomplete();
    return *bytes;
}

namespace {

plist::Dictionary about(ipc::Command command, const std::string& identifier) {
    plist::Dictionary message = request(command);
    setIdentifier(message, identifier);
    return message;
}

plist::Dictionary groupsRequest(std::uint32_t user, const std::string& identifier) {
    plist::Dictionary message = about(ipc::Command::getGroupContainerPaths, identifier);
    message.set(keys::userId, user);
    return message;
}

} // namespace

Result<Client::GroupPaths> Client::groupContainerPaths(std::uint32_t user, const std::string& identifier) {
    return groupPathsIn(connection_->call(groupsRequest(user, identifier)));
}

Result<Client::SharedContainers> Client::sharedContainers(std::uint32_t user, const std::string& identifier) {
    plist::Dictionary requests[] = {groupsRequest(user, identifier),
                                    about(ipc::Command::getSystemGroupContainerPaths, identifier),
                                    about(ipc::Command::getSystemContainerPath, identifier)};
    requests[0].set(keys::passedSockets, true);
    auto replies = connection_->callTogether(requests);
    const plist::Value* const passed = replies[0] ? replies[0]->find(keys::replyPassedSockets) : nullptr;
    const bool* const mayBePassed = passed ? passed->asBoolean() : nullptr;
    const std::optional<bool> passedSockets = mayBePassed ? std::optional(*mayBePassed) : std::nullopt;
    auto applicationGroups = TRY(groupPathsIn(std::move(replies[0])));
    auto systemGroups = TRY(groupPathsIn(std::move(replies[1])));
    SharedContainers shared{.applicationGroups = std::move(applicationGroups),
                            .systemGroups = std::move(systemGroups),
                            .systemContainer = {},
                            .passedSockets = passedSockets};
    auto path = pathIn(std::move(replies[2]));
    if (path)
        shared.systemContainer = std::move(*path);
    else if (path.error().kind != Error::Kind::daemon || path.error().code != codeNotEntitled)
        return std::unexpected(std::move(path.error()));
    return shared;
}

Result<std::vector<std::string>> Client::groupContainerIdentifiers(std::uint32_t user, const std::string& identifier) {
    plist::Dictionary message = request(ipc::Command::getGroupContainerIdentifiers);
    message.set(keys::userId, user);
    setIdentifier(message, identifier);
    const plist::Dictionary reply = TRY(connection_->call(message));
    const plist::Array* array = reply.array(keys::replyGroupIdentifiersArray);
    if (!array)
        return incomplete();
    std::vector<std::string> groups;
    for (const plist::Value& element : *array) {
        if (!element.asString())
            return incomplete();
        groups.push_back(*element.asString());
    }
    return groups;
}

Result<std::string> Client::systemContainerPath(const std::string& identifier) {
    return pathIn(connection_->call(about(ipc::Command::getSystemContainerPath, identifier)));
}

Result<Client::GroupPaths> Client::systemGroupContainerPaths(const std::string& identifier) {
    return groupPathsIn(connection_->call(about(ipc::Command::getSystemGroupContainerPaths, identifier)));
}

Result<std::string> Client::systemGroupContainerPath(const std::string& groupIdentifier,
                                                     const std::string& identifier) {
    plist::Dictionary message = request(ipc::Command::getSystemGroupContainerPath);
    message.set(keys::groupIdentifier, groupIdentifier);
    setIdentifier(message, identifier);
    return pathIn(connection_->call(message));
}

Result<void> Client::processEntitlements(const Registration& registration) {
    plist::Dictionary options;
    if (!registration.parentIdentifier.empty())
        options.set(keys::parentBundleIdOption, registration.parentIdentifier);
    if (registration.placeholder)
        options.set(keys::placeholderOption, true);
    plist::Dictionary message = request(ipc::Command::processEntitlements);
    message.set(keys::identifier, registration.identifier);
    message.set(keys::optionsDictionary, std::move(options));
    if (registration.entitlements)
        message.set(keys::entitlements, unconverted(*registration.entitlements));
    return withoutContent(connection_->call(message));
}

Result<Value> status(const ConnectOptions& options) {
    auto connection = TRY(Client::Connection::open(options, Client::Connection::Service::status));
    connection.startTime(connection.timeoutMilliseconds());
    const auto reply = connection.receive();
    if (!reply)
        return std::unexpected(connection.explained(reply.error()));
    return Value{converted(reply->content)};
}

} // namespace zorvane
