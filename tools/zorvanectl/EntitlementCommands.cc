// SPDX-License-Identifier: Apache-2.0
// Registering, showing and removing what an identifier is entitled to.
#include "Commands.h"
#include "RegisteredEntitlements.h"

#include <cstdio>
#include <expected>
#include <memory>

namespace zorvanectl {

namespace {

struct CloseFile {
    void operator()(std::FILE* file) const {
        if (file != stdin)
            std::fclose(file);
    }
};

/// Everything that a file holds; nullopt when it cannot be read.
std::optional<std::string> contentOf(const std::string& file) {
    const std::unique_ptr<std::FILE, CloseFile> input(file == "-" ? stdin : std::fopen(file.c_str(), "re"));
    if (!input)
        return std::nullopt;
    std::string content;
    char buffer[4096];
    for (std::size_t count = sizeof buffer; count == sizeof buffer;) {
        count = std::fread(buffer, 1, sizeof buffer, input.get());
        content.append(buffer, count);
    }
    return std::ferror(input.get()) ? std::nullopt : std::optional(std::move(content));
}

/// The object in a file, or why there is none.
std::expected<zorvane::Map, std::string> readFile(const std::string& file) {
    const auto content = contentOf(file);
    const auto json = nlohmann::json::parse(content.value_or(""), nullptr, false);
    if (json.is_object())
        if (auto value = fromJson(json))
            return std::get<zorvane::Map>(std::move(value->content));
    return std::unexpected(printable(file) + (content ? " holds no JSON object without null" : " cannot be read"));
}

void addStrings(zorvane::Map& map, const char* key, const std::vector<std::string>& texts) {
    if (texts.empty())
        return;
    zorvane::List list;
    for (const std::string& text : texts)
        list.push_back({text});
    map[key] = {std::move(list)};
}

std::string registering(const std::string& identifier) {
    return "register " + identifier;
}

int answer(const zorvane::Result<void>& result, const Output& output, const std::string& identifier, const char* verb) {
    if (!result)
        return output.error(result.error(), registering(identifier));
    if (output.isJson())
        output.json({{"identifier", identifier}, {verb, true}});
    else
        output.line(printable(identifier) + " " + verb);
    return exitDone;
}

} // namespace

int setEntitlements(const zorvane::ConnectOptions& connect, const Output& output, const Registration& registration) {
    const std::string what = registering(registration.identifier);
    zorvane::Map entitlements;
    if (!registration.file.empty()) {
        auto read = readFile(registration.file);
        if (!read)
            return output.localError(exitUsage, read.error(), "give a file with a JSON object of entitlements", what);
        entitlements = std::move(*read);
    }
    addStrings(entitlements, applicationGroupsKey, registration.applicationGroups);
    addStrings(entitlements, systemGroupsKey, registration.systemGroups);
    if (registration.systemContainer)
        entitlements[systemContainerKey] = {true};
    if (entitlements.empty())
        return output.localError(exitUsage, "no entitlements given",
                                 "give some; to remove what is registered, use 'entitlements clear'", what);
    auto client = zorvane::Client::connect(connect);
    if (!client)
        return output.error(client.error(), what);
    return answer(client->processEntitlements({.identifier = registration.identifier,
                                               .entitlements = std::move(entitlements),
                                               .parentIdentifier = registration.parent,
                                               .placeholder = registration.placeholder}),
                  output, registration.identifier, "registered");
}

int showEntitlements(const zorvane::ConnectOptions& connect, const Output& output, const std::string& identifier) {
    const std::string what = "show the entitlements of " + identifier;
    const auto registered = RegisteredEntitlements::ask(connect);
    if (!registered)
        return output.error(registered.error(), what);
    const zorvane::Map* entitlements = registered->of(identifier);
    if (output.isJson()) {
        output.json({{"identifier", identifier},
                     {"registered", entitlements != nullptr},
                     {"entitlements", toJson({entitlements ? *entitlements : zorvane::Map()})},
                     {"children", registered->childrenOf(identifier)}});
        return exitDone;
    }
    output.line(printable(identifier) + (entitlements ? "" : ": nothing is registered"));
    for (const auto& [key, value] : entitlements ? *entitlements : zorvane::Map())
        output.tree(key, value, "  ");
    for (const std::string& child : registered->childrenOf(identifier))
        output.line("  child: " + printable(child));
    return exitDone;
}

int listEntitlements(const zorvane::ConnectOptions& connect, const Output& output) {
    const auto registered = RegisteredEntitlements::ask(connect);
    if (!registered)
        return output.error(registered.error(), "list what is registered");
    nlohmann::json list = nlohmann::json::array();
    std::vector<std::vector<std::string>> rows;
    for (const std::string& identifier : registered->identifiers()) {
        using Kind = RegisteredEntitlements::GroupKind;
        const std::size_t application = registered->groupsOf(identifier, Kind::application).size();
        const std::size_t system = registered->groupsOf(identifier, Kind::system).size();
        const bool systemContainer = registered->hasSystemContainer(identifier);
        const auto children = registered->childrenOf(identifier);
        list.push_back({{"identifier", identifier},
                        {"applicationGroups", application},
                        {"systemGroups", system},
                        {"systemContainer", systemContainer},
                        {"children", children}});
        rows.push_back({std::to_string(application), std::to_string(system), systemContainer ? "yes" : "no",
                        std::to_string(children.size()), printable(identifier)});
    }
    if (output.isJson())
        output.json({{"identifiers", std::move(list)}});
    else
        output.table({"APP GROUPS", "SYSTEM GROUPS", "SYSTEM CONTAINER", "CHILDREN", "IDENTIFIER"}, rows);
    return exitDone;
}

int clearEntitlements(const zorvane::ConnectOptions& connect, const Output& output, const std::string& identifier) {
    auto client = zorvane::Client::connect(connect);
    if (!client)
        return output.error(client.error(), "clear the entitlements of " + identifier);
    return answer(
        client->processEntitlements({.identifier = identifier, .entitlements = std::nullopt, .parentIdentifier = {}}),
        output, identifier, "cleared");
}

} // namespace zorvanectl
