// SPDX-License-Identifier: Apache-2.0
// Disks as a power cut may leave them, built from a log of disk operations. Each file system of the tree keeps its
// own order and knows nothing of the others'.
//
// orderedJournal (ext4 with data=ordered, XFS): changes of names, modes, owners and attributes become durable in their
// order, so a cut leaves the first so many of them: at least up to the last change of an inode that was synced since,
// at least all before a sync of the file system. Data of a file is there for certain when the file was synced, or when
// it was ordered out and the persisted changes go beyond that point. Data that is not certain may be there, be gone, be
// cut short or be zeros, even below a name that is there.
//
// unordered (anything that keeps to POSIX, btrfs): a name is certain only when a directory of it was synced since, an
// inode's mode, owner, attributes and data only when that inode was; a sync of the file system settles all. Each other
// change may be there or not, for itself. A rename happens whole or not at all, and what a change of a name started
// from came before it. Ordering data out promises nothing.
//
// Neither makes more certain than the file systems do; an fsync of an inode that did not change since commits nothing.
// States come from the extremes, from each single change lost or kept alone, and from a seeded choice: the same log and
// options give the same states.
#pragma once

#include "support/RecordingDisk.h"

#include <compare>
#include <random>

namespace zor::support {

enum class DiskModel { orderedJournal, unordered };

struct PowerCutOptions {
    DiskModel model = DiskModel::orderedJournal;
    std::uint64_t seed = 1;
    std::size_t randomStatesPerCut = 8;
    /// More uncertain changes than this are not lost or kept one by one at a cut; the seeded choice has to do.
    std::size_t singleChangesMax = 24;
    /// No cut before so many operations: what a test has only to prepare.
    std::size_t firstCut = 0;
};

struct PowerCutState {
    FileTree tree;
    /// How many marks of the log lie before the cut.
    std::size_t marksPassed = 0;
    /// Which of the uncertain changes are there, in words.
    std::string description;
};

class PowerCut {
public:
    PowerCut(const DiskLog& log, const PowerCutOptions& options);
    /// The states that a cut after the first `done` operations may leave, without doubles.
    [[nodiscard]] std::vector<PowerCutState> statesAfter(std::size_t done) const;

private:
    enum class DataFate { lost, kept, zeros, cut };
    /// For each operation before the cut whether it is there; of a write its fate and, when cut, its length.
    struct Choice {
        std::vector<bool> persisted;
        std::vector<DataFate> data;
        std::vector<std::size_t> cutTo;
        auto operator<=>(const Choice&) const = default;
    };

    /// For each file system, before which operation of the log its changes are there.
    using Prefixes = std::map<dev_t, std::size_t>;

    void decide(Choice& choice, std::size_t write, DataFate fate, std::mt19937_64& random) const;
    [[nodiscard]] std::vector<Choice> orderedChoices(std::size_t done) const;
    [[nodiscard]] std::vector<Choice> unorderedChoices(std::size_t done) const;
    [[nodiscard]] std::size_t committedPrefix(std::size_t done, dev_t device) const;
    /// Every prefix that a cut may leave of a file system, ascending.
    [[nodiscard]] std::vector<std::size_t> possiblePrefixes(std::size_t done, dev_t device) const;
    [[nodiscard]] std::vector<Prefixes> prefixesToTry(std::size_t done, std::mt19937_64& random) const;
    /// Whether an operation after it and before `done` syncs what it changed.
    [[nodiscard]] bool isSynced(std::size_t operation, std::size_t done) const;
    [[nodiscard]] bool dataIsOrdered(std::size_t write, std::size_t prefix) const;
    /// Adds what each chosen operation started from.
    void completeBackwards(std::vector<bool>& persisted) const;
    [[nodiscard]] PowerCutState build(const Choice& choice, std::size_t done) const;

    const DiskLog& log_;
    const PowerCutOptions options_;
    /// For each operation on names the earlier ones that last changed the same names.
    std::vector<std::vector<std::size_t>> startedFrom_;
    std::set<dev_t> devices_;
};

/// Judges every state after every operation of the log, each in a new directory (given to `judge`, which may change it)
/// and no two equal states with as many marks twice. Ends at the first complaint, to which it adds model, seed, cut and
/// the log so far.
LoopReport forEachPowerCut(const DiskLog& log, const PowerCutOptions& options,
                           const std::function<std::string(const PowerCutState&, const std::string&)>& judge);

} // namespace zor::support
