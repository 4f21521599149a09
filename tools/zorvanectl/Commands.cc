// SPDX-License-Identifier: Apache-2.0
#include "Commands.h"

#include <algorithm>

namespace zorvanectl {

namespace {

std::uint32_t userOf(const Target& target) {
    return target.user.value_or(zorvane::defaultUserOfClass(target.containerClass));
}

std::string describe(const Target& target) {
    std::string text = target.identifier.empty() ? "this program's own container" : target.identifier;
    text += " in " + std::string(zorvane::containerClassName(target.containerClass));
    const std::uint32_t user = userOf(target);
    text += user == zorvane::currentMobileUser ? " of the current user" : " of user " + std::to_string(user);
    return target.transient ? text + ", transient" : text;
}

int createOrLookup(const zorvane::ConnectOptions& connect, const Output& output, const Target& target, bool make) {
    const std::string what = (make ? "create " : "look up ") + describe(target);
    auto client = zorvane::Client::connect(connect);
    if (!client)
        return output.error(client.error(), what);
    const auto container = client->createOrLookup({.containerClass = target.containerClass,
                                                   .user = userOf(target),
                                                   .identifier = target.identifier,
                                                   .create = make,
                                                   .transient = target.transient});
    if (!container)
        return output.error(container.error(), what);
    if (output.isJson()) {
        output.json({{"identifier", container->identifier},
                     {"uuid", zorvane::uuidText(container->uuid)},
                     {"path", container->path},
                     {"existed", container->existed},
                     {"class", target.containerClass}});
        return exitDone;
    }
    output.line(printable(container->identifier) + (container->existed ? " exists" : " created"));
    output.line("  uuid  " + zorvane::uuidText(container->uuid));
    output.line("  path  " + printable(container->path));
    return exitDone;
}

std::string shown(const zorvane::Value& value) {
    if (const auto* text = std::get_if<std::string>(&value.content))
        return printable(*text);
    if (const auto* boolean = std::get_if<bool>(&value.content))
        return *boolean ? "yes" : "no";
    return toJson(value).dump();
}

void printTree(const Output& output, const std::string& name, const zorvane::Value& value, const std::string& indent) {
    const auto* map = std::get_if<zorvane::Map>(&value.content);
    if (!map) {
        output.line(indent + printable(name) + ": " + shown(value));
        return;
    }
    output.line(indent + printable(name) + ":");
    for (const auto& [key, element] : *map)
        printTree(output, key, element, indent + "  ");
}

} // namespace

int create(const zorvane::ConnectOptions& connect, const Output& output, const Target& target) {
    return createOrLookup(connect, output, target, true);
}

int lookup(const zorvane::ConnectOptions& connect, const Output& output, const Target& target) {
    return createOrLookup(connect, output, target, false);
}

int list(const zorvane::ConnectOptions& connect, const Output& output, const Target& target) {
    const std::string what = "list " + std::string(zorvane::containerClassName(target.containerClass));
    auto client = zorvane::Client::connect(connect);
    if (!client)
        return output.error(client.error(), what);
    auto containers = client->list(target.containerClass, userOf(target), target.transient);
    if (!containers)
        return output.error(containers.error(), what);
    std::ranges::sort(*containers, {}, &zorvane::ListedContainer::identifier);
    if (output.isJson()) {
        nlohmann::json rows = nlohmann::json::array();
        for (const auto& container : *containers)
            rows.push_back({{"identifier", container.identifier}, {"uuid", zorvane::uuidText(container.uuid)}});
        output.json(rows);
        return exitDone;
    }
    std::vector<std::vector<std::string>> rows;
    for (const auto& container : *containers)
        rows.push_back({zorvane::uuidText(container.uuid), printable(container.identifier)});
    output.table({"UUID", "IDENTIFIER"}, rows);
    return exitDone;
}

int emptyDeathRow(const zorvane::ConnectOptions& connect, const Output& output) {
    auto client = zorvane::Client::connect(connect);
    if (!client)
        return output.error(client.error(), "empty death row");
    if (const auto done = client->emptyDeathRow(); !done)
        return output.error(done.error(), "empty death row");
    if (output.isJson())
        output.json({{"emptied", true}});
    else
        output.line("Death row is empty");
    return exitDone;
}

int status(const zorvane::ConnectOptions& connect, const Output& output) {
    const auto answer = zorvane::status(connect);
    if (!answer)
        return output.error(answer.error(), "ask for the status");
    if (output.isJson()) {
        output.json(toJson(*answer));
        return exitDone;
    }
    if (const auto* map = std::get_if<zorvane::Map>(&answer->content))
        for (const auto& [key, value] : *map)
            printTree(output, key, value, "");
    return exitDone;
}

} // namespace zorvanectl
