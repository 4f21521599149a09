// SPDX-License-Identifier: Apache-2.0
// The bounds of the property-list readers and writers, each with its unit and the reason for its size.
#pragma once

#include <cstddef>

namespace zor::plist {

/// Containers inside each other, the root included. Real files stay under ten; readers, writers and destructors recurse
/// once per level, so this also bounds their stack.
inline constexpr std::size_t nestingMax = 64;

/// Bytes of memory that a value may take for each byte of the binary form it is read from. Every reference in a
/// container is at least one byte there and one Value (an entry: two and one key and Value) here, so whatever shares
/// nothing pays for itself, and so does sharing of short keys and scalars; sharing that multiplies does not.
inline constexpr std::size_t memoryBytesPerInputByte = 64;

/// Bytes of an XML property list. People and packages write them; what the daemon writes itself is binary.
inline constexpr std::size_t xmlBytesMax = std::size_t{16} << 20;

} // namespace zor::plist
