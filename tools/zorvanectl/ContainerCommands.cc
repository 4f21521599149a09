// SPDX-License-Identifier: Apache-2.0
// Making, finding and deleting containers.
#include "Commands.h"
#include "KnownContainer.h"

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
        output.json({{"deleted", rows}, {"bytes", toJson(bytes)}, {"waitsOnDeathRow", true}});
    else
        output.line(amount + ". The files wait on death row until 'zorvanectl empty-death-row', the next replace, "
                             "installation or wipe, or the next start of the daemon");
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

} // namespace zorvanectl
