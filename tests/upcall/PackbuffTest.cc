// SPDX-License-Identifier: Apache-2.0
#include "upcall/packbuff/Packbuff.h"

#include "upcall/PackbuffWorld.h"

#include <functional>
#include <limits>

namespace zor::test {
namespace {

constexpr std::uint32_t lengthMax = std::numeric_limits<std::uint32_t>::max();

std::span<const std::uint8_t> contentOf(const sb_packbuff& packbuff) {
    return {sb_packbuff_get_bytes(&packbuff), sb_packbuff_get_size(&packbuff)};
}

PackbuffPointer readerOf(std::uint8_t* bytes, std::size_t size) {
    return PackbuffPointer(sb_packbuff_init_with_buffer(bytes, size, true, packbuffDeallocNone));
}

using Write = std::function<int(sb_packbuff*)>;

Write number(std::uint16_t type, std::uint32_t value) {
    return [=](sb_packbuff* packbuff) { return sb_packbuff_pack_uint32(packbuff, type, value); };
}
Write string(std::uint16_t type, const char* text, std::uint32_t length) {
    return [=](sb_packbuff* packbuff) { return sb_packbuff_pack_string(packbuff, type, text, length); };
}
Write bytes(std::uint16_t type, const char* data, std::uint32_t length) {
    return [=](sb_packbuff* packbuff) { return sb_packbuff_pack_bytes(packbuff, type, data, length); };
}

// Goal: what is written has exactly these bytes, from an empty buffer on. Method: each row writes into a buffer full of
// other bytes, so that padding that is left as it was shows.
TEST(Packbuff, WritesByteForByte) {
    const std::string end = "00 00 00 00 00 00 00 00";
    const std::pair<Write, std::string> rows[] = {
        // the bytes before the end item
        {[](sb_packbuff*) { return 0; }, ""},
        {number(3, 501), "01 00 03 00 f5 01 00 00"},
        {number(0xFFFF, lengthMax), "01 00 ff ff ff ff ff ff"},
        {string(4, "ab", 2), "02 00 04 00 03 00 00 00  61 62 00 00 00 00 00 00"},
        {string(1, "", 0), "02 00 01 00 01 00 00 00  00 00 00 00 00 00 00 00"},
        {string(1, "abcdefg", 7), "02 00 01 00 08 00 00 00  61 62 63 64 65 66 67 00"},
        {bytes(9, "\1\2\3\4\5\6\7\x08\x09", 9),
         "03 00 09 00 09 00 00 00  01 02 03 04 05 06 07 08  09 00 00 00 00 00 00 00"},
        {bytes(9, nullptr, 0), "03 00 09 00 00 00 00 00"},
        {[](sb_packbuff* p) { return sb_packbuff_pack_key_with_string_value(p, 3, "k", 4, "value"); },
         "02 00 03 00 02 00 00 00  6b 00 00 00 00 00 00 00  02 00 04 00 06 00 00 00  76 61 6c 75 65 00 00 00"},
    };
    for (const auto& [write, before] : rows) {
        SCOPED_TRACE(before);
        const ByteVector expected = fromHex(before + end);
        ByteVector memory(expected.size(), 0xEE);
        const PackbuffPointer fixed(
            sb_packbuff_init_with_buffer(memory.data(), memory.size(), false, packbuffDeallocNone));
        const PackbuffPointer growing(sb_packbuff_new(8));
        for (sb_packbuff* packbuff : {fixed.get(), growing.get()}) {
            ASSERT_TRUE(packbuff);
            EXPECT_EQ(toHex(contentOf(*packbuff)), toHex(fromHex(end)));
            EXPECT_EQ(write(packbuff), packbuffSuccess);
            EXPECT_EQ(toHex(contentOf(*packbuff)), toHex(expected));
            EXPECT_EQ(packbuff->bytes_remaining, packbuff->bytes_allocated - packbuff->bytes_used);
            EXPECT_EQ(packbuff->item, packbuff->item_buffer + expected.size() - packbuffHeaderBytes);
        }
        // One that is full says so and stays as it was.
        EXPECT_EQ(sb_packbuff_pack_uint32(fixed.get(), 1, 1), packbuffNotSupported);
        EXPECT_EQ(toHex(contentOf(*fixed)), toHex(expected));
    }
}

/// The items in order, each read as what it is, and how it ends.
std::string readAll(sb_packbuff* packbuff) {
    std::string text;
    std::uint16_t valueType = 0;
    while (sb_packbuff_get_item_value_type(packbuff, &valueType) != 0) {
        int error = 0;
        std::uint32_t length = 0;
        const std::uint8_t* const before = packbuff->item;
        const std::uint32_t number = sb_packbuff_unpack_uint32(packbuff, &error);
        std::string item = std::to_string(number);
        EXPECT_TRUE(error == packbuffSuccess || packbuff->item == before);
        if (error == packbuffInvalidArgument)
            if (const char* string = sb_packbuff_unpack_string(packbuff, &length, &error))
                item = "'" + std::string(string, length) + "'";
        if (error == packbuffInvalidArgument && packbuff->item == before) {
            const std::uint8_t* const data = sb_packbuff_unpack_bytes(packbuff, &length, &error);
            item = "<" + std::to_string(length) +
                   (error == 0 && length > 0 ? " " + std::to_string(data[length - 1]) : "") + ">";
        }
        text += std::to_string(valueType) + "=";
        if (error != packbuffSuccess)
            return text + "error " + std::to_string(error);
        text += item + " ";
    }
    return text + (sb_packbuff_is_at_end(packbuff) ? "end" : "cut");
}

// Goal: a reader tells what is there, in order, and where it is broken. Method: a table of bytes.
TEST(Packbuff, ReadsWhatIsThere) {
    const std::string end = "00 00 00 00 00 00 00 00 ";
    const std::string ab = "02 00 04 00 03 00 00 00 61 62 00 00 00 00 00 00 ";
    const std::string pair = "02 00 03 00 02 00 00 00 6b 00 00 00 00 00 00 00 ";
    const std::pair<std::string, std::string> rows[] = {
        {end, "end"},
        {"01 00 03 00 f5 01 00 00 " + ab + "03 00 05 00 01 00 00 00 07 00 00 00 00 00 00 00 " + end,
         "3=501 4='ab' 5=<1 7> end"},
        {ab + "00 00 ff ff ff ff ff ff", "4='ab' end"},
        {"02 00 01 00 05 00 00 00 61 00 62 00 00 00 00 00" + end, std::string("1='a\0b\0' end", 12)},
        {"02 00 01 00 00 00 00 00" + end, "1=error 22"},
        {"02 00 01 00 02 00 00 00 61 62 00 00 00 00 00 00" + end, "1=error 22"},
        {"04 00 01 00 02 00 00 00" + end, "1=error 22"},
        {ab, "4=error 34"},
        {"01 00 01 00 01 00 00 00", "1=error 34"},
        {"02 00 01 00 09 00 00 00" + end + end, "1=error 34"},
        {"02 00 01 00 ff ff ff ff" + end, "1=error 34"},
        {"03 00 01 00 f9 ff ff ff" + end, "1=error 34"},
        {ab + "00", "4='ab' cut"},
        {"02 00 04 00 03 00 00", "cut"},
    };
    for (const auto& [hex, read] : rows) {
        const ByteVector bytes = fromHex(hex);
        const EdgeOfMemory memory(bytes); // of any alignment
        EXPECT_EQ(readAll(readerOf(memory.data(), bytes.size()).get()), read) << hex;
        EXPECT_EQ(toHex({memory.data(), bytes.size()}), toHex(bytes)) << "a reader wrote";
    }
    // A key without a value: the type is not told, the error is the value's.
    for (const bool whole : {true, false}) {
        ByteVector bytes = fromHex((whole ? pair : "") + ab + end);
        const char* key = nullptr;
        const char* value = nullptr;
        std::uint16_t type = 99;
        std::uint32_t length = 0;
        const PackbuffPointer reader = readerOf(bytes.data(), bytes.size());
        EXPECT_EQ(sb_packbuff_unpack_key_with_string_value(reader.get(), &key, &type, &value, &length),
                  whole ? packbuffSuccess : packbuffInvalidArgument);
        EXPECT_EQ(type, whole ? 4 : 99);
        EXPECT_EQ(std::string(key) + (whole ? std::string(value, length) : ""), whole ? "kab" : "ab");
    }
}

// Goal: no bytes make a reader or the dump leave the buffer or run for ever. Method: a whole request at the end of the
// memory, cut at every length, and with each byte set to values that matter.
TEST(Packbuff, StaysInsideDamagedBytes) {
    const ByteVector whole = golden("request.hex");
    const std::span items = std::span(whole).subspan(24);
    const std::unique_ptr<std::FILE, int (*)(std::FILE*)> nowhere(std::fopen("/dev/null", "w"), &std::fclose);
    const auto drive = [&](std::span<const std::uint8_t> bytes) {
        const EdgeOfMemory memory(bytes);
        const PackbuffPointer reader = readerOf(memory.data(), bytes.size());
        if (!reader)
            return;
        sb_packbuff_print(reader.get(), nowhere.get());
        (void)readAll(reader.get());
        sb_packbuff_print(reader.get(), nowhere.get());
        EXPECT_LE(reader->item, memory.data() + bytes.size());
    };
    for (std::size_t size = 0; size <= items.size(); ++size)
        drive(items.first(size));
    for (std::size_t at = 0; at < items.size(); ++at)
        for (const int value : {0, 1, 2, 3, 4, 7, 8, 127, 128, 248, 255}) {
            ByteVector damaged(items.begin(), items.end());
            damaged[at] = static_cast<std::uint8_t>(value);
            drive(damaged);
        }
}

} // namespace
} // namespace zor::test
