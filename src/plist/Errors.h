// SPDX-License-Identifier: Apache-2.0
// Why a property list could not be read or written. The reasons are literals: an error costs nothing to make and drop,
// which matters because clients can provoke them at will.
#pragma once

#include <cstddef>
#include <string>

namespace zor::plist {

struct ReadError {
    /// The place in the input, in bytes.
    std::size_t offset = 0;
    /// The fault there, in words. Never null, lives for ever.
    const char* reason = "";

    /// "byte 12: not a property list"
    [[nodiscard]] std::string text() const { return "byte " + std::to_string(offset) + ": " + reason; }
};

struct WriteError {
    const char* reason = "";
};

// The bounds of the property-list readers and writers, each with its unit and the reason for its size.

/// Containers inside each other, the root included. Real files stay under ten; readers, writers and destructors recurse
/// once per level, so this also bounds their stack.
inline constexpr std::size_t nestingMax = 64;

/// Bytes of memory that a value may take which is read from a binary form of `inputBytes`. In a small list every
/// reference is at least one byte, and one Value here (an entry: two, and one key and Value), so at 64 whatever shares
/// nothing pays for itself and so does sharing of short keys and scalars; sharing that multiplies does not. In a long
/// list a member of its own takes five bytes and more (reference, marker, offset), so 16 is enough there, and the
/// largest request, 1 MiB, cannot take more than 19 MiB of a thread, and half as much again for what the allocator adds
/// to small pieces and for putting a dictionary's keys in order.
constexpr std::size_t memoryBytesMax(std::size_t inputBytes) {
    constexpr std::size_t smallInputBytes = std::size_t{64} << 10;
    const std::size_t head = inputBytes < smallInputBytes ? inputBytes : smallInputBytes;
    return head * 64 + (inputBytes - head) * 16;
}

/// Bytes of an XML property list. People and packages write them; what the daemon writes itself is binary.
inline constexpr std::size_t xmlBytesMax = std::size_t{16} << 20;

} // namespace zor::plist
