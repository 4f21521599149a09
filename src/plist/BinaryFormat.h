// SPDX-License-Identifier: Apache-2.0
// The markers and sizes that the reader and the writer of the binary form share.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string_view>

namespace zor::plist::binary {

inline constexpr std::string_view magic = "bplist00";
inline constexpr std::size_t trailerBytes = 32;
// Places in the trailer.
inline constexpr std::size_t trailerOffsetWidth = 6;
inline constexpr std::size_t trailerReferenceWidth = 7;
inline constexpr std::size_t trailerObjectCount = 8;
inline constexpr std::size_t trailerRoot = 16;
inline constexpr std::size_t trailerTable = 24;

/// The high half of a marker byte; the comment says what the low half is.
enum class Kind : std::uint8_t {
    simple = 0x0,     // 8 false, 9 true
    integer = 0x1,    // log2 of the bytes that follow
    real = 0x2,       // log2 of the bytes that follow
    date = 0x3,       // 3
    data = 0x4,       // count of bytes
    ascii = 0x5,      // count of characters
    utf16 = 0x6,      // count of 16-bit units
    array = 0xA,      // count of references
    dictionary = 0xD, // count of entries: first all key references, then all value references
};
inline constexpr std::uint8_t markerFalse = 0x08;
inline constexpr std::uint8_t markerTrue = 0x09;
inline constexpr std::uint8_t markerDate = 0x33;
/// A count in the low half that means: an integer object with the real count follows.
inline constexpr std::uint8_t countFollows = 0xF;

} // namespace zor::plist::binary
