// SPDX-License-Identifier: Apache-2.0
// Property lists as bytes: either form read, the binary one written, and the bounds of both.
#pragma once

#include "plist/Value.h"

#include <cstddef>
#include <cstdint>
#include <expected>
#include <span>
#include <string>

namespace zor::plist {

// Why a property list could not be read or written. The reasons are literals: an error costs nothing to make and drop,
// which matters because clients can provoke them at will.

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

// Reads property lists of either form, for files: the first bytes say which it is. Messages are binary only.
//
// The XML form is read only: registry files and metadata files that people and packages wrote. The one element "plist"
// holds one value: dict, array, string, integer, real, true, false, date or data. The document may name the usual
// document type but may not declare anything: an internal subset is refused, so there are no entities but the five
// predefined ones and nothing can grow or be fetched. Every value takes at least seven bytes of input, so memory stays
// in proportion without further accounts; nesting and size are bounded above. Pure; any thread.

[[nodiscard]] std::expected<Value, ReadError> readPropertyList(std::span<const std::uint8_t> bytes);

[[nodiscard]] std::expected<Value, ReadError> readXml(std::span<const std::uint8_t> bytes);

// The binary form of property lists. All numbers in it are big-endian:
//
//   "bplist00"          8 bytes
//   objects             each a marker byte (type in the high half, size or count in the low) and its content;
//   containers
//                       name their members by object number
//   offset table        for each object number, where it starts
//   trailer             32 bytes: 6 unused, width of an offset, width of a reference, then 8 bytes each: count of
//   objects,
//                       number of the root, place of the offset table
//
// The reader takes any bytes and trusts none: bounds, cycles, and sharing that would take more memory than
// the input pays for, end in a named error. Strings hold no NUL and are valid Unicode, so that no name can mean one
// thing to C interfaces and another to the rest. The writer gives the same bytes for equal values, and whatever it
// writes the reader takes. Pure functions; any thread.

/// True when `bytes` begin as a binary property list of any version does.
[[nodiscard]] bool looksBinary(std::span<const std::uint8_t> bytes);

[[nodiscard]] std::expected<Value, ReadError> readBinary(std::span<const std::uint8_t> bytes);

[[nodiscard]] std::expected<Data, WriteError> writeBinary(const Value& value);

/// Writes behind what `out` already holds, so that a frame header and its payload share one buffer. On an error `out`
/// is unchanged.
[[nodiscard]] std::expected<void, WriteError> appendBinary(const Value& value, Data& out);
/// The same for a root that is held as a dictionary, without a copy of it.
[[nodiscard]] std::expected<void, WriteError> appendBinary(const Dictionary& root, Data& out);

} // namespace zor::plist
