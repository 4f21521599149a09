// SPDX-License-Identifier: Apache-2.0
// Replacing a file in one step: the old content or the new one, whole, whenever somebody looks or the power goes.
//
// A temporary file (its name begins with ".") in the same directory is written and synced, renamed over the target, and
// the directory is synced. A stop before the rename leaves the temporary file, which no listing shows; the next write
// of the same target removes it. Any thread; writers of one target are serialised by their
// callers.
#pragma once

#include "platform/Disk.h"

#include <cstdint>
#include <functional>
#include <span>
#include <string>
#include <string_view>
#include <sys/types.h>

namespace zor::fs {

/// 0, or a negative errno with the target untouched (unless only the last directory sync failed).
/// `mode` is set whatever the process's mask; the file belongs to the daemon. `prepare` does more to the new file
/// before it is synced: 0 or a negative errno.
[[nodiscard]] int replaceFileDurably(platform::Disk& disk, int directory, const std::string& name, mode_t mode,
                                     std::span<const std::uint8_t> bytes,
                                     const std::function<int(int file)>& prepare = nullptr);

/// Whether a file of this name is what a write that was cut short left.
[[nodiscard]] bool isWriteLeftover(std::string_view name);

/// A new file with the content, not synced. Its descriptor, or a negative errno with nothing left behind but perhaps
/// the file.
[[nodiscard]] int writeNewFile(platform::Disk& disk, int directory, const char* name, mode_t mode,
                               std::span<const std::uint8_t> bytes);

/// `prefix` and six random characters.
[[nodiscard]] std::string uniqueName(std::string prefix);

} // namespace zor::fs
