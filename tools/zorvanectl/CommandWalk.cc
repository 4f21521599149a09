// SPDX-License-Identifier: Apache-2.0
#include "CommandWalk.h"

#include <algorithm>
#include <numeric>

namespace zorvanectl {

namespace {

/// Changes of single characters, and swaps of two beside each other, that make one word the other.
std::size_t distanceBetween(const std::string& from, const std::string& to) {
    std::vector<std::vector<std::size_t>> cost(from.size() + 1, std::vector<std::size_t>(to.size() + 1));
    for (std::size_t i = 0; i <= from.size(); ++i)
        for (std::size_t j = 0; j <= to.size(); ++j) {
            if (i == 0 || j == 0) {
                cost[i][j] = i + j;
                continue;
            }
            const bool same = from[i - 1] == to[j - 1];
            cost[i][j] = std::min({cost[i - 1][j] + 1, cost[i][j - 1] + 1, cost[i - 1][j - 1] + (same ? 0U : 1U)});
            if (i > 1 && j > 1 && from[i - 1] == to[j - 2] && from[i - 2] == to[j - 1])
                cost[i][j] = std::min(cost[i][j], cost[i - 2][j - 2] + 1);
        }
    return cost[from.size()][to.size()];
}

bool takesValue(const CLI::Option& option) {
    return option.get_items_expected_max() > 0;
}

std::string withDashes(const CLI::Option& option) {
    return option.get_lnames().empty() ? "-" + option.get_snames().front() : "--" + option.get_lnames().front();
}

const CLI::Option* optionNamed(const CLI::App& command, const std::string& name) {
    for (const CLI::Option* option : optionsOf(command))
        if (std::ranges::find(option->get_lnames(), name) != option->get_lnames().end() ||
            std::ranges::find(option->get_snames(), name) != option->get_snames().end())
            return option;
    return nullptr;
}

void takeValue(Place& place, const CLI::Option& option, const std::string& value) {
    place.values[nameOf(option)] = value;
    place.awaiting = nullptr;
}

void addUnknownOption(Place& place, const std::string& word) {
    std::vector<std::string> known;
    for (const CLI::Option* option : optionsOf(*place.command))
        known.push_back(withDashes(*option));
    place.mistake = "'" + fullNameOf(*place.command) + "' has no option '" + word + "'" + suggestion(word, known);
}

void takeLongOption(Place& place, const std::string& word) {
    const std::size_t equals = word.find('=');
    const CLI::Option* option = optionNamed(*place.command, word.substr(2, equals - 2));
    if (!option || (equals != std::string::npos && !takesValue(*option)))
        return addUnknownOption(place, word.substr(0, equals));
    if (equals != std::string::npos)
        takeValue(place, *option, word.substr(equals + 1));
    else if (takesValue(*option))
        place.awaiting = option;
}

/// "-y", "-yc", "-c2".
void takeShortOptions(Place& place, const std::string& word) {
    for (std::size_t i = 1; i < word.size(); ++i) {
        const CLI::Option* option = optionNamed(*place.command, word.substr(i, 1));
        if (!option)
            return addUnknownOption(place, "-" + word.substr(i, 1));
        if (!takesValue(*option))
            continue;
        if (i + 1 < word.size())
            takeValue(place, *option, word.substr(i + 1));
        else
            place.awaiting = option;
        return;
    }
}

void takeWord(Place& place, const std::string& word) {
    const auto subcommands = subcommandsOf(*place.command);
    const auto found = std::ranges::find(subcommands, word, [](const CLI::App* app) { return app->get_name(); });
    if (found != subcommands.end()) {
        place.command = *found;
        return;
    }
    if (!subcommands.empty()) {
        std::vector<std::string> known;
        for (const CLI::App* subcommand : subcommands)
            known.push_back(subcommand->get_name());
        place.mistake = "'" + fullNameOf(*place.command) + "' has no command '" + word + "'" + suggestion(word, known);
        return;
    }
    if (!nextPositional(place))
        place.mistake = "'" + fullNameOf(*place.command) + "' takes no further word, such as '" + word + "'";
    ++place.positionals;
}

} // namespace

std::string nameOf(const CLI::Option& option) {
    return option.get_positional() ? option.get_name(true) : option.get_lnames().front();
}

std::vector<const CLI::Option*> optionsOf(const CLI::App& command) {
    std::vector<const CLI::Option*> options;
    for (const CLI::App* app = &command; app; app = app->get_parent())
        for (const CLI::Option* option : app->get_options())
            if (!option->get_positional() && !option->get_lnames().empty())
                options.push_back(option);
    return options;
}

const CLI::Option* nextPositional(const Place& place) {
    std::size_t before = 0;
    for (const CLI::Option* option : place.command->get_options()) {
        if (!option->get_positional())
            continue;
        before += static_cast<std::size_t>(option->get_items_expected_max());
        if (place.positionals < before)
            return option;
    }
    return nullptr;
}

std::vector<const CLI::App*> subcommandsOf(const CLI::App& command) {
    return command.get_subcommands([](const CLI::App* app) { return !app->get_group().empty(); });
}

std::string fullNameOf(const CLI::App& command) {
    const CLI::App* above = command.get_parent();
    return above ? fullNameOf(*above) + " " + command.get_name() : command.get_name();
}

Place placeAfter(const CLI::App& app, std::span<const std::string> words) {
    Place place;
    place.command = &app;
    for (const std::string& word : words) {
        if (place.mistake)
            break;
        if (place.awaiting)
            takeValue(place, *place.awaiting, word);
        else if (place.optionsHaveEnded || word.size() < 2 || word[0] != '-')
            takeWord(place, word);
        else if (word == "--")
            place.optionsHaveEnded = true;
        else if (word[1] == '-')
            takeLongOption(place, word);
        else
            takeShortOptions(place, word);
    }
    return place;
}

std::string suggestion(const std::string& word, const std::vector<std::string>& known) {
    const std::string* nearest = nullptr;
    std::size_t least = std::max<std::size_t>(word.size() / 3, 2) + 1;
    for (const std::string& candidate : known) {
        // Its beginning alone may have been typed.
        const std::size_t distance =
            std::min(distanceBetween(word, candidate), distanceBetween(word, candidate.substr(0, word.size())) + 1);
        if (distance < least && distance < word.size()) {
            least = distance;
            nearest = &candidate;
        }
    }
    return nearest ? "; is '" + *nearest + "' meant?" : "";
}

} // namespace zorvanectl
