// SPDX-License-Identifier: Apache-2.0
// Walking over what a directory holds: the entries of one, and every item of a tree. The trees belong to others, who
// change them meanwhile.
#pragma once

#include "os/FileDescriptor.h"
#include "platform/Errno.h"

#include <array>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <sys/stat.h>
#include <sys/types.h>
#include <unordered_map>
#include <vector>

namespace zor::fs {

// The entries of an open directory, as many at a time as fit a caller's buffer (getdents64).
//
// "." and ".." are left out. A directory that was removed meanwhile has no entries; that is no error. Entries that
// others add or remove while it is read may be seen or not; every other entry is seen exactly once. The descriptor and
// the buffer belong to the caller and have to outlive the reader. One thread at a time.

class BulkDirectoryRead {
public:
    static constexpr std::size_t bufferBytes = 32768;
    using Buffer = std::array<std::byte, bufferBytes>;

    struct Entry {
        /// NUL-terminated, one component; valid until the call of next() after the one that gave it.
        const char* name = nullptr;
        std::size_t nameBytes = 0;
        ino_t inode = 0;
        /// A DT_ value of <dirent.h>; DT_UNKNOWN where the file system does not say.
        unsigned char type = 0;
    };

    /// Reads on from the descriptor's offset. The buffer holds at least one entry of any name: 512 bytes or more.
    BulkDirectoryRead(int directory, std::span<std::byte> buffer);

    /// The next entry, or nullptr at the end and after an error.
    const Entry* next();
    /// The error of the read that ended the entries.
    [[nodiscard]] Errno error() const { return error_; }
    /// The place at which the entry after the last one given begins. Good for seek(), on this or another descriptor of
    /// the same directory.
    [[nodiscard]] off_t position() const { return position_; }
    /// Goes on at a position; 0 is the beginning.
    Errno seek(off_t position);

private:
    bool fill();

    int directory_;
    std::span<std::byte> buffer_;
    std::size_t filled_ = 0;
    std::size_t used_ = 0;
    off_t position_ = 0;
    Errno error_;
    Entry entry_;
};

// A directory that was made where others may write: they can put another in its place before it is opened.

/// Whether the open directory can be the one that this process just made: its own, closed to others, and empty.
[[nodiscard]] bool isFreshDirectory(int directory);

// The directories from the root of a walk down to where it is, with a bounded number of them open.
//
// Invariants: the root and the deepest level are open; of the others, levels are closed only when more than openMax
// levels below them were entered. Every level remembers its inode number, its name, and how far it was read. A level
// that was closed is opened again only as the same inode of the same file system: by ".." of the level below it, else
// by names from the root. So nobody who moves directories about can make a walk go on in a directory it did not come
// from.
//
// Memory grows with the length of the path. One thread.

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

// Visits every item of a tree, the root first, without following links and without leaving the root's file system.
//
// The trees belong to others, who change them while they are walked. So every step starts from a directory that is
// open; a name that is gone when its turn comes counts as never having been there; a name that became something else is
// visited as what it is now. A directory is visited before and after its content. A mount point, or a subvolume, is
// visited before and after but not entered, and nothing of what lies on it is asked; that holds for the root of the
// walk too, unless it is ".". A mount on a file is shown as the file where only types are wanted.
//
// Any depth and any width: fewer than DirectoryStack::openMax + 8 descriptors, no recursion, and memory that grows with
// the length of the current path alone. A directory whose descriptor had to be closed is found again by ".." and must
// be the same inode as before; else by its names from the root, each of them checked; else it counts as vanished, with
// what was not yet visited in it.
//
// The visitor may remove, rename and change items. One walk at a time for an object, in one thread.

enum class WalkEntryKind {
    directory,           ///< before its content
    directoryEnd,        ///< after its content
    unreadableDirectory, ///< in place of directoryEnd: it could not be opened or read to its end; `error` says why
    file,
    symbolicLink,
    other,   ///< FIFO, socket, device
    noStatus ///< could not be examined; `error` says why
};

struct WalkEntry {
    WalkEntryKind kind = WalkEntryKind::noStatus;
    /// The open directory that holds the entry. All descriptors belong to the walker and are good for this call only.
    int parent = -1;
    /// One component. A caller that acts on it must be ready to find something else there by now.
    const char* name = nullptr;
    /// For a directory that could be opened: the directory itself. Else -1.
    int directory = -1;
    /// The item's own, never that of a link's target. With WalkStatus::typeOnly, and on other file systems, only the
    /// type in st_mode and st_ino mean something.
    struct stat status{};
    Errno error;
    /// Lies on another file system than the root: leave it alone.
    bool onOtherFileSystem = false;
    /// 0 for the root.
    std::size_t depth = 0;
    /// Counts the entries of the directory that holds the entry, from 0 in each pass. Not for directoryEnd.
    std::uint64_t index = 0;
    /// How often this directory was read before this end of it: 1, and one more after each WalkStep::again.
    unsigned pass = 0;

    /// Relative to the root of the walk; empty for the root. Made on demand.
    [[nodiscard]] std::string path() const;

    const DirectoryStack* stack = nullptr;
};

enum class WalkStep {
    proceed,
    skip,  ///< answer to `directory`: do not enter; its end follows at once
    again, ///< answer to `directoryEnd`: read this directory once more from the beginning
    stop
};

enum class WalkStatus { full, typeOnly };

class TreeWalker {
public:
    using Visitor = std::function<WalkStep(const WalkEntry&)>;

    explicit TreeWalker(WalkStatus status = WalkStatus::full) : statusWanted_(status) {}

    /// Walks from the entry `name` (one component, or "." for `parent` itself) of the open directory `parent`.
    /// ECANCELED when the visitor stopped it; another error when the root could not be examined (no visit).
    Errno walk(int parent, const char* name, const Visitor& visitor);

    /// How many directories of the last walk were moved or replaced so that they could not be finished. Those had no
    /// end visit.
    [[nodiscard]] std::size_t vanishedDirectories() const { return vanishedDirectories_; }

private:
    WalkStep visitRoot();
    WalkStep visitName(WalkEntry entry, unsigned char type);
    WalkStep visitDirectory(WalkEntry& entry, platform::FileDescriptor directory);
    WalkStep visitUnopened(WalkEntry& entry, Errno error);
    WalkStep visitMountPoint(WalkEntry& entry);
    WalkStep visitNonDirectory(WalkEntry& entry);
    WalkStep finishDirectory();
    [[nodiscard]] bool atRoot() const { return stack_.empty(); }

    WalkStatus statusWanted_;
    const Visitor* visitor_ = nullptr;
    int rootParent_ = -1;
    std::string rootName_;
    dev_t device_ = 0;
    /// Why the root could not be examined.
    Errno rootError_;
    std::size_t vanishedDirectories_ = 0;
    DirectoryStack stack_;
};

// Tells, in one walk of a tree, whether a file that has several names has one outside: when all its names have been
// met, it has none.
//
// Meetings are counted. A user who can rename in the tree during the walk can have one name met twice, so the caller
// sees to it that nobody can, or that nobody gains by it. Memory grows with the files of which names are still to come.

class NamesMet {
public:
    /// Counts one name of a file, of which `status` is fresh: whether it was the last.
    [[nodiscard]] bool wasLast(const struct stat& status) {
        if (status.st_nlink <= 1)
            return true;
        const auto met = met_.try_emplace(status.st_ino, 0).first;
        if (++met->second < status.st_nlink)
            return false;
        met_.erase(met);
        return true;
    }
    /// Files of which a name has been met and another has not.
    [[nodiscard]] std::size_t unfinished() const { return met_.size(); }
    void forgetAll() { met_.clear(); }

private:
    std::unordered_map<ino_t, nlink_t> met_;
};

} // namespace zor::fs
