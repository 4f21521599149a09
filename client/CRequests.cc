// SPDX-License-Identifier: Apache-2.0
// Requests of the C interface: each judges and copies its arguments, and says which call of the client carries it out.
#include "CInterface.h"

#include "platform/Errno.h"
#include "plist/Text.h"

#include <utility>

namespace zorvane::c {

namespace {

using Outcome = Result<zorvane_result>;

/// The request that `build` returns the Run of. Arguments that are not allowed are the error of the call.
template <typename Build>
zorvane_request* prepared(Build&& build) noexcept {
    return guardedOr(static_cast<zorvane_request*>(nullptr), [&] {
        try {
            return std::make_unique<zorvane_request>(build()).release();
        } catch (const Wrong& wrong) {
            const Run fails = [wrong](Session&) -> Outcome { throw wrong; };
            return std::make_unique<zorvane_request>(fails).release();
        }
    });
}

template <typename Call>
Run onClient(Call&& call) {
    return [call = std::forward<Call>(call)](Session& session) -> Outcome { return call(*TRY(session.client())); };
}

std::string textOf(const char* text, const char* whenMissing) {
    if (!text || *text == '\0')
        throw Wrong{whenMissing};
    if (!zor::plist::isUtf8(text))
        throw Wrong{"a string of the request is no UTF-8"};
    return text;
}

std::string neededIdentifier(const char* identifier) {
    return textOf(identifier, "the request has no identifier");
}

/// Empty: the caller's own.
std::string identifierOrOwn(const char* identifier) {
    return identifier ? textOf(identifier, "the identifier is empty") : std::string();
}

Client::Address addressOf(const zorvane_address* address) {
    if (!address)
        throw Wrong{"the request names no container"};
    Client::Address made{.containerClass = address->container_class,
                         .user = address->user,
                         .identifier = neededIdentifier(address->identifier)};
    std::copy_n(address->uuid, made.uuid.size(), made.uuid.begin());
    return made;
}

/// Fails for a flag that is none of the allowed ones.
void judge(std::uint32_t flags, std::uint32_t allowed) {
    if ((flags & ~allowed) != 0)
        throw Wrong{"the request has a flag that its command does not have"};
}

bool has(std::uint32_t flags, std::uint32_t flag) {
    return (flags & flag) != 0;
}

Outcome nothingOf(const Result<void>& result) {
    TRY(result);
    return zorvane_result{};
}

/// The answer that `fill` makes of the client's.
template <typename T, typename Fill>
Outcome resultOf(Result<T>&& answer, Fill&& fill) {
    T value = TRY(std::move(answer));
    zorvane_result result;
    fill(result, std::move(value));
    return result;
}

Outcome pathOf(Result<std::string>&& answer) {
    return resultOf(std::move(answer), [](zorvane_result& result, std::string&& path) { result.path = path; });
}

Outcome groupsOf(Result<Client::GroupPaths>&& answer) {
    return resultOf(std::move(answer), [](zorvane_result& result, Client::GroupPaths&& paths) {
        for (auto& [group, path] : paths)
            result.entries.push_back({.identifier = group, .path = std::move(path), .uuid = {}});
    });
}

void putListed(zorvane_result& result, std::vector<ListedContainer>&& containers) {
    for (ListedContainer& container : containers)
        result.entries.push_back({.identifier = std::move(container.identifier), .path = {}, .uuid = container.uuid});
}

/// A request about one container, whose answer has nothing in it.
zorvane_request* onContainer(const zorvane_address* container, Result<void> (Client::*call)(const Client::Address&)) {
    return prepared([&] {
        return onClient([=, address = addressOf(container)](Client& client) -> Outcome {
            return nothingOf((client.*call)(address));
        });
    });
}

} // namespace

} // namespace zorvane::c

using namespace zorvane::c;
using zorvane::Client;

void zorvane_request_free(zorvane_request* request) {
    delete request;
}

zorvane_request* zorvane_request_lookup(std::uint32_t container_class, std::uint32_t user, const char* identifier,
                                        std::uint32_t flags) {
    return prepared([&] {
        judge(flags, ZORVANE_CREATE | ZORVANE_TRANSIENT);
        return onClient([lookup = Client::Lookup{.containerClass = container_class,
                                                 .user = user,
                                                 .identifier = identifierOrOwn(identifier),
                                                 .create = has(flags, ZORVANE_CREATE),
                                                 .transient = has(flags, ZORVANE_TRANSIENT)}](Client& client) {
            return resultOf(client.createOrLookup(lookup), [](zorvane_result& result, zorvane::Container&& found) {
                result.path = std::move(found.path);
                result.identifier = std::move(found.identifier);
                result.uuid = found.uuid;
                result.existed = found.existed;
            });
        });
    });
}

zorvane_request* zorvane_request_list(std::uint32_t container_class, std::uint32_t user, std::uint32_t flags) {
    return prepared([&] {
        judge(flags, ZORVANE_TRANSIENT);
        return onClient([=](Client& client) {
            return resultOf(client.list(container_class, user, has(flags, ZORVANE_TRANSIENT)), putListed);
        });
    });
}

zorvane_request* zorvane_request_list_page(std::uint32_t container_class, std::uint32_t user, std::uint32_t flags,
                                           const char* after) {
    return prepared([&] {
        judge(flags, ZORVANE_TRANSIENT);
        const std::string begin = after && *after != '\0' ? textOf(after, "") : std::string();
        return onClient([=, after = begin](Client& client) {
            return resultOf(client.listPage(container_class, user, has(flags, ZORVANE_TRANSIENT), after),
                            [](zorvane_result& result, Client::Page&& page) {
                                putListed(result, std::move(page.containers));
                                result.nextPage = std::move(page.next);
                            });
        });
    });
}

zorvane_request* zorvane_request_delete(std::uint32_t container_class, std::uint32_t user, const char* identifier,
                                        std::uint32_t flags) {
    return prepared([&] {
        judge(flags, ZORVANE_TRANSIENT);
        return onClient([=, identifier = neededIdentifier(identifier)](Client& client) {
            return nothingOf(client.deleteContainer(container_class, user, identifier, has(flags, ZORVANE_TRANSIENT)));
        });
    });
}

zorvane_request* zorvane_request_stage_for_delete(const zorvane_address* containers, std::size_t count) {
    return prepared([&] {
        if (!containers && count != 0)
            throw Wrong{"the request names no container"};
        std::vector<Client::Address> addresses;
        for (std::size_t i = 0; i < count; ++i)
            addresses.push_back(addressOf(containers + i));
        return onClient(
            [addresses = std::move(addresses)](Client& client) { return nothingOf(client.stageForDelete(addresses)); });
    });
}

zorvane_request* zorvane_request_empty_death_row() {
    return prepared([&] { return onClient([](Client& client) { return nothingOf(client.emptyDeathRow()); }); });
}

zorvane_request* zorvane_request_replace(const zorvane_address* old, const zorvane_address* fresh) {
    return prepared([&] {
        return onClient([old = old ? std::optional(addressOf(old)) : std::nullopt,
                         fresh = addressOf(fresh)](Client& client) { return nothingOf(client.replace(old, fresh)); });
    });
}

zorvane_request* zorvane_request_wipe(std::uint32_t container_class, std::uint32_t user, const char* identifier) {
    return prepared([&] {
        return onClient([=, identifier = neededIdentifier(identifier)](Client& client) {
            return nothingOf(client.wipe(container_class, user, identifier));
        });
    });
}

zorvane_request* zorvane_request_wipe_plugin_data(std::uint32_t user, const char* identifier) {
    return prepared([&] {
        return onClient([=, identifier = neededIdentifier(identifier)](Client& client) {
            return nothingOf(client.wipePluginData(user, identifier));
        });
    });
}

zorvane_request* zorvane_request_metadata(const zorvane_address* container) {
    return prepared([&] {
        return onClient([address = addressOf(container)](Client& client) {
            return resultOf(client.metadata(address), [](zorvane_result& result, Client::Metadata&& metadata) {
                result.path = std::move(metadata.path);
                result.transient = metadata.transient;
                result.value = zorvane::Value{std::move(metadata.info)};
            });
        });
    });
}

zorvane_request* zorvane_request_info(const zorvane_address* container, const char* key) {
    return prepared([&] {
        return onClient([address = addressOf(container), key = textOf(key, "the request has no key")](Client& client) {
            return resultOf(client.infoValue(address, key),
                            [](zorvane_result& result, zorvane::Value&& value) { result.value = std::move(value); });
        });
    });
}

zorvane_request* zorvane_request_set_info(const zorvane_address* container, const char* key,
                                          const zorvane_value* value) {
    return prepared([&] {
        return onClient([address = addressOf(container), key = textOf(key, "the request has no key"),
                         value = value ? std::optional(*valueOf(value)) : std::nullopt](Client& client) {
            return nothingOf(client.setInfoValue(address, key, value));
        });
    });
}

zorvane_request* zorvane_request_disk_usage(const zorvane_address* container) {
    return prepared([&] {
        return onClient([address = addressOf(container)](Client& client) {
            return resultOf(client.diskUsage(address),
                            [](zorvane_result& result, std::uint64_t bytes) { result.bytes = bytes; });
        });
    });
}

zorvane_request* zorvane_request_recreate_structure(const zorvane_address* container) {
    return onContainer(container, &Client::recreateDefaultStructure);
}

zorvane_request* zorvane_request_regenerate_directory(const zorvane_address* container) {
    return onContainer(container, &Client::regenerateDirectoryUUID);
}

zorvane_request* zorvane_request_set_protection(std::uint32_t container_class, std::uint32_t user,
                                                const char* identifier, std::int32_t protection_class,
                                                std::uint32_t flags) {
    return prepared([&] {
        judge(flags, ZORVANE_THIRD_PARTY | ZORVANE_RETRY_IF_LOCKED);
        return onClient([change = Client::ProtectionChange{.containerClass = container_class,
                                                           .user = user,
                                                           .identifier = neededIdentifier(identifier),
                                                           .protectionClass = protection_class,
                                                           .thirdParty = has(flags, ZORVANE_THIRD_PARTY),
                                                           .retryIfLocked = has(flags, ZORVANE_RETRY_IF_LOCKED)}](
                            Client& client) { return nothingOf(client.setDataProtection(change)); });
    });
}

zorvane_request* zorvane_request_group_paths(std::uint32_t user, const char* identifier) {
    return prepared([&] {
        return onClient([=, identifier = identifierOrOwn(identifier)](Client& client) {
            return groupsOf(client.groupContainerPaths(user, identifier));
        });
    });
}

zorvane_request* zorvane_request_group_identifiers(std::uint32_t user, const char* identifier) {
    return prepared([&] {
        return onClient([=, identifier = identifierOrOwn(identifier)](Client& client) {
            return resultOf(client.groupContainerIdentifiers(user, identifier),
                            [](zorvane_result& result, std::vector<std::string>&& groups) {
                                for (std::string& group : groups)
                                    result.entries.push_back({.identifier = std::move(group), .path = {}, .uuid = {}});
                            });
        });
    });
}

zorvane_request* zorvane_request_system_path(const char* identifier) {
    return prepared([&] {
        return onClient([identifier = identifierOrOwn(identifier)](Client& client) {
            return pathOf(client.systemContainerPath(identifier));
        });
    });
}

zorvane_request* zorvane_request_system_group_paths(const char* identifier) {
    return prepared([&] {
        return onClient([identifier = identifierOrOwn(identifier)](Client& client) {
            return groupsOf(client.systemGroupContainerPaths(identifier));
        });
    });
}

zorvane_request* zorvane_request_system_group_path(const char* group, const char* identifier) {
    return prepared([&] {
        return onClient([group = textOf(group, "the request has no group"), identifier = identifierOrOwn(identifier)](
                            Client& client) { return pathOf(client.systemGroupContainerPath(group, identifier)); });
    });
}

zorvane_request* zorvane_request_register(const char* identifier, const zorvane_value* entitlements, const char* parent,
                                          std::uint32_t flags) {
    return prepared([&] {
        judge(flags, ZORVANE_PLACEHOLDER);
        Client::Registration registration{.identifier = neededIdentifier(identifier),
                                          .entitlements = {},
                                          .parentIdentifier = identifierOrOwn(parent),
                                          .placeholder = has(flags, ZORVANE_PLACEHOLDER)};
        if (entitlements) {
            const auto* const map = std::get_if<zorvane::Map>(&valueOf(entitlements)->content);
            if (!map)
                throw Wrong{"the entitlements are no map"};
            registration.entitlements = *map;
        }
        return onClient([registration = std::move(registration)](Client& client) {
            return nothingOf(client.processEntitlements(registration));
        });
    });
}

zorvane_request* zorvane_request_status() {
    return prepared([&]() -> Run {
        return [](Session& session) {
            return resultOf(zorvane::status(session.options()),
                            [](zorvane_result& result, zorvane::Value&& value) { result.value = std::move(value); });
        };
    });
}

zorvane_request* zorvane_request_retry_test(std::uint32_t user, std::uint64_t crashes) {
    return prepared(
        [&] { return onClient([=](Client& client) { return nothingOf(client.retryTest(user, crashes)); }); });
}
