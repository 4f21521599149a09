// SPDX-License-Identifier: Apache-2.0
// Bytes that want to crash the reader, keep it busy or fill the memory.
#include "plist/Binary.h"
#include "plist/Limits.h"
#include "plist/Samples.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <string>

namespace zor::plist::test {

namespace {

/// Reads under watch: a value or a reason inside the input, in memory that the input pays for. The factor of two and
/// the constant are the allocator's rounding and the reader itself.
std::expected<Value, ReadError> readWatched(const Data& bytes) {
    const MemoryWatch watch;
    auto read = readBinary(bytes);
    EXPECT_LE(watch.peakBytes(), 2 * memoryBytesMax(bytes.size()) + 1024);
    if (!read) {
        EXPECT_STRNE(read.error().reason, "");
        EXPECT_LE(read.error().offset, bytes.size());
    }
    return read;
}

/// `levels` containers, each holding the next `fanOut` times; the last holds a boolean as often.
Data laughs(std::size_t levels, std::size_t fanOut) {
    Objects objects;
    for (std::size_t level = 0; level < levels; ++level) {
        Data& array = objects.emplace_back(Data{static_cast<std::uint8_t>(0xA0 + fanOut)});
        array.insert(array.end(), fanOut, static_cast<std::uint8_t>(level + 1));
    }
    objects.push_back({0x09});
    return assemble(objects, {.offsetWidth = 2});
}

/// A list with every kind of object, references shared and not.
Data sample() {
    const Value value(Dictionary{
        {"array", Array{Value(1), Value(-1), Value(~std::uint64_t{0}), Value(false)}},
        {"data", Data(20, 0xAB)},
        {"date", Date{1e8}},
        {"dictionary", Dictionary{{"real", 0.25}, {"empty", Dictionary{}}}},
        {"string of more than fifteen", "and \U0001F600"},
    });
    return *writeBinary(value);
}

} // namespace

// Goal: each refusal has its own reason. Method: a table of broken lists and a word of the reason.
TEST(BinaryHostile, RefusedWithAReason) {
    Data trailingByte = assemble({{0x09}});
    trailingByte.push_back(0);
    const struct {
        const char* name;
        Data bytes;
        const char* reason;
    } rows[] = {
        {"nothing", {}, "not a binary"},
        {"another version", bytesOf("bplist16 and much more that is long enough for a trailer"), "version 00"},
        {"magic alone", bytesOf("bplist00"), "too short"},
        {"no objects", assemble({}), "too short"},
        {"a byte behind the trailer", trailingByte, "width"},
        {"offset width 0", assemble({{0x09}, {0x09}}, {.offsetWidth = 0}), "width of an offset"},
        {"offset width 9", assemble({{0x09}}, {.offsetWidth = 9}), "width of an offset"},
        {"reference width 0", assemble({{0x09}}, {.referenceWidth = 0}), "width of a reference"},
        {"reference width 9", assemble({{0x09}}, {.referenceWidth = 9}), "width of a reference"},
        {"root outside", assemble({{0x09}}, {.root = 1}), "does not exist"},
        {"root far outside", assemble({{0x09}}, {.root = ~std::uint64_t{0}}), "does not exist"},
        {"reference outside", assemble({{0xA1, 7}}), "does not exist"},
        {"null", assemble({{0x00}}), "null or fill"},
        {"fill", assemble({{0x0F}}), "null or fill"},
        {"UID", assemble({{0x80, 1}}), "type"},
        {"set", assemble({{0xC1, 1}, {0x09}}), "type"},
        {"ordered set", assemble({{0xB1, 1}, {0x09}}), "type"},
        {"unknown marker", assemble({{0x70}}), "type"},
        {"integer of 32 bytes", assemble({{0x15}, Data(32, 0)}), "more than 16"},
        {"integer over 64 bits", assemble({{0x14}, {0, 0, 0, 0, 0, 0, 0, 1}, Data(8, 0)}), "does not fit"},
        {"negative in 16 bytes", assemble({{0x14}, Data(16, 0xFF)}), "does not fit"},
        {"integer cut off", assemble({{0x13, 0, 0, 0, 0, 0, 0}}), "cut off"},
        {"real of one byte", assemble({{0x20, 0}}), "neither"},
        {"real cut off", assemble({{0x23, 0}}), "cut off"},
        {"date of four bytes", assemble({{0x32, 0, 0, 0, 0}}), "not 8 bytes"},
        {"date cut off", assemble({{0x33, 0}}), "cut off"},
        {"data cut off", assemble({{0x42, 0}}), "cut off"},
        {"data as long as memory", assemble({{0x4F, 0x13, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}}), "cut off"},
        {"count missing", assemble({{0x5F}}), "cut off"},
        {"count cut off", assemble({{0x5F, 0x12, 0}}), "cut off"},
        {"count of 16 bytes", assemble({{0x5F, 0x14}, Data(16, 0)}), "a count that is no integer"},
        {"count is a string", assemble({{0x5F, 0x51, 'a'}}), "a count that is no integer"},
        {"ASCII above 127", assemble({{0x51, 0x80}}), "above 127"},
        {"ASCII above 127 in a long one", assemble({{0x5B}, bytesOf("0123456789\xFF")}), "above 127"},
        {"NUL in ASCII", assemble({{0x53, 'a', 0, 'b'}}), "NUL"},
        {"NUL in the first eight", assemble({{0x59}, {'a', 'b', 0, 'c', 'd', 'e', 'f', 'g', 'h'}}), "NUL"},
        {"NUL in UTF-16", assemble({{0x62, 0, 'a', 0, 0}}), "NUL"},
        {"UTF-16 cut off", assemble({{0x62, 0, 'a', 0}}), "cut off"},
        {"UTF-16 whose bytes overflow", assemble({{0x6F, 0x13, 0x80, 0, 0, 0, 0, 0, 0, 0}}), "cut off"},
        {"high surrogate at the end", assemble({{0x61, 0xD8, 0x00}}), "surrogate"},
        {"high surrogate before another object", assemble({{0x61, 0xD8, 0x00}, {0xDC, 0x00}}), "surrogate"},
        {"high surrogate before a letter", assemble({{0x62, 0xD8, 0x00, 0x00, 'a'}}), "surrogate"},
        {"low surrogate first", assemble({{0x62, 0xDC, 0x00, 0xD8, 0x00}}), "surrogate"},
        {"array cut off", assemble({{0xA2, 0}}), "cut off"},
        {"array as long as memory", assemble({{0xAF, 0x13, 0x1F, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}}),
         "cut off"},
        {"dictionary cut off", assemble({{0xD1, 0}}), "cut off"},
        {"dictionary whose bytes overflow", assemble({{0xDF, 0x13, 0x80, 0, 0, 0, 0, 0, 0, 1, 0, 0}}), "cut off"},
        {"key is a number", assemble({{0xD1, 1, 1}, {0x10, 1}}), "key"},
        {"key is the dictionary", assemble({{0xD1, 0, 0}}), "key"},
        {"array in itself", assemble({{0xA1, 0}}), "contains itself"},
        {"dictionary in its array", assemble({{0xD1, 1, 2}, {0x51, 'k'}, {0xA1, 0}}), "contains itself"},
        {"laughs", laughs(10, 10), "more memory"},
        {"many laughs", laughs(60, 14), "more memory"},
    };
    for (const auto& row : rows) {
        const auto read = readWatched(row.bytes);
        ASSERT_FALSE(read) << row.name;
        EXPECT_NE(std::string(read.error().reason).find(row.reason), std::string::npos)
            << row.name << ": " << read.error().text();
    }
}

// Goal: no shared payload multiplies. Method: one long object of each kind with payload, referred to very often.
TEST(BinaryHostile, SharedPayload) {
    const Data count4000{0x11, 0x0F, 0xA0};
    for (const std::uint8_t marker : {0x4F, 0x5F, 0x6F}) {
        Data payload{marker};
        payload.insert(payload.end(), count4000.begin(), count4000.end());
        payload.insert(payload.end(), marker == 0x6F ? 8000 : 4000, 'a');
        for (const std::size_t references : {2U, 4000U}) {
            Data array{0xAF, 0x11, static_cast<std::uint8_t>(references >> 8), static_cast<std::uint8_t>(references)};
            array.insert(array.end(), references, 1);
            const auto read = readWatched(assemble({array, payload}, {.offsetWidth = 2}));
            EXPECT_EQ(read.has_value(), references == 2) << int{marker} << ", " << references;
        }
    }
}

// Goal: in a long list, members that are one object do not pay for themselves, members of their own do. Method: the
// same array of booleans in both forms.
TEST(BinaryHostile, LongLists) {
    constexpr std::size_t count = 200000;
    Data array{0xAF, 0x12, 0, 0x03, 0x0D, 0x40};
    array.insert(array.end(), count, 1);
    EXPECT_FALSE(readWatched(assemble({array, {0x09}}, {.offsetWidth = 4})));
    EXPECT_TRUE(readWatched(*writeBinary(Array(count, Value(true)))));
}

// Goal: 64 containers in each other are read and written, 65 are not. Method: chains of arrays in both directions.
TEST(BinaryHostile, NestingLimit) {
    EXPECT_EQ(*readBinary(*writeBinary(nestedArrays(nestingMax))), nestedArrays(nestingMax));
    for (const std::size_t depth : {64U, 65U, 200U}) {
        Objects objects;
        for (std::size_t i = 1; i < depth; ++i)
            objects.push_back({0xA1, static_cast<std::uint8_t>(i)});
        objects.push_back({0xA0});
        const auto read = readWatched(assemble(objects, {.offsetWidth = 2}));
        EXPECT_EQ(read.has_value(), depth <= nestingMax) << depth;
    }
}

// Goal: no cut and no changed byte does harm, and what still reads can be written. Method: every cut and, for every
// byte, each single bit and all bits turned over.
TEST(BinaryHostile, SystematicDamage) {
    const Data samples[] = {sample(), assemble({{0xD1, 1, 2}, {0x51, 'k'}, {0xA3, 1, 1, 1}}, {.referenceWidth = 1}),
                            laughs(3, 2)};
    for (const Data& whole : samples) {
        ASSERT_TRUE(readWatched(whole));
        for (std::size_t length = 0; length < whole.size(); ++length)
            ASSERT_FALSE(readWatched(Data(whole.begin(), whole.begin() + static_cast<std::ptrdiff_t>(length))))
                << length;
        for (std::size_t at = 0; at < whole.size(); ++at) {
            for (const int bits : {1, 2, 4, 8, 16, 32, 64, 128, 255}) {
                Data damaged = whole;
                damaged[at] = static_cast<std::uint8_t>(damaged[at] ^ bits);
                const auto read = readWatched(damaged);
                if (!read)
                    continue;
                const auto written = writeBinary(*read);
                ASSERT_TRUE(written) << "byte " << at << " bits " << bits << ": " << written.error().reason;
                ASSERT_EQ(*readBinary(*written), *read) << "byte " << at << " bits " << bits;
            }
        }
    }
}

// Goal: an offset may point anywhere. Method: the root's offset takes every value of two bytes.
TEST(BinaryHostile, OffsetsAnywhere) {
    Data bytes = assemble({{0xA2, 1, 1}, {0x5E}, bytesOf("\xD1\xA1\x4F\x10\x33\x23\x13\x61?????")}, {.offsetWidth = 2});
    const std::size_t table = bytes.size() - 32 - 6;
    // The table's first byte would be an object by itself: its own place, 9, is the marker of true.
    Data atTable = assemble({{0x08}});
    ASSERT_EQ(atTable[9], 8);
    atTable[9] = 9;
    EXPECT_FALSE(readWatched(atTable));
    for (std::size_t offset = 0; offset <= 0xFFFF; ++offset) {
        bytes[table] = static_cast<std::uint8_t>(offset >> 8);
        bytes[table + 1] = static_cast<std::uint8_t>(offset);
        const auto read = readWatched(bytes);
        if (offset < 8 || offset >= table) {
            ASSERT_FALSE(read) << offset;
        }
    }
}

} // namespace zor::plist::test
