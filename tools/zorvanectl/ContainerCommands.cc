// SPDX-License-Identifier: Apache-2.0
// Making, finding, listing and deleting containers, and asking how the daemon is.
#include "Commands.h"
#include "KnownContainer.h"
#include "RegisteredEntitlements.h"

#include <algorithm>

namespace zorvanectl {

namespace {

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

int deleteContainers(const zorvane::ConnectOptions& connect, const Output& output, const Target& target,
                     const std::vector<std::string>& identifiers, Consent consent) {
    const std::string what = "delete from " + std::string(zorvane::containerClassName(target.containerClass));
    auto client = zorvane::Client::connect(connect);
    if (!client)
        return output.error(client.error(), what);
    const auto containers = client->list(target.containerClass, userOf(target), target.transient);
    if (!containers)
        return output.error(containers.error(), what);
    std::vector<zorvane::Client::Address> deletions;
    for (const std::string& identifier : identifiers) {
        const auto found = std::ranges::find(*containers, identifier, &zorvane::ListedContainer::identifier);
        if (found == containers->end())
            return output.error(
                {.kind = zorvane::Error::Kind::daemon,
                 .code = codeNotFound,
                 .message = "there is no container of " + printable(identifier) + "; nothing was deleted"},
                what);
        deletions.push_back({.containerClass = target.containerClass,
                             .user = userOf(target),
                             .identifier = identifier,
                             .uuid = found->uuid});
    }
    const auto bytes = measured(connect, deletions);
    const std::string amount = std::to_string(deletions.size()) +
                               (deletions.size() == 1 ? " container" : " containers") + ", " + shownBytes(bytes);
    if (consent == Consent::ask && !output.agreed("Delete " + amount + "?", what))
        return exitUsage;
    if (const auto staged = client->stageForDelete(deletions); !staged)
        return output.error(staged.error(), what);
    nlohmann::json rows = nlohmann::json::array();
    for (const auto& deletion : deletions) {
        rows.push_back({{"identifier", deletion.identifier}, {"uuid", zorvane::uuidText(deletion.uuid)}});
        if (!output.isJson())
            output.line(printable(deletion.identifier) + " deleted");
    }
    if (output.isJson())
        output.json({{"deleted", rows}, {"bytes", toJson(bytes)}});
    else
        output.line(amount);
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
            if (key != statusEntitlements && key != statusGroupReferences) // 'entitlements show' and 'why' have them
                output.tree(key, value);
    return exitDone;
}

} // namespace zorvanectl
