// SPDX-License-Identifier: Apache-2.0
// Packed buffers: tagged items in one flat sequence of bytes, written and read through a cursor. The form is in
// docs/formats.md; programs outside the daemon speak it too, so this library knows nothing of the daemon.
//
// Invariants of a handle: bytes_used <= bytes_allocated, bytes_remaining is their difference, and the cursor of a
// writer is at the end item, 8 bytes before bytes_used. Nothing outside the buffer is read or written, whatever
// its bytes are, and however a handle's size was set. Neither the buffer's address nor its size need be
// aligned.
//
// Nothing here throws or logs. One handle is used by one thread at a time.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <memory>

namespace zor {

/// How a buffer is released.
enum PackbuffDealloc : std::uint32_t {
    packbuffDeallocNone = 0,
    packbuffDeallocFree = 1,  // free()
    packbuffDeallocPages = 2, // the pages it lies on are unmapped
};

enum PackbuffItemType : std::uint16_t {
    packbuffItemEnd = 0,
    packbuffItemUint32 = 1,
    packbuffItemString = 2,
    packbuffItemBytes = 3,
};

/// These numbers are part of the interface and the same on every system.
enum PackbuffError : int {
    packbuffSuccess = 0,
    packbuffOutOfMemory = 12,
    packbuffInvalidArgument = 22, // or another item type than was asked for
    packbuffOutOfRange = 34,
    packbuffNotSupported = 45, // a buffer that cannot grow is full
};

/// Every item begins with this many bytes, at a multiple of them: item type (2), value type (2), value or length (4).
inline constexpr std::size_t packbuffHeaderBytes = 8;
inline constexpr std::uint32_t packbuffDefaultBlockSize = 256;

// The names of the handle and its operations are those of the other side of the interface.
struct sb_packbuff {
    std::uint32_t dealloc_type = packbuffDeallocNone;
    std::uint32_t block_size = 0; // growth step in bytes; 0: the buffer cannot grow
    std::uint32_t bytes_allocated = 0;
    std::uint32_t bytes_remaining = 0;
    std::uint32_t bytes_used = 0; // of content, with the end item when writing
    std::uint8_t* item_buffer = nullptr;
    std::uint8_t* item = nullptr; // the item to be read next, or the end item that the next write replaces
};

/// A writer that grows by `blockSize` bytes (packbuffDefaultBlockSize when that is below 8), or nullptr.
[[nodiscard]] sb_packbuff* sb_packbuff_new(std::uint32_t blockSize);
/// A reader of all `size` bytes, or a writer into them that cannot grow. nullptr without memory for the handle, for an
/// empty buffer, one over 2^32 - 1 bytes, and one to be written that does not hold the end item. The buffer is the
/// handle's only when there is one.
[[nodiscard]] sb_packbuff* sb_packbuff_init_with_buffer(void* buffer, std::size_t size, bool hasContent,
                                                        std::uint32_t deallocType);
/// Releases the buffer as its dealloc_type says, then the handle; nullptr is nothing.
void sb_packbuff_free(sb_packbuff* packbuff);

[[nodiscard]] const std::uint8_t* sb_packbuff_get_bytes(const sb_packbuff* packbuff);
[[nodiscard]] std::uint32_t sb_packbuff_get_size(const sb_packbuff* packbuff);
/// A size beyond the buffer counts as the whole of it.
void sb_packbuff_set_size(sb_packbuff* packbuff, std::uint32_t size);
/// 1 and the value type of the item at the cursor, or 0 at the end item and where no item fits.
[[nodiscard]] int sb_packbuff_get_item_value_type(const sb_packbuff* packbuff, std::uint16_t* valueType);
/// Whether an end item lies at the cursor: not so at the end of a sequence that was cut.
[[nodiscard]] bool sb_packbuff_is_at_end(const sb_packbuff* packbuff);

// Writing. Each returns a PackbuffError. After a failure the buffer still ends with an end item and the cursor is where
// it was; only when a reallocation failed the buffer is gone, and every later write fails as on one that cannot grow.
int sb_packbuff_pack_uint32(sb_packbuff* packbuff, std::uint16_t valueType, std::uint32_t value);
/// `length` without the NUL, which has to follow.
int sb_packbuff_pack_string(sb_packbuff* packbuff, std::uint16_t valueType, const char* string, std::uint32_t length);
int sb_packbuff_pack_bytes(sb_packbuff* packbuff, std::uint16_t valueType, const void* data, std::uint32_t length);
/// Two strings in a row. When the value does not fit, the key stays.
int sb_packbuff_pack_key_with_string_value(sb_packbuff* packbuff, std::uint16_t keyValueType, const char* key,
                                           std::uint16_t valueValueType, const char* value);

// Reading. The out arguments may be nullptr. An item of another type, or one that does not end before the buffer does,
// leaves the cursor in place; a string without a NUL at its end is passed by.
std::uint32_t sb_packbuff_unpack_uint32(sb_packbuff* packbuff, int* error);
/// Points into the buffer; `length` is without the NUL. nullptr on failure. A NUL may also stand inside a string.
const char* sb_packbuff_unpack_string(sb_packbuff* packbuff, std::uint32_t* length, int* error);
const std::uint8_t* sb_packbuff_unpack_bytes(sb_packbuff* packbuff, std::uint32_t* length, int* error);
int sb_packbuff_unpack_key_with_string_value(sb_packbuff* packbuff, const char** key, std::uint16_t* valueType,
                                             const char** value, std::uint32_t* valueLength);

/// Describes the handle and every item, for people.
void sb_packbuff_print(const sb_packbuff* packbuff, std::FILE* out = stdout);

struct PackbuffDeleter {
    void operator()(sb_packbuff* packbuff) const { sb_packbuff_free(packbuff); }
};
using PackbuffPointer = std::unique_ptr<sb_packbuff, PackbuffDeleter>;

} // namespace zor
