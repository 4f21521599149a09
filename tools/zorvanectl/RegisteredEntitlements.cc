// SPDX-License-Identifier: Apache-2.0
#include "RegisteredEntitlements.h"

#include "platform/Errno.h"

#include <algorithm>

namespace zorvanectl {

namespace {

template <typename T>
const T* in(const zorvane::Map* map, const std::string& key) {
    if (!map)
        return nullptr;
    const auto found = map->find(key);
    return found == map->end() ? nullptr : std::get_if<T>(&found->second.content);
}

std::vector<std::string> strings(const zorvane::List* list) {
    std::vector<std::string> texts;
    for (const zorvane::Value& element : list ? *list : zorvane::List())
        if (const auto* text = std::get_if<std::string>(&element.content))
            texts.push_back(*text);
    return texts;
}

} // namespace

zorvane::Result<RegisteredEntitlements> RegisteredEntitlements::ask(const zorvane::ConnectOptions& connect) {
    zorvane::Value status = TRY(zorvane::status(connect));
    const auto failed = [](std::string message) {
        return std::unexpected(
            zorvane::Error{.kind = zorvane::Error::Kind::refused, .code = 0, .message = std::move(message)});
    };
    auto* map = std::get_if<zorvane::Map>(&status.content);
    if (map && in<bool>(map, statusEntitlementsLeftOut))
        return failed("the registered entitlements are too many or nest too deep for the status socket, or the daemon "
                      "has too little memory");
    if (!in<zorvane::Map>(map, statusEntitlements))
        return failed("only the owner of the daemon's root may see registered entitlements");
    return RegisteredEntitlements(std::move(*map));
}

const zorvane::Map* RegisteredEntitlements::map(const char* key) const {
    return in<zorvane::Map>(&status_, key);
}

const zorvane::Map* RegisteredEntitlements::of(const std::string& identifier) const {
    return in<zorvane::Map>(map(statusEntitlements), identifier);
}

bool RegisteredEntitlements::hasSystemContainer(const std::string& identifier) const {
    const bool* entitled = in<bool>(of(identifier), systemContainerKey);
    return entitled && *entitled;
}

std::vector<std::string> RegisteredEntitlements::childrenOf(const std::string& identifier) const {
    return strings(in<zorvane::List>(in<zorvane::Map>(map(statusEntitlements), childrenKey), identifier));
}

std::vector<std::string> RegisteredEntitlements::identifiers() const {
    std::vector<std::string> identifiers;
    const zorvane::Map* entitlements = map(statusEntitlements);
    for (const auto& [identifier, value] : entitlements ? *entitlements : zorvane::Map())
        if (!identifier.starts_with(ownKeysBegin))
            identifiers.push_back(identifier);
    return identifiers;
}

std::vector<RegisteredEntitlements::Group> RegisteredEntitlements::groups(GroupKind kind) const {
    std::vector<Group> groups;
    const char* name = kind == GroupKind::application ? "Application" : "System";
    const zorvane::Map* references = in<zorvane::Map>(map(statusGroupReferences), name);
    for (const auto& [group, value] : references ? *references : zorvane::Map())
        groups.push_back({.identifier = group, .holders = strings(std::get_if<zorvane::List>(&value.content))});
    return groups;
}

std::vector<RegisteredEntitlements::Group> RegisteredEntitlements::groupsOf(const std::string& identifier,
                                                                            GroupKind kind) const {
    auto all = groups(kind);
    std::erase_if(
        all, [&](const Group& group) { return std::ranges::find(group.holders, identifier) == group.holders.end(); });
    return all;
}

} // namespace zorvanectl
