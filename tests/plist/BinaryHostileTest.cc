// SPDX-License-Identifier: Apache-2.0
// Bytes that want to crash the reader, keep it busy or fill the memory.
#include "plist/Binary.h"
#include "plist/Errors.h"
#include "plist/Samples.h"
#include "support/Allocations.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <string>

namespace zor::plist::test {

namespace {

/// Reads under watch: a value or a reason inside the input, in memory that the input pays for. The factor of two and
/// the constant are the allocator's rounding and the reader itself.
std::expected<Value, ReadError> readWatched(const Data& bytes) {
    const support::MemoryWatch watch;
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
    for (std::size_t level = 1; level <= levels; ++level)
        objects.push_back(Data{static_cast<std::uint8_t>(0xA0 + fanOut)} +
                          Data(fanOut, static_cast<std::uint8_t>(level)));
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

// Goal: each refusal has its own reason. Method: a table of reasons, each with broken lists.
TEST(BinaryHostile, RefusedWithAReason) {
    const Data boolean{0x09};
    const Data mostBytes{0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF};
    const struct {
        const char* reason;
        std::vector<Data> files;
    } files[] = {
        {"not a binary", {{}}},
        {"version 00", {bytesOf("bplist16 and much more that is long enough for a trailer")}},
        {"too short", {bytesOf("bplist00"), assemble({})}},
        {"width", {assemble({boolean}) + Data{0}}},
        {"width of an offset",
         {assemble({boolean, boolean}, {.offsetWidth = 0}), assemble({boolean}, {.offsetWidth = 9})}},
        {"width of a reference",
         {assemble({boolean}, {.referenceWidth = 0}), assemble({boolean}, {.referenceWidth = 9})}},
        {"does not exist", {assemble({boolean}, {.root = 1}), assemble({boolean}, {.root = ~std::uint64_t{0}})}},
        {"more memory", {laughs(10, 10), laughs(60, 14)}},
    };
    const struct {
        const char* reason;
        std::vector<Objects> lists;
    } lists[] = {
        {"does not exist", {{{0xA1, 7}}}},
        {"null or fill", {{{0x00}}, {{0x0F}}}},
        // UID, set, ordered set, unknown.
        {"type", {{{0x80, 1}}, {{0xC1, 1}, boolean}, {{0xB1, 1}, boolean}, {{0x70}}}},
        {"more than 16", {{{0x15}, Data(32, 0)}}},
        {"does not fit", {{{0x14}, {0, 0, 0, 0, 0, 0, 0, 1}, Data(8, 0)}, {{0x14}, Data(16, 0xFF)}}},
        {"neither", {{{0x20, 0}}}},
        {"not 8 bytes", {{{0x32, 0, 0, 0, 0}}}},
        // Integer, real, date, data, two counts, UTF-16, array, dictionary.
        {"cut off", {{{0x13, 0, 0, 0, 0, 0, 0}}, {{0x23, 0}}, {{0x33, 0}}, {{0x42, 0}}, {{0x5F}}, {{0x5F, 0x12, 0}}}},
        {"cut off", {{{0x62, 0, 'a', 0}}, {{0xA2, 0}}, {{0xD1, 0}}}},
        // Data and an array as long as memory, UTF-16 and a dictionary whose bytes overflow.
        {"cut off",
         {{{0x4F, 0x13}, mostBytes},
          {{0xAF, 0x13, 0x1F, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}},
          {{0x6F, 0x13, 0x80, 0, 0, 0, 0, 0, 0, 0}},
          {{0xDF, 0x13, 0x80, 0, 0, 0, 0, 0, 0, 1, 0, 0}}}},
        {"a count that is no integer", {{{0x5F, 0x14}, Data(16, 0)}, {{0x5F, 0x51, 'a'}}}},
        {"above 127", {{{0x51, 0x80}}, {{0x5B}, bytesOf("0123456789\xFF")}}},
        {"NUL", {{{0x53, 'a', 0, 'b'}}, {{0x59, 'a', 'b', 0}, bytesOf("cdefgh")}, {{0x62, 0, 'a', 0, 0}}}},
        // A high one at the end, before another object and before a letter, a low one first.
        {"surrogate", {{{0x61, 0xD8, 0}}, {{0x61, 0xD8, 0}, {0xDC, 0}}}},
        {"surrogate", {{{0x62, 0xD8, 0, 0, 'a'}}, {{0x62, 0xDC, 0, 0xD8, 0}}}},
        {"key", {{{0xD1, 1, 1}, {0x10, 1}}, {{0xD1, 0, 0}}}},
        {"contains itself", {{{0xA1, 0}}, {{0xD1, 1, 2}, {0x51, 'k'}, {0xA1, 0}}}},
    };
    const auto expectRefused = [](const Data& bytes, const char* reason) {
        const auto read = readWatched(bytes);
        ASSERT_FALSE(read) << reason << ": " << testing::PrintToString(bytes);
        EXPECT_NE(std::string(read.error().reason).find(reason), std::string::npos)
            << reason << " but " << read.error().text() << ": " << testing::PrintToString(bytes);
    };
    for (const auto& row : files)
        for (const Data& file : row.files)
            expectRefused(file, row.reason);
    for (const auto& row : lists)
        for (const Objects& list : row.lists)
            expectRefused(assemble(list), row.reason);
}

// Goal: nothing shared multiplies: payload, or members of a long list, pay for themselves each time. Method: one long
// object of each kind with payload, referred to very often, and an array of one boolean, which may be long when it is
// not one.
TEST(BinaryHostile, SharedPayload) {
    for (const std::uint8_t marker : {0x4F, 0x5F, 0x6F}) {
        const Data payload = Data{marker, 0x11, 0x0F, 0xA0} + Data(marker == 0x6F ? 8000 : 4000, 'a');
        for (const std::size_t references : {2U, 4000U}) {
            const Data array{0xAF, 0x11, static_cast<std::uint8_t>(references >> 8),
                             static_cast<std::uint8_t>(references)};
            const auto read = readWatched(assemble({array + Data(references, 1), payload}, {.offsetWidth = 2}));
            EXPECT_EQ(read.has_value(), references == 2) << int{marker} << ", " << references;
        }
    }
    constexpr std::size_t count = 200'000;
    const Data array = Data{0xAF, 0x12, 0, 0x03, 0x0D, 0x40} + Data(count, 1);
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
        forEachDamage(whole, [](const Data& damaged) {
            const auto read = readWatched(damaged);
            if (!read)
                return;
            const auto written = writeBinary(*read);
            ASSERT_TRUE(written) << written.error().reason << ": " << testing::PrintToString(damaged);
            ASSERT_EQ(*readBinary(*written), *read) << testing::PrintToString(damaged);
        });
    }
}

} // namespace zor::plist::test
