// SPDX-License-Identifier: Apache-2.0
// The records that the process that decodes an archive sends to the one that writes: entries, each followed by pieces
// of its data, and at last an end or a failure. Both are this program; still the reader trusts no record, since the
// sender has read hostile bytes with a large library.
#pragma once

#include <cstddef>
#include <cstdint>

namespace zorvanectl::content {

enum class RecordKind : std::uint32_t {
    entry = 1, ///< `first` bytes of the name, then `second` bytes of a link's target
    data,      ///< `first` bytes of the last entry's data, at `offset`
    end,       ///< nothing follows. `flags`: what is known of the archive
    failure    ///< `first` bytes of text; nothing follows
};

// Flags of an entry.
inline constexpr std::uint32_t recordHardLink = 1; ///< the target is a hard link's
inline constexpr std::uint32_t recordHasTime = 2;
inline constexpr std::uint32_t recordHasSize = 4;
// The flag of the end.
inline constexpr std::uint32_t recordUncompressedTar = 1;

struct Record {
    RecordKind kind{};
    std::uint32_t flags = 0;
    std::uint32_t first = 0;
    std::uint32_t second = 0;
    /// Type and permissions.
    std::uint32_t mode = 0;
    std::uint32_t timeNanoseconds = 0;
    std::int64_t timeSeconds = 0;
    /// The size of an entry; for data, the offset at which it begins.
    std::int64_t offset = 0;
    /// The bytes of the archive that were read so far.
    std::uint64_t readBytes = 0;
};

/// The most bytes that follow a record.
inline constexpr std::size_t recordBytesMax = 256 * 1024;

} // namespace zorvanectl::content
