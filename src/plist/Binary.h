// SPDX-License-Identifier: Apache-2.0
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
// The reader takes any bytes and trusts none: bounds (Errors.h), cycles, and sharing that would take more memory than
// the input pays for, end in a named error. Strings hold no NUL and are valid Unicode, so that no name can mean one
// thing to C interfaces and another to the rest. The writer gives the same bytes for equal values, and whatever it
// writes the reader takes. Pure functions; any thread.
#pragma once

#include "plist/Errors.h"
#include "plist/Value.h"

#include <cstdint>
#include <expected>
#include <span>

namespace zor::plist {

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
