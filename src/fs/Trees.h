// SPDX-License-Identifier: Apache-2.0
// The things that are done to a whole tree: it is copied, removed, measured. Trees belong to others, who change them
// meanwhile; each function says what that does to it.
#pragma once

#include "fs/TreeWalker.h"
#include "platform/Disk.h"
#include "platform/Errno.h"

#include <chrono>
#include <cstdint>
#include <functional>
#include <string>
#include <string_view>
#include <sys/stat.h>
#include <sys/types.h>
#include <utility>
#include <vector>

namespace zor::fs {

// Gives a copied file or directory what the source has besides its data: extended attributes, owner and group, mode,
// access control lists, times, in an order in which none undoes another. One thread.

class CopyAttributes {
public:
    explicit CopyAttributes(platform::Disk& disk);

    /// Both are open files or directories; `status` is of `from`, `mode` what the copy gets.
    Errno copy(int from, int to, const struct stat& status, mode_t mode);
    /// Owner, group, mode and times alone.
    Errno giveBasic(int to, const struct stat& status, mode_t mode);
    /// A new directory takes over the default access control list of the one it is made in, and its content would in
    /// turn.
    Errno dropInheritedDefaultAcl(int directory);

private:
    /// The names of the attributes of `file`, each followed by a NUL.
    Errno list(int file);
    Errno copyAttribute(int from, int to, const char* name);
    Errno dropInheritedAcl(int from, int to, mode_t mode);
    [[nodiscard]] bool skips(std::string_view name) const;
    [[nodiscard]] bool mayLack(std::string_view name, Errno error) const;

    platform::Disk& disk_;
    const bool isRoot_;
    std::vector<char> names_;
    std::vector<std::uint8_t> value_;
};

// Copies the data of regular files: shared where the file system can, else copied by the kernel, else read and written.
// Holes stay holes. Remembers what this pair of file systems refused. One thread.

class CopyData {
public:
    /// Told of each piece that was copied; an error ends the copy.
    using Copied = std::function<Errno(std::uint64_t bytes)>;
    explicit CopyData(platform::Disk& disk, Copied copied = {}) : disk_(disk), copied_(std::move(copied)) {}

    /// Both files are open at their beginning, `to` is new. `status` is of `from`: not more than its size is copied,
    /// however fast the file grows; where the data is shared, the whole file is.
    Errno copy(int from, int to, const struct stat& status);

private:
    Errno copyRuns(int from, int to, off_t size);
    /// The bytes copied, fewer at the end of the file.
    ErrnoOr<off_t> copyRun(int from, int to, off_t bytes);
    Errno extend(int from, int to, off_t size);
    Errno tell(off_t bytes) const { return copied_ ? copied_(static_cast<std::uint64_t>(bytes)) : Errno(); }

    platform::Disk& disk_;
    const Copied copied_;
    bool cloneRefused_ = false;
    bool kernelCopyRefused_ = false;
    std::vector<std::uint8_t> buffer_;
};

// Copies an item and, when it is a directory, everything below it, to a name that does not exist yet.
//
// Kept: data (shared with the source where the file system can), holes, mode, owner and group, access and modification
// time, access control lists, extended attributes, symbolic links as links, FIFOs, hard links between files of the
// tree. Not kept, on purpose:
//   - set-user-ID and set-group-ID of files, and file capabilities: a copy must not bring a power to life a second time
//     (directories keep set-group-ID, which only says who inherits the group).
//   - sockets: their names mean nothing without the process that made them. They are skipped.
//   - inode flags; attributes of links and FIFOs; attributes that the destination's file system does not have.
//   - ownership and security labels when not run as root, as far as the kernel refuses them.
// Refused, failing the copy: device nodes (EPERM) and anything that lies on another file system than the source's root
// (EXDEV).
//
// The source belongs to others, who change it meanwhile: see fs/TreeWalker.h. Names that vanish are left out; a
// directory that is moved away while it is copied fails the copy (ESTALE). A file is copied up to the size it had when
// it was opened. The destination is closed to others (mode 0700, the daemon's own) until its content is complete; its
// root gets its mode and owner last.
//
// The first error ends the copy and is what is returned; what was made until then stays under the destination's name,
// for the caller to remove. So the caller copies to a hidden name, syncs (nothing is synced here), then renames. Any
// thread.

/// EEXIST when the destination exists, ENOENT when the source does not. `goOn` is asked often; with the answer false
/// the copy ends with ECANCELED.
Errno copyTree(platform::Disk& disk, int fromDirectory, const char* from, int toDirectory, const char* to,
               const std::function<bool()>& goOn = {});

/// How the content of a directory is copied to become somebody's: whose, and what may come along.
struct ContentRules {
    uid_t owner = 0;
    gid_t group = 0;
    /// Asked about each item before it is copied, with the status of what will be: `item` is the open file or
    /// directory, -1 for all else and where none could be opened. A symbolic link comes with its target. An error ends
    /// the copy.
    std::function<Errno(const WalkEntry& entry, int item, const char* linkTarget)> admit;
    /// Told of each piece of a file that was copied; the same.
    std::function<Errno(std::uint64_t bytes)> copied;
    /// Told of the item at which the copy ended.
    std::function<void(const WalkEntry& entry, Errno error)> failed;
};

/// Copies everything below the open directory `from` into the open directory `to`, which is empty and closed to others,
/// and stays so. As copyTree, but owner and group are those of the rules, no attributes and access control lists come
/// along, of modes no more than the bits for access, and a directory's owner may always use it. All of `rules` is
/// required.
Errno copyContent(platform::Disk& disk, int from, int to, const ContentRules& rules);

// Removes an item and, when it is a directory, everything below it.
//
// Works inside trees that others own and change meanwhile: links are removed, never followed; what lies on another file
// system is left (its mount point then cannot be removed: EBUSY); a name that is gone is as good as removed; names that
// are added meanwhile are removed too, within a limit. Any depth and width, see fs/TreeWalker.h. Nothing outside the
// tree is touched: the directory that holds the root only loses the root's name.
//
// A second thread helps with a tree of many directories, unless `goOn` is asked: see RecursiveRemove.cc.
//
// An interruption leaves a smaller tree under the root's name. Nothing is synced. Any thread.

struct RemoveFailure {
    /// Relative to the root of the removal; empty for the root itself. For messages.
    std::string path;
    /// Why `name` of the open directory `parent` cannot be removed.
    Errno error;
    int parent = -1;
    const char* name = nullptr;
};

struct RemoveCallbacks {
    /// Called for every item that cannot be removed, directories that stay because something in them stayed included.
    /// It may repair and remove the item itself: what holds it is then removed as if nothing had happened. Required.
    std::function<void(const RemoveFailure&)> failed;
    /// Told, with its path as above, of each directory below the root whose immutable or append-only flag was in the
    /// way and was cleared. Optional.
    std::function<void(const std::string& path)> directoryMadeMutable;
    /// Asked with the root's open directory, before anything in it is touched; with the answer false nothing is, and
    /// the removal ends with ESTALE. Optional.
    std::function<bool(int directory)> isMeant;
    /// Asked before each item; with the answer false the removal ends with ECANCELED. Optional.
    std::function<bool()> goOn;
};

/// No error when everything was removed or told to `failed`; ENOENT when there is no such item; another one when the
/// root could not be examined.
Errno removeTree(platform::Disk& disk, int directory, const char* name, const RemoveCallbacks& callbacks);

/// Removes what can be removed. The first error that kept an item; `goOn` as above.
Errno removeTree(platform::Disk& disk, int directory, const char* name, const std::function<bool()>& goOn = {});

/// Clears the flags that keep an item from being removed, immutable and append-only, of a regular file or directory.
/// Whether one was set and is cleared: none is on anything that cannot have them, links among them.
[[nodiscard]] ErrnoOr<bool> clearImmutable(platform::Disk& disk, int directory, const char* name);

// Allocated bytes of every non-directory below a directory, each hard-linked file counted once.
//
// Breadth first, one bulk read buffer for each thread, no recursion; a second thread shares the directories of a large
// tree. The queue of directories is bounded; what does not fit it, and what lies deeper than a path can name, is
// measured depth first on the spot, so width and depth are bounded by nothing. The set of files seen grows only with
// files whose link count is not 1. Links are not followed and other file systems not entered. Never fails: what cannot
// be read adds nothing and is said in the log. Any thread, any number at once.

struct UsageLog {
    /// Called with level 3 or 7 and the message, by one thread at a time. May be empty.
    std::function<void(int level, const std::string& message)> write;
    /// Messages above this level are not even made.
    int levelMax = 3;
};

struct Usage {
    std::uint64_t bytes = 0;
    /// This process ran out of descriptors or memory meanwhile: some of the tree is not in it.
    bool cutShort = false;
    /// When the last of what was examined, directories too, was changed (ctime, which nobody can set).
    std::chrono::system_clock::time_point lastChange{};
};

/// `path` names the directory, open for reading, in messages and serves nothing else. Its offset is moved.
Usage diskUsage(int directory, const std::string& path, const UsageLog& log);

} // namespace zor::fs
