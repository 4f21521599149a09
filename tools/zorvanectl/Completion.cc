// SPDX-License-Identifier: Apache-2.0
#include "Completion.h"

#include "CommandWalk.h"
#include "ContainerLists.h"
#include "Explain.h"
#include "RegisteredEntitlements.h"
#include "Users.h"
#include "zorvane/Text.h"

#include <algorithm>
#include <cstdio>
#include <set>

namespace zorvanectl {

namespace {

/// Somebody waits at a keyboard.
constexpr std::uint32_t askMillisecondsMax = 500;

struct Candidate {
    std::string word;
    std::string meaning;
};
using Candidates = std::vector<Candidate>;

std::string valueOf(const Place& place, const std::string& option, const std::string& otherwise) {
    const auto found = place.values.find(option);
    return found == place.values.end() ? otherwise : found->second;
}

zorvane::ConnectOptions connectionFor(const Place& place) {
    return {.root = valueOf(place, "root", "/"), .timeoutMilliseconds = askMillisecondsMax};
}

Candidates classes() {
    Candidates candidates;
    for (std::uint64_t number = 1; number <= zorvane::containerClassMax; ++number)
        candidates.push_back({std::string(zorvane::containerClassName(number)), "class " + std::to_string(number)});
    return candidates;
}

Candidates users(const Place& place) {
    Candidates candidates = {{"current", "the current mobile user"}};
    const std::string root = valueOf(place, "root", "/");
    std::set<std::uint32_t> seen;
    for (std::uint64_t number = 1; number <= zorvane::containerClassMax; ++number)
        for (const NamedUser& user : ownersOfClass(root, number))
            if (seen.insert(user.number).second)
                candidates.push_back({user.name.empty() ? std::to_string(user.number) : user.name,
                                      "user " + std::to_string(user.number)});
    return candidates;
}

Candidates registered(const Place& place) {
    Candidates candidates;
    if (const auto entitlements = RegisteredEntitlements::ask(connectionFor(place)))
        for (const std::string& identifier : entitlements->identifiers())
            candidates.push_back({identifier, "registered"});
    return candidates;
}

Candidates containers(const Place& place) {
    const zorvane::ConnectOptions connect = connectionFor(place);
    const auto containerClass = zorvane::containerClassOf(valueOf(place, "class", ""));
    const std::string user = valueOf(place, "user", "");
    Target target{.containerClass = containerClass.value_or(0), .user = {}, .identifier = {}, .transient = false};
    if (const auto number = userNumber(connect.root, user); !user.empty() && number)
        target.user = *number;
    auto client = zorvane::Client::connect(connect);
    Candidates candidates;
    if (!client)
        return candidates;
    const Listing listing{.all = !containerClass};
    if (const auto found = findContainers(*client, connect.root, target, listing))
        for (const FoundContainer& container : found->containers)
            candidates.push_back({container.address.identifier,
                                  std::string(zorvane::containerClassName(container.address.containerClass))});
    return candidates;
}

Candidates identifiers(const Place& place) {
    const CLI::App* above = place.command->get_parent();
    const std::string& name = place.command->get_name();
    const bool isAboutEntitlements = (above && above->get_name() == "entitlements") || name == "why" ||
                                     name == "groups" || name == "system-path" || name == "system-group-path";
    return isAboutEntitlements ? registered(place) : containers(place);
}

Candidates groups(const Place& place) {
    Candidates candidates;
    if (const auto entitlements = RegisteredEntitlements::ask(connectionFor(place)))
        for (const auto& [kind, name] : RegisteredEntitlements::groupKinds)
            for (const RegisteredEntitlements::Group& group : entitlements->groups(kind))
                candidates.push_back({group.identifier, std::string(name) + " group"});
    return candidates;
}

Candidates commands(const CLI::App& command) {
    Candidates candidates;
    for (const CLI::App* subcommand : subcommandsOf(command))
        candidates.push_back({subcommand->get_name(), subcommand->get_description()});
    return candidates;
}

Candidates codes() {
    Candidates candidates;
    for (const auto& [code, meaning] : explainedCodes())
        candidates.push_back({code, meaning});
    return candidates;
}

Candidates valuesFor(const CLI::App& app, const Place& place, const CLI::Option& option) {
    const std::string name = nameOf(option);
    if (name == "class")
        return classes();
    if (name == "user")
        return users(place);
    if (name == "identifier" || name == "identifiers" || name == "parent")
        return identifiers(place);
    if (name == "group" || name == "app-group" || name == "system-group")
        return groups(place);
    if (name == "code")
        return codes();
    if (name == "command")
        return commands(app);
    if (name == "progress")
        return {{"bar", ""}, {"json", ""}, {"none", ""}};
    if (name == "sort")
        return {{"class", ""}, {"identifier", ""}, {"user", ""}, {"size", ""}};
    if (name == "state")
        return {{"0", "unlocked"}, {"1", "locked"}};
    if (name == "protection-class")
        return {{"0", "none"}, {"1", "only while unlocked"}, {"3", "from the first unlock"}};
    return {};
}

Candidates candidatesAt(const CLI::App& app, const Place& place, const std::string& typed) {
    if (place.mistake)
        return {};
    if (place.awaiting)
        return valuesFor(app, place, *place.awaiting);
    if (typed.starts_with('-') && !place.optionsHaveEnded) {
        Candidates candidates;
        for (const CLI::Option* option : optionsOf(*place.command))
            candidates.push_back({"--" + nameOf(*option), option->get_description()});
        return candidates;
    }
    if (!subcommandsOf(*place.command).empty())
        return commands(*place.command);
    const CLI::Option* next = nextPositional(place);
    return next ? valuesFor(app, place, *next) : Candidates();
}

bool isPlain(const std::string& word) {
    return !word.empty() && std::ranges::all_of(word, [](char character) {
        return (character >= '0' && character <= '9') || (character >= 'a' && character <= 'z') ||
               (character >= 'A' && character <= 'Z') || std::string_view("._-/+").contains(character);
    });
}

} // namespace

int complete(const CLI::App& app, std::span<const std::string> words) {
    const std::string typed = words.empty() ? "" : words.back();
    const Place place = placeAfter(app, words.first(words.empty() ? 0 : words.size() - 1));
    for (const auto& [word, meaning] : candidatesAt(app, place, typed))
        if (word.starts_with(typed) && isPlain(word))
            std::printf("%s\t%s\n", word.c_str(), zorvane::printable(meaning).c_str());
    return 0;
}

} // namespace zorvanectl
