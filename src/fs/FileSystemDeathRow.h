// SPDX-License-Identifier: Apache-2.0
// A death row of its own for each file system: where things wait for their removal that cannot be renamed to another
// file system, so that nothing has to be copied to get out of the way.
//
// It lies at the top of the mount, perhaps in a user's home: TOP/.zorvaned-dead/com.veltra.zorvaned.dead. The outer
// directory is root's and closed, so nobody else looks in, and nobody puts anything in. A user may rename it, or rename
// another closed directory of root's to its name. So its name says nothing: what is removed is only what lies in the
// inner directory, which can have come to be in a closed directory by the daemon alone. A row that was renamed away is
// lost, and the next move makes another.
//
// Beside the row, in TOP/.zorvaned-dead/com.veltra.zorvaned.aside, lies what is only out of the way for a moment and
// may come back: a container that is being replaced, and what was copied here to take its place. A launch clears it.
//
// A stop leaves one directory or both, empty, or with items; the next pass finds them by their place. "The daemon's" is
// the effective user's. Any thread.
#pragma once

#include "fs/PathResolver.h"
#include "platform/Errno.h"

#include <utility>

namespace zor::fs {

struct MountTop {
    FileURL url;
    FileDescriptor directory; // O_PATH
    /// Device and inode: two places have one row when they are the same.
    std::pair<dev_t, ino_t> identity;
};
/// The topmost directory of the mount that `url` lies on, from `url` up to the system root.
[[nodiscard]] ErrnoOr<MountTop> topOfMount(const PathResolver& resolver, const FileURL& url);

/// How the row is called in messages.
[[nodiscard]] FileURL deathRowBelow(const FileURL& top);
/// The same of the directory beside it.
[[nodiscard]] FileURL asideBelow(const FileURL& top);
/// The row in an open directory, for reading and for naming items in it. ENOENT: there is none; EPERM: something that
/// is not the daemon's has its name.
[[nodiscard]] OpenResult openDeathRow(int top);
[[nodiscard]] OpenResult openOrMakeDeathRow(platform::Disk& disk, int top);
[[nodiscard]] OpenResult openAside(int top);
[[nodiscard]] OpenResult openOrMakeAside(platform::Disk& disk, int top);
/// The directory beside the row that holds the item of that name, or an errno; judged as above.
[[nodiscard]] OpenResult openAsideOf(const PathResolver& resolver, const FileURL& item);
/// With the directory beside it; leaves what is not empty. The caller that moves an item in has to make sure that it is
/// not removed before.
void removeEmptyDeathRow(platform::Disk& disk, int top);

} // namespace zor::fs
