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

#include "platform/Disk.h"

namespace zor::fs {

/// 0, or -errno. -EEXIST when the destination exists, -ENOENT when the source does not.
int copyTree(platform::Disk& disk, int fromDirectory, const char* from, int toDirectory, const char* to);

} // namespace zor::fs
