// SPDX-License-Identifier: Apache-2.0
// Shared containers: where they are, who refers to them, and what would go with an identifier.
#include "Commands.h"
#include "KnownContainer.h"
#include "RegisteredEntitlements.h"

namespace zorvanectl {

namespace {

std::string named(const std::string& identifier) {
    return identifier.empty() ? "this program" : identifier;
}

int pathAnswer(const zorvane::Result<std::string>& path, const Output& output, const std::string& what) {
    if (!path)
        return output.error(path.error(), what);
    if (output.isJson())
        output.json({{"path", *path}});
    else
        output.line(printable(*path));
    return exitDone;
}

struct GroupFate {
    RegisteredEntitlements::Group group;
    const char* kind;
    /// Its only reference is the identifier's.
    bool goes;
};

std::vector<GroupFate> fatesOf(const RegisteredEntitlements& registered, const std::string& identifier) {
    std::vector<GroupFate> fates;
    for (const auto& [kind, name] : RegisteredEntitlements::groupKinds)
        for (auto& group : registered.groupsOf(identifier, kind)) {
            const bool goes = group.holders.size() == 1;
            fates.push_back({.group = std::move(group), .kind = name, .goes = goes});
        }
    return fates;
}

} // namespace

int groups(const zorvane::ConnectOptions& connect, const Output& output, std::uint32_t user,
           const std::string& identifier) {
    const std::string what = "find the groups of " + named(identifier);
    auto client = zorvane::Client::connect(connect);
    if (!client)
        return output.error(client.error(), what);
    const auto application = client->groupContainerPaths(user, identifier);
    if (!application)
        return output.error(application.error(), what);
    const auto system = client->systemGroupContainerPaths(identifier);
    if (!system)
        return output.error(system.error(), what);
    if (output.isJson()) {
        output.json({{"application", *application}, {"system", *system}});
        return exitDone;
    }
    std::vector<std::vector<std::string>> rows;
    for (const auto& [group, path] : *application)
        rows.push_back({printable(group), printable(path)});
    for (const auto& [group, path] : *system)
        rows.push_back({printable(group), printable(path)});
    output.table({"GROUP", "PATH"}, rows);
    return exitDone;
}

int systemPath(const zorvane::ConnectOptions& connect, const Output& output, const std::string& identifier) {
    const std::string what = "find the system container of " + named(identifier);
    auto client = zorvane::Client::connect(connect);
    if (!client)
        return output.error(client.error(), what);
    return pathAnswer(client->systemContainerPath(identifier), output, what);
}

int systemGroupPath(const zorvane::ConnectOptions& connect, const Output& output, const std::string& group,
                    const std::string& identifier) {
    const std::string what = "find the container of system group " + group;
    auto client = zorvane::Client::connect(connect);
    if (!client)
        return output.error(client.error(), what);
    return pathAnswer(client->systemGroupContainerPath(group, identifier), output, what);
}

int why(const zorvane::ConnectOptions& connect, const Output& output, const std::string& identifier) {
    const auto registered = RegisteredEntitlements::ask(connect);
    if (!registered)
        return output.error(registered.error(), "explain " + identifier);
    const auto fates = fatesOf(*registered, identifier);
    const bool systemContainer = registered->hasSystemContainer(identifier);
    if (output.isJson()) {
        nlohmann::json groups = nlohmann::json::array();
        for (const GroupFate& fate : fates)
            groups.push_back({{"group", fate.group.identifier},
                              {"kind", fate.kind},
                              {"references", fate.group.holders.size()},
                              {"holders", fate.group.holders},
                              {"goesWithIdentifier", fate.goes}});
        output.json({{"identifier", identifier},
                     {"registered", registered->of(identifier) != nullptr},
                     {"systemContainerGoesWithIdentifier", systemContainer},
                     {"groups", groups},
                     {"children", registered->childrenOf(identifier)}});
        return exitDone;
    }
    if (!registered->of(identifier)) {
        output.line(printable(identifier) + ": nothing is registered, so nothing would go with it");
        return exitDone;
    }
    output.line(printable(identifier));
    for (const GroupFate& fate : fates) {
        const std::size_t references = fate.group.holders.size();
        std::string line = "  " + std::string(fate.kind) + " group " + printable(fate.group.identifier) + ": " +
                           std::to_string(references) + (references == 1 ? " reference, by" : " references, by");
        for (const std::string& holder : fate.group.holders)
            line += " " + printable(holder);
        output.line(line);
    }
    output.line("If it went, these containers would go:");
    for (const GroupFate& fate : fates)
        if (fate.goes)
            output.line("  of " + std::string(fate.kind) + " group " + printable(fate.group.identifier));
    if (systemContainer)
        output.line("  its system container");
    for (const std::string& child : registered->childrenOf(identifier))
        output.line("  and what goes with its child " + printable(child));
    return exitDone;
}

int whyGroup(const zorvane::ConnectOptions& connect, const Output& output, const std::string& identifier) {
    const std::string what = "explain group " + identifier;
    const auto registered = RegisteredEntitlements::ask(connect);
    if (!registered)
        return output.error(registered.error(), what);
    for (const auto& [kind, name] : RegisteredEntitlements::groupKinds)
        for (const RegisteredEntitlements::Group& group : registered->groups(kind)) {
            if (group.identifier != identifier)
                continue;
            if (output.isJson()) {
                output.json({{"group", identifier}, {"kind", name}, {"holders", group.holders}});
                return exitDone;
            }
            output.line(printable(identifier) + ", " + name + " group, held by");
            for (const std::string& holder : group.holders)
                output.line("  " + printable(holder));
            output.line(group.holders.size() == 1 ? "Its container goes when this one drops it."
                                                  : "Its container goes when the last of these drops it.");
            return exitDone;
        }
    return output.error({.kind = zorvane::Error::Kind::daemon,
                         .code = codeNotFound,
                         .message = "nobody is registered for this group",
                         .advice = "'zorvanectl entitlements list' shows who is registered; a group comes with an "
                                   "identifier that lists it"},
                        what);
}

} // namespace zorvanectl
