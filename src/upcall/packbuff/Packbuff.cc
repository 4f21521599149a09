// SPDX-License-Identifier: Apache-2.0
#include "upcall/packbuff/Packbuff.h"

#include <algorithm>
#include <bit>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <new>
#include <sys/mman.h>

namespace zor {

// Fields are in the machine's byte order, and every machine that is served has this one.
static_assert(std::endian::native == std::endian::little);

namespace {

constexpr std::uint32_t bytesMax = std::numeric_limits<std::uint32_t>::max();

struct ItemHeader {
    std::uint16_t itemType = packbuffItemEnd;
    std::uint16_t valueType = 0;
    std::uint32_t valueOrLength = 0;
};
static_assert(sizeof(ItemHeader) == packbuffHeaderBytes);

constexpr bool hasData(std::uint16_t itemType) {
    return itemType == packbuffItemString || itemType == packbuffItemBytes;
}

constexpr std::uint32_t padBytes(std::uint32_t length) {
    return (packbuffHeaderBytes - length % packbuffHeaderBytes) % packbuffHeaderBytes;
}

/// The whole item; more than 32 bits hold for the longest lengths.
constexpr std::uint64_t itemBytes(const ItemHeader& header) {
    if (!hasData(header.itemType))
        return packbuffHeaderBytes;
    return packbuffHeaderBytes + std::uint64_t{header.valueOrLength} + padBytes(header.valueOrLength);
}

ItemHeader headerAt(const sb_packbuff* packbuff, std::size_t offset) {
    ItemHeader header;
    std::memcpy(&header, packbuff->item_buffer + offset, sizeof header);
    return header;
}

std::size_t cursorOffset(const sb_packbuff* packbuff) {
    return static_cast<std::size_t>(packbuff->item - packbuff->item_buffer);
}

bool headerFits(const sb_packbuff* packbuff) {
    const std::size_t offset = cursorOffset(packbuff);
    return offset <= packbuff->bytes_allocated && packbuff->bytes_allocated - offset >= packbuffHeaderBytes;
}

void writeEndItem(sb_packbuff* packbuff) {
    std::memset(packbuff->item, 0, packbuffHeaderBytes);
}

/// A handle whose buffer is gone: nothing fits, and nothing makes it grow again.
void forgetBuffer(sb_packbuff* packbuff) {
    packbuff->block_size = 0;
    packbuff->bytes_allocated = 0;
    packbuff->bytes_remaining = 0;
    packbuff->bytes_used = 0;
    packbuff->item_buffer = nullptr;
    packbuff->item = nullptr;
}

int grow(sb_packbuff* packbuff, std::uint32_t needed) {
    if (packbuff->block_size == 0 || packbuff->dealloc_type != packbuffDeallocFree)
        return packbuffNotSupported;
    std::uint64_t allocated = std::uint64_t{packbuff->bytes_allocated} + packbuff->block_size;
    const std::uint64_t rounded = std::uint64_t{needed} + padBytes(needed);
    if (rounded > allocated - packbuff->bytes_used)
        allocated += rounded;
    if (allocated > bytesMax)
        return packbuffOutOfRange;
    void* const moved = std::realloc(packbuff->item_buffer, allocated);
    if (!moved) {
        std::free(packbuff->item_buffer);
        forgetBuffer(packbuff);
        return packbuffOutOfMemory;
    }
    packbuff->item_buffer = static_cast<std::uint8_t*>(moved);
    packbuff->bytes_allocated = static_cast<std::uint32_t>(allocated);
    packbuff->bytes_remaining = packbuff->bytes_allocated - packbuff->bytes_used;
    packbuff->item = packbuff->item_buffer;
    if (packbuff->bytes_used >= packbuffHeaderBytes)
        packbuff->item += packbuff->bytes_used - packbuffHeaderBytes;
    return packbuffSuccess;
}

int packItem(sb_packbuff* packbuff, const ItemHeader& header, const void* data) {
    const std::uint64_t size = itemBytes(header);
    if (size > bytesMax)
        return packbuffOutOfRange;
    const auto needed = static_cast<std::uint32_t>(size);
    if (needed > packbuff->bytes_remaining) {
        if (const int error = grow(packbuff, needed); error != packbuffSuccess)
            return error;
    }
    // A size that was set has moved the count and not the cursor.
    if (cursorOffset(packbuff) + size + packbuffHeaderBytes > packbuff->bytes_allocated)
        return packbuffOutOfRange;
    std::memcpy(packbuff->item, &header, sizeof header);
    if (hasData(header.itemType)) {
        const std::uint32_t length = header.valueOrLength;
        std::uint8_t* const start = packbuff->item + packbuffHeaderBytes;
        if (length > 0)
            std::memcpy(start, data, length);
        std::memset(start + length, 0, padBytes(length));
    }
    packbuff->item += needed;
    packbuff->bytes_remaining -= needed;
    packbuff->bytes_used += needed;
    writeEndItem(packbuff);
    return packbuffSuccess;
}

struct UnpackedItem {
    int error = packbuffSuccess;
    const std::uint8_t* data = nullptr;
    std::uint32_t valueOrLength = 0;
};

UnpackedItem unpackItem(sb_packbuff* packbuff, std::uint16_t expectedType) {
    if (!headerFits(packbuff))
        return {.error = packbuffOutOfRange};
    const std::size_t offset = cursorOffset(packbuff);
    const ItemHeader header = headerAt(packbuff, offset);
    if (header.itemType != expectedType)
        return {.error = packbuffInvalidArgument};
    const std::uint64_t size = itemBytes(header);
    // Behind an item there is always another, be it the end.
    if (size >= packbuff->bytes_allocated - offset)
        return {.error = packbuffOutOfRange};
    const std::uint8_t* const data = packbuff->item + packbuffHeaderBytes;
    packbuff->item += size;
    return {.data = data, .valueOrLength = header.valueOrLength};
}

void report(int* error, int code) {
    if (error)
        *error = code;
}

int packCString(sb_packbuff* packbuff, std::uint16_t valueType, const char* string) {
    const std::size_t length = std::min<std::size_t>(std::strlen(string), bytesMax);
    return sb_packbuff_pack_string(packbuff, valueType, string, static_cast<std::uint32_t>(length));
}

const char* deallocName(std::uint32_t deallocType) {
    switch (deallocType) {
    case packbuffDeallocNone:
        return "None";
    case packbuffDeallocFree:
        return "free()";
    case packbuffDeallocPages:
        return "munmap()";
    default:
        return "<Unknown>";
    }
}

void printHandle(const sb_packbuff* packbuff, std::FILE* out) {
    std::fprintf(out, "packbuff: %p\n", static_cast<const void*>(packbuff));
    std::fprintf(out, "  block_size:      %zu\n", std::size_t{packbuff->block_size});
    std::fprintf(out, "  dealloc_type:    %s\n", deallocName(packbuff->dealloc_type));
    std::fprintf(out, "  bytes_allocated: %zu\n", std::size_t{packbuff->bytes_allocated});
    std::fprintf(out, "  bytes_used:      %zu\n", std::size_t{packbuff->bytes_used});
    std::fprintf(out, "  bytes_remaining: %zu\n", std::size_t{packbuff->bytes_remaining});
    std::fprintf(out, "  item_buffer %p, item: %p\n", static_cast<const void*>(packbuff->item_buffer),
                 static_cast<const void*>(packbuff->item));
    std::fprintf(out, "\n");
}

/// The item at `start`; `available` bytes of data lie behind its header.
void printItem(const ItemHeader& header, const std::uint8_t* start, std::size_t available, std::FILE* out) {
    const void* const data = start + packbuffHeaderBytes;
    const std::uint32_t length = header.valueOrLength;
    switch (header.itemType) {
    case packbuffItemUint32:
        std::fprintf(out, "inline value: %u\n", length);
        break;
    case packbuffItemString: {
        constexpr std::size_t shownMax = std::numeric_limits<int>::max();
        const auto shown = static_cast<int>(std::min({std::size_t{length}, available, shownMax}));
        std::fprintf(out, "string (%p, %u pad bytes, size: %u): \n     `%.*s'\n", data, padBytes(length), length, shown,
                     static_cast<const char*>(data));
        break;
    }
    case packbuffItemBytes:
        std::fprintf(out, "bytes (%p, %u pad bytes, size: %u)\n", data, padBytes(length), length);
        break;
    default:
        std::fprintf(out, "*Unknown item type* %u\n", header.itemType);
        break;
    }
}

} // namespace

sb_packbuff* sb_packbuff_new(std::uint32_t blockSize) {
    auto* const packbuff = new (std::nothrow) sb_packbuff;
    if (!packbuff)
        return nullptr;
    packbuff->dealloc_type = packbuffDeallocFree;
    packbuff->block_size = blockSize < packbuffHeaderBytes ? packbuffDefaultBlockSize : blockSize;
    if (grow(packbuff, 0) != packbuffSuccess) {
        delete packbuff;
        return nullptr;
    }
    sb_packbuff_set_size(packbuff, packbuffHeaderBytes);
    writeEndItem(packbuff);
    return packbuff;
}

sb_packbuff* sb_packbuff_init_with_buffer(void* buffer, std::size_t size, bool hasContent, std::uint32_t deallocType) {
    const std::size_t sizeMin = hasContent ? 1 : packbuffHeaderBytes;
    if (!buffer || size < sizeMin || size > bytesMax)
        return nullptr;
    auto* const packbuff = new (std::nothrow) sb_packbuff;
    if (!packbuff)
        return nullptr;
    packbuff->dealloc_type = deallocType;
    packbuff->bytes_allocated = static_cast<std::uint32_t>(size);
    packbuff->item_buffer = static_cast<std::uint8_t*>(buffer);
    packbuff->item = packbuff->item_buffer;
    if (!hasContent)
        writeEndItem(packbuff);
    sb_packbuff_set_size(packbuff, hasContent ? packbuff->bytes_allocated : packbuffHeaderBytes);
    return packbuff;
}

void sb_packbuff_free(sb_packbuff* packbuff) {
    if (!packbuff)
        return;
    void* const buffer = packbuff->item_buffer;
    const std::size_t size = packbuff->bytes_allocated;
    if (packbuff->dealloc_type == packbuffDeallocPages && ::munmap(buffer, size) != 0)
        std::printf("failed: munmap(%p, %zu)\n", buffer, size);
    if (packbuff->dealloc_type == packbuffDeallocFree)
        std::free(buffer);
    delete packbuff;
}

const std::uint8_t* sb_packbuff_get_bytes(const sb_packbuff* packbuff) {
    return packbuff->item_buffer;
}

std::uint32_t sb_packbuff_get_size(const sb_packbuff* packbuff) {
    return packbuff->bytes_used;
}

void sb_packbuff_set_size(sb_packbuff* packbuff, std::uint32_t size) {
    packbuff->bytes_used = std::min(size, packbuff->bytes_allocated);
    packbuff->bytes_remaining = packbuff->bytes_allocated - packbuff->bytes_used;
}

int sb_packbuff_get_item_value_type(const sb_packbuff* packbuff, std::uint16_t* valueType) {
    if (!headerFits(packbuff))
        return 0;
    const ItemHeader header = headerAt(packbuff, cursorOffset(packbuff));
    if (header.itemType == packbuffItemEnd)
        return 0;
    if (valueType)
        *valueType = header.valueType;
    return 1;
}

bool sb_packbuff_is_at_end(const sb_packbuff* packbuff) {
    return headerFits(packbuff) && headerAt(packbuff, cursorOffset(packbuff)).itemType == packbuffItemEnd;
}

int sb_packbuff_pack_uint32(sb_packbuff* packbuff, std::uint16_t valueType, std::uint32_t value) {
    return packItem(packbuff, {.itemType = packbuffItemUint32, .valueType = valueType, .valueOrLength = value},
                    nullptr);
}

int sb_packbuff_pack_string(sb_packbuff* packbuff, std::uint16_t valueType, const char* string, std::uint32_t length) {
    if (length == bytesMax || string[length] != '\0')
        return packbuffInvalidArgument;
    return packItem(packbuff, {.itemType = packbuffItemString, .valueType = valueType, .valueOrLength = length + 1},
                    string);
}

int sb_packbuff_pack_bytes(sb_packbuff* packbuff, std::uint16_t valueType, const void* data, std::uint32_t length) {
    return packItem(packbuff, {.itemType = packbuffItemBytes, .valueType = valueType, .valueOrLength = length}, data);
}

int sb_packbuff_pack_key_with_string_value(sb_packbuff* packbuff, std::uint16_t keyValueType, const char* key,
                                           std::uint16_t valueValueType, const char* value) {
    if (const int error = packCString(packbuff, keyValueType, key); error != packbuffSuccess)
        return error;
    return packCString(packbuff, valueValueType, value);
}

std::uint32_t sb_packbuff_unpack_uint32(sb_packbuff* packbuff, int* error) {
    const UnpackedItem item = unpackItem(packbuff, packbuffItemUint32);
    report(error, item.error);
    return item.valueOrLength;
}

const char* sb_packbuff_unpack_string(sb_packbuff* packbuff, std::uint32_t* length, int* error) {
    UnpackedItem item = unpackItem(packbuff, packbuffItemString);
    const bool ends = item.data && item.valueOrLength > 0 && item.data[item.valueOrLength - 1] == '\0';
    if (item.error == packbuffSuccess && !ends)
        item.error = packbuffInvalidArgument;
    report(error, item.error);
    if (item.error != packbuffSuccess)
        return nullptr;
    if (length)
        *length = item.valueOrLength - 1;
    return reinterpret_cast<const char*>(item.data);
}

const std::uint8_t* sb_packbuff_unpack_bytes(sb_packbuff* packbuff, std::uint32_t* length, int* error) {
    const UnpackedItem item = unpackItem(packbuff, packbuffItemBytes);
    report(error, item.error);
    if (item.error == packbuffSuccess && length)
        *length = item.valueOrLength;
    return item.data;
}

int sb_packbuff_unpack_key_with_string_value(sb_packbuff* packbuff, const char** key, std::uint16_t* valueType,
                                             const char** value, std::uint32_t* valueLength) {
    int error = packbuffSuccess;
    const char* const keyString = sb_packbuff_unpack_string(packbuff, nullptr, &error);
    if (error != packbuffSuccess)
        return error;
    if (key)
        *key = keyString;
    if (valueType)
        (void)sb_packbuff_get_item_value_type(packbuff, valueType);
    const char* const valueString = sb_packbuff_unpack_string(packbuff, valueLength, &error);
    if (error == packbuffSuccess && value)
        *value = valueString;
    return error;
}

void sb_packbuff_print(const sb_packbuff* packbuff, std::FILE* out) {
    printHandle(packbuff, out);
    const std::size_t end = std::min(packbuff->bytes_used, packbuff->bytes_allocated);
    std::size_t offset = 0;
    for (int index = 0;; ++index) {
        if (offset > end || end - offset < packbuffHeaderBytes) {
            std::fprintf(out, ">> item pointer exceeds end of buffer. <<");
            return;
        }
        const std::uint8_t* const start = packbuff->item_buffer + offset;
        const ItemHeader header = headerAt(packbuff, offset);
        const char* const marker = start == packbuff->item ? "*" : " ";
        const void* const address = start;
        if (header.itemType == packbuffItemEnd) {
            std::fprintf(out, "%s%3d: %p -- END\n", marker, index, address);
            return;
        }
        std::fprintf(out, "%s%3d:%p -- value type %u --", marker, index, address, header.valueType);
        printItem(header, start, end - offset - packbuffHeaderBytes, out);
        offset += itemBytes(header);
    }
}

} // namespace zor
