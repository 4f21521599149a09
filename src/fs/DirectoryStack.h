// SPDX-License-Identifier: Apache-2.0
// The directories from the root of a walk down to where it is, with a bounded number of them open.
//
// Invariants: the root and the deepest level are open; of the others, levels are closed only when more than openMax
// levels below them were entered. Every level remembers its inode number, its name, and how far it was read. A level
// that was closed is opened again only as the same inode of the same file system: by ".." of the level below it, else
// by names from the root. So nobody who moves directories about can make a walk go on in a directory it did not come
// from.
//
// Memory grows with the length of the path. One thread.
#pragma once

#include "fs/BulkDirectoryRead.h"
#include "os/FileDescriptor.h"

#include <array>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <sys/types.h>
#include <vector>

namespace zor::fs {

class DirectoryStack {
public:
    static constexpr std::size_t openMax = 24;

    /// The number of levels; the root is one of them.
    [[nodiscard]] std::size_t depth() const { return levels_.size(); }
    [[nodiscard]] bool empty() const { return levels_.empty(); }

    /// Enters a directory. `name` of the root is not kept.
    void push(platform::FileDescriptor directory, dev_t device, ino_t inode, std::string_view name);
    /// Leaves the deepest level; ensureParent() must have said true unless it is the root.
    void pop();
    void clear();

    /// Opens the level above the deepest one again if it was closed. False: it is not where it was; then `levelsLost`
    /// levels cannot be reached any more and have been left, the deepest one among them, and the stack ends in
    /// a level that is open and verified.
    bool ensureParent(std::size_t& levelsLost);

    [[nodiscard]] int top() const { return descriptor(levels_.size() - 1); }
    [[nodiscard]] int root() const { return descriptor(0); }
    /// The level above the deepest one; only after ensureParent() said true.
    [[nodiscard]] int parent() const { return descriptor(levels_.size() - 2); }

    /// The entries of the deepest level, going on where they were left.
    BulkDirectoryRead& reader();
    /// Reads the deepest level from its beginning once more.
    void rewind();
    /// How often the deepest level was begun to be read.
    [[nodiscard]] unsigned pass() const { return levels_.back().pass; }
    /// Counts the entries of the deepest level from 0, in each pass anew.
    std::uint64_t nextIndex() { return levels_.back().entries++; }

    /// Name of the deepest level; empty for the root.
    [[nodiscard]] std::string name() const { return std::string(nameOf(levels_.size() - 1)); }
    /// Path of the deepest level relative to the root, "" for the root itself.
    [[nodiscard]] const std::string& path() const { return path_; }
    [[nodiscard]] dev_t device() const { return device_; }

private:
    struct Level {
        ino_t inode = 0;
        /// The place at which reading goes on when the level is opened again.
        off_t resume = 0;
        /// Length of the path up to and with this level's name.
        std::size_t pathBytes = 0;
        std::uint64_t entries = 0;
        unsigned pass = 1;
    };
    struct Slot {
        platform::FileDescriptor directory;
        std::size_t level = 0;
        std::unique_ptr<BulkDirectoryRead::Buffer> buffer;
        std::optional<BulkDirectoryRead> reader;
    };

    [[nodiscard]] static std::size_t slotOf(std::size_t level) { return level == 0 ? 0 : 1 + (level - 1) % openMax; }
    /// -1 while the level is closed.
    [[nodiscard]] int descriptor(std::size_t level) const;
    [[nodiscard]] std::string_view nameOf(std::size_t level) const;
    [[nodiscard]] bool isLevel(int directory, std::size_t level) const;
    void install(std::size_t level, platform::FileDescriptor directory);
    void truncate(std::size_t levels);
    /// Opens levels 1 to `last` by their names; the number of levels, the root included, that are where they were.
    std::size_t reopenFromRoot(std::size_t last);

    dev_t device_ = 0;
    std::vector<Level> levels_;
    std::string path_;
    /// The root's, and one for each level modulo openMax.
    std::array<Slot, openMax + 1> slots_;
};

} // namespace zor::fs
