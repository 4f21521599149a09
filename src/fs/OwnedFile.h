// SPDX-License-Identifier: Apache-2.0
// Reading small files that lie where others may write: only what the daemon itself can have written is believed.
#pragma once

#include "plist/Value.h"

#include <cstddef>
#include <expected>
#include <optional>
#include <sys/types.h>

namespace zor::fs {

/// Largest file of one container: its info values have to fit.
inline constexpr std::size_t metadataFileBytesMax = std::size_t{1} << 20;

/// The whole of a file, or an errno. `path` is relative to `directory` and resolved without following a link.
///
/// The file must be regular, have one link, belong to root or the daemon's user (or to `formerOwner`, for files of an
/// older system), not be writable by group or others, and hold at most `bytesMax`; else EPERM or EFBIG. Opening cannot
/// block, whatever is found there. Any thread.
[[nodiscard]] std::expected<plist::Data, int> readOwnedFile(int directory, const char* path, std::size_t bytesMax,
                                                            std::optional<uid_t> formerOwner = std::nullopt);

} // namespace zor::fs
