// SPDX-License-Identifier: Apache-2.0
// The syncs that make a change survive a power cut, on the file system that it is made on.
//
// A new container is built in staging and becomes visible with one move. Two things must hold: when the move is on the
// disk, so is all that it moved; and when the client has its answer, the move is on the disk.
//
// - ext4 with an ordered journal, and XFS, commit changes of names and inodes in the order in which they were made.
// There
//   it is enough to write the new file's data out before the move (beforeMove), and to sync the destination directory
//   once after it (afterMove): that one sync commits everything before it. It runs outside the store's locks, and those
//   of concurrent creators share a commit.
// - Any other file system promises no such order, so the whole file system is synced before the move and after it.
//
// Which kind a directory lies on is asked once for each device. Any thread.
#pragma once

#include "base/Mutex.h"
#include "platform/Disk.h"
#include "platform/Errno.h"

#include <map>
#include <sys/types.h>

namespace zor::fs {

/// How a file system orders what is not synced.
enum class Ordering { journal, none };

/// Asks the kernel for the file system of an open file: its type, and for ext4 the mount's options.
[[nodiscard]] Ordering orderingOfFileSystem(int fd);

class Durability {
public:
    using Probe = Ordering (*)(int fd);
    explicit Durability(platform::Disk& disk, Probe probe = orderingOfFileSystem) : disk_(disk), probe_(probe) {}

    /// Before a tree of new directories and small new files is moved into view. `file` is a new file in the tree whose
    /// data counts.
    Errno beforeMove(int file) const;
    /// After things were moved to a directory to be removed there, before they are: else a cut could leave the removal
    /// and undo the move.
    Errno beforeRemoval(int directory) const;
    /// Between a change of names in one directory and one in another that must not be durable without it.
    Errno between(int changed, int next) const;
    /// Whether the file systems see to that themselves, so that `between` has nothing to wait for.
    [[nodiscard]] bool keepsOrder(int changed, int next) const;
    /// After the move, before it is acknowledged; needs no lock. `directory` is where the name came to be.
    Errno afterMove(int directory) const;
    /// The same for changes of names in two directories, which may lie on two file systems.
    Errno afterMoves(int directory, int other) const;

private:
    [[nodiscard]] Ordering ordering(int fd) const;

    platform::Disk& disk_;
    const Probe probe_;
    mutable platform::Mutex mutex_;
    mutable std::map<dev_t, Ordering> orderings_ ZOR_GUARDED_BY(mutex_);
};

} // namespace zor::fs
