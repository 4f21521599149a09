// SPDX-License-Identifier: Apache-2.0
// Removes an item and, when it is a directory, everything below it.
//
// Works inside trees that others own and change meanwhile: links are removed, never followed; what lies on another file
// system is left (its mount point then cannot be removed: EBUSY); a name that is gone is as good as removed; names that
// are added meanwhile are removed too, within a limit. Any depth and width, see fs/TreeWalker.h. Nothing outside the
// tree is touched: the directory that holds the root only loses the root's name.
//
// One thread: a second one showed no gain, and would be one more way into a tree that its owner changes.
//
// An interruption leaves a smaller tree under the root's name. Nothing is synced. Any thread.
#pragma once

#include "platform/Disk.h"
#include "platform/Errno.h"

#include <functional>
#include <string>

namespace zor::fs {

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

} // namespace zor::fs
