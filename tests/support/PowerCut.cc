// SPDX-License-Identifier: Apache-2.0
#include "support/PowerCut.h"

#include <algorithm>

namespace zor::support {

PowerCut::PowerCut(const DiskLog& log, const PowerCutOptions& options) : log_(log), options_(options) {
    std::map<std::pair<InodeId, std::string>, std::size_t> lastChange;
    for (std::size_t i = 0; i < log_.operations.size(); ++i) {
        const LoggedOperation& operation = log_.operations[i];
        startedFrom_.emplace_back();
        devices_.insert(operation.device);
        if (!operation.changesNames())
            continue;
        const auto take = [&](InodeId directory, const std::string& name) {
            const auto [last, isFirst] = lastChange.emplace(std::pair(directory, name), i);
            if (!isFirst)
                startedFrom_[i].push_back(std::exchange(last->second, i));
        };
        take(operation.directory, operation.name);
        if (operation.call == DiskCall::rename)
            take(operation.toDirectory, operation.toName);
    }
}

std::size_t PowerCut::committedPrefix(std::size_t done, dev_t device) const {
    std::size_t prefix = 0;
    for (std::size_t s = 0; s < done; ++s) {
        const LoggedOperation& operation = log_.operations[s];
        if (operation.device != device)
            continue;
        if (operation.call == DiskCall::syncFileSystem)
            prefix = s;
        if (operation.call != DiskCall::sync)
            continue;
        for (std::size_t i = s; i > prefix; --i) {
            if (log_.operations[i - 1].touches(operation.inode))
                prefix = i;
        }
    }
    return prefix;
}

std::vector<std::size_t> PowerCut::possiblePrefixes(std::size_t done, dev_t device) const {
    std::vector<std::size_t> prefixes = {committedPrefix(done, device)};
    for (std::size_t i = prefixes.front(); i < done; ++i) {
        const LoggedOperation& operation = log_.operations[i];
        const bool counts =
            operation.changesNames() || operation.changesInode() || operation.call == DiskCall::orderData;
        if (counts && operation.device == device)
            prefixes.push_back(i + 1);
    }
    return prefixes;
}

std::vector<PowerCut::Prefixes> PowerCut::prefixesToTry(std::size_t done, std::mt19937_64& random) const {
    std::map<dev_t, std::vector<std::size_t>> possible;
    Prefixes least;
    Prefixes most;
    for (const dev_t device : devices_) {
        possible[device] = possiblePrefixes(done, device);
        least[device] = possible[device].front();
        most[device] = possible[device].back();
    }
    std::vector<Prefixes> tried = {least, most};
    for (auto [device, prefixes] : possible) {
        std::shuffle(prefixes.begin(), prefixes.end(), random);
        prefixes.resize(std::min(prefixes.size(), options_.singleChangesMax));
        for (const std::size_t prefix : prefixes) {
            for (const Prefixes& others : {least, most}) {
                tried.push_back(others);
                tried.back()[device] = prefix;
            }
        }
    }
    for (std::size_t i = 0; i < options_.randomStatesPerCut; ++i) {
        tried.emplace_back();
        for (const auto& [device, prefixes] : possible)
            tried.back()[device] = prefixes[random() % prefixes.size()];
    }
    std::sort(tried.begin(), tried.end());
    tried.erase(std::unique(tried.begin(), tried.end()), tried.end());
    return tried;
}

bool PowerCut::isSynced(std::size_t index, std::size_t done) const {
    const LoggedOperation& operation = log_.operations[index];
    for (std::size_t s = index + 1; s < done; ++s) {
        const LoggedOperation& sync = log_.operations[s];
        if (sync.call == DiskCall::syncFileSystem && sync.device == operation.device)
            return true;
        const bool reaches = operation.changesNames()
                                 ? sync.inode == operation.directory || sync.inode == operation.toDirectory
                                 : sync.inode == operation.inode;
        if (sync.call == DiskCall::sync && reaches)
            return true;
    }
    return false;
}

bool PowerCut::dataIsOrdered(std::size_t write, std::size_t prefix) const {
    for (std::size_t s = write + 1; s < prefix; ++s) {
        const LoggedOperation& operation = log_.operations[s];
        if (operation.call == DiskCall::orderData && operation.inode == log_.operations[write].inode)
            return true;
    }
    return false;
}

void PowerCut::completeBackwards(std::vector<bool>& persisted) const {
    for (std::size_t i = persisted.size(); i-- > 0;) {
        if (!persisted[i])
            continue;
        for (const std::size_t earlier : startedFrom_[i])
            persisted[earlier] = true;
    }
}

void PowerCut::decide(Choice& choice, std::size_t write, DataFate fate, std::mt19937_64& random) const {
    const std::size_t length = random() % log_.operations[write].value.content.size();
    choice.data[write] = fate;
    choice.cutTo[write] = fate == DataFate::cut ? length : 0;
}

std::vector<PowerCut::Choice> PowerCut::orderedChoices(std::size_t done) const {
    std::mt19937_64 random(options_.seed * 1'000'003 + done);
    std::vector<Choice> choices;
    const auto choose = [&](const Prefixes& prefixes, const std::function<DataFate()>& fate) {
        Choice choice{std::vector<bool>(done), std::vector<DataFate>(done, DataFate::kept),
                      std::vector<std::size_t>(done)};
        for (std::size_t i = 0; i < done; ++i) {
            const std::size_t prefix = prefixes.at(log_.operations[i].device);
            choice.persisted[i] = i < prefix;
            if (!log_.operations[i].writes() || isSynced(i, done) || dataIsOrdered(i, prefix))
                continue;
            decide(choice, i, fate(), random);
        }
        choices.push_back(std::move(choice));
    };
    for (const Prefixes& prefixes : prefixesToTry(done, random)) {
        for (const DataFate fate : {DataFate::lost, DataFate::kept, DataFate::zeros, DataFate::cut})
            choose(prefixes, [&] { return fate; });
        choose(prefixes, [&] { return static_cast<DataFate>(random() % 4); });
    }
    return choices;
}

std::vector<PowerCut::Choice> PowerCut::unorderedChoices(std::size_t done) const {
    std::mt19937_64 random(options_.seed * 1'000'003 + done);
    std::vector<bool> certain(done);
    for (std::size_t i = 0; i < done; ++i)
        certain[i] = isSynced(i, done);
    completeBackwards(certain);
    std::vector<std::size_t> uncertain;
    for (std::size_t i = 0; i < done; ++i) {
        const LoggedOperation& operation = log_.operations[i];
        if (!certain[i] && (operation.changesNames() || operation.changesInode() || operation.writes()))
            uncertain.push_back(i);
    }
    std::vector<Choice> choices;
    const auto choose = [&](const std::function<bool(std::size_t)>& isThere,
                            const std::function<DataFate()>& lostFate) {
        Choice choice{certain, std::vector<DataFate>(done, DataFate::kept), std::vector<std::size_t>(done)};
        for (const std::size_t i : uncertain)
            choice.persisted[i] = isThere(i);
        completeBackwards(choice.persisted);
        for (const std::size_t i : uncertain) {
            if (log_.operations[i].writes() && !choice.persisted[i])
                decide(choice, i, lostFate(), random);
        }
        choices.push_back(std::move(choice));
    };
    const auto lost = [] { return DataFate::lost; };
    choose([](std::size_t) { return false; }, lost);
    choose([](std::size_t) { return true; }, lost);
    for (const bool names : {false, true})
        choose([&](std::size_t i) { return log_.operations[i].changesNames() == names; }, lost);
    for (const DataFate fate : {DataFate::lost, DataFate::zeros, DataFate::cut})
        choose([&](std::size_t i) { return !log_.operations[i].writes(); }, [&] { return fate; });
    // The latest ones are what the operation at hand did; of the earlier ones some have to do.
    std::vector<std::size_t> single(uncertain.rbegin(), uncertain.rend());
    if (single.size() > options_.singleChangesMax / 2)
        std::shuffle(single.begin() + options_.singleChangesMax / 2, single.end(), random);
    single.resize(std::min(single.size(), options_.singleChangesMax));
    for (const std::size_t one : single) {
        choose([&](std::size_t i) { return i != one; }, lost);
        choose([&](std::size_t i) { return i == one; }, lost);
    }
    for (std::size_t i = 0; i < options_.randomStatesPerCut; ++i)
        choose([&](std::size_t) { return random() % 2 == 0; }, [&] { return static_cast<DataFate>(random() % 4); });
    return choices;
}

PowerCutState PowerCut::build(const Choice& choice, std::size_t done) const {
    PowerCutState state{.tree = log_.start};
    state.marksPassed = static_cast<std::size_t>(
        std::count_if(log_.marks.begin(), log_.marks.end(), [&](std::size_t mark) { return mark <= done; }));
    // Every inode exists from the start; it is there when a persisted name reaches it.
    for (std::size_t i = 0; i < done; ++i) {
        if (log_.operations[i].makesInode())
            state.tree.inodes[log_.operations[i].inode] = log_.operations[i].value;
    }
    for (std::size_t i = 0; i < done; ++i) {
        LoggedOperation operation = log_.operations[i];
        const std::string label = " #" + std::to_string(i);
        if (operation.writes()) {
            Bytes& content = operation.value.content;
            const std::size_t kept[] = {0, content.size(), content.size(), choice.cutTo[i]};
            content.resize(kept[static_cast<std::size_t>(choice.data[i])]);
            if (choice.data[i] == DataFate::zeros)
                std::ranges::fill(content, std::uint8_t{0});
            if (choice.data[i] != DataFate::kept)
                state.description += label + (choice.data[i] == DataFate::zeros ? " zeros of " : " cut to ") +
                                     std::to_string(content.size()) + ";";
            if (choice.data[i] == DataFate::lost)
                continue;
        } else if (!choice.persisted[i]) {
            if (operation.changesNames() || operation.changesInode())
                state.description += label + " lost;";
            continue;
        }
        apply(operation, state.tree);
    }
    return state;
}

std::vector<PowerCutState> PowerCut::statesAfter(std::size_t done) const {
    std::vector<PowerCutState> states;
    std::set<Choice> tried;
    std::set<std::string> seen;
    const bool ordered = options_.model == DiskModel::orderedJournal;
    for (const Choice& choice : ordered ? orderedChoices(done) : unorderedChoices(done)) {
        if (!tried.insert(choice).second)
            continue;
        PowerCutState state = build(choice, done);
        // Directories moved around each other may come out of a choice in a way that no file system leaves them in.
        if (state.tree.isTree() && seen.insert(state.tree.describe()).second)
            states.push_back(std::move(state));
    }
    return states;
}

LoopReport forEachPowerCut(const DiskLog& log, const PowerCutOptions& options,
                           const std::function<std::string(const PowerCutState&, const std::string&)>& judge) {
    const PowerCut cut(log, options);
    LoopReport report;
    std::set<std::pair<std::string, std::size_t>> judged;
    for (std::size_t done = options.firstCut; done <= log.operations.size(); ++done) {
        for (const PowerCutState& state : cut.statesAfter(done)) {
            if (!judged.emplace(state.tree.describe(), state.marksPassed).second)
                continue;
            const TemporaryDirectory directory;
            materialise(state.tree, directory.path());
            ++report.examined;
            const std::string complaint = judge(state, directory.path());
            if (complaint.empty())
                continue;
            report.complaint = options.model == DiskModel::unordered ? "unordered" : "ordered journal";
            report.complaint +=
                ", seed " + std::to_string(options.seed) + ", with" + state.description + " " + complaint;
            for (std::size_t i = 0; i < done; ++i)
                report.complaint += "\n  #" + std::to_string(i) + " " + log.operations[i].describe();
            return report;
        }
    }
    return report;
}

} // namespace zor::support
