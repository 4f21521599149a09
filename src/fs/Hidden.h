// SPDX-License-Identifier: Apache-2.0
// Telling what is missing from what is hidden: a directory that is encrypted, while its key is away, answers for each
// name that there is none. Asked only where a name was not found, so what is found costs nothing. Any thread.
#pragma once

#include "base/FileURL.h"
#include "fs/PathResolver.h"
#include "platform/Disk.h"

#include <optional>

namespace zor::fs {

/// The directory at `url`, or the nearest one above it that is there, when that hides what is in it.
[[nodiscard]] std::optional<FileURL> hiddenBy(const PathResolver& resolver, platform::Disk& disk, const FileURL& url);
/// Whether the directory `name` in an open one hides what is in it.
[[nodiscard]] bool hidesNamesBelow(platform::Disk& disk, int directory, const char* name);

} // namespace zor::fs
