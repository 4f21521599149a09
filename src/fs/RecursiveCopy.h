// SPDX-License-Identifier: Apache-2.0
// Copies an item and, when it is a directory, everything below it, to a name that does not exist yet.
//
// Kept: data (shared with the source where the file system can), holes, mode, owner and group, access and modification
// time, access control lists, extended attributes, symbolic links as links, FIFOs, hard links between files of the
// tree. Not kept, on purpose:
//   - set-user-ID and set-group-ID of files, and file capabilities: a copy must not bring a power to life a second
//   time.
//     (Directories keep set-group-ID: there it only says who inherits the group.)
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
#pragma once

#include "fs/TreeWalker.h"
#include "platform/Disk.h"
#include "platform/Errno.h"

#include <cstdint>
#include <functional>
#include <sys/types.h>

namespace zor::fs {

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

} // namespace zor::fs
