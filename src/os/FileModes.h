// SPDX-License-Identifier: Apache-2.0
// Modes that directories and files of the daemon have wherever they are made, and the unit of a file's blocks.
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

namespace zor::platform {

/// Nobody but the owner enters: a directory while it is being made, and one that no user is to see.
inline constexpr mode_t closedMode = S_IRWXU;
/// The bits that chmod(2) sets.
inline constexpr mode_t permissionBits = S_ISUID | S_ISGID | S_ISVTX | ACCESSPERMS;
/// `st_blocks` of stat(2) counts these, on every file system.
inline constexpr off_t blockBytes = S_BLKSIZE;

} // namespace zor::platform
