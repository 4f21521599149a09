// SPDX-License-Identifier: Apache-2.0
// The bytes of the binary form: derived by hand, read and written.
#include "plist/Binary.h"
#include "plist/Samples.h"

#include <gtest/gtest.h>

#include <limits>
#include <random>

namespace zor::plist::test {

namespace {

/// Offsets are as wide as that of the table needs, which is the highest.
Data wholeListOf(const Data& object) {
    return assemble({object}, {.offsetWidth = object.size() < 248 ? 1U : 2U});
}

struct Scalar {
    const char* name;
    Value value;
    Data object;
};

/// Hand-derived object bytes.
const std::vector<Scalar>& scalars() {
    constexpr auto least = std::numeric_limits<std::int64_t>::min();
    constexpr auto most = std::numeric_limits<std::int64_t>::max();
    constexpr double nan = std::numeric_limits<double>::quiet_NaN();
    static const std::vector<Scalar> rows = {
        {"false", false, {0x08}},
        {"true", true, {0x09}},
        {"0", 0, {0x10, 0x00}},
        {"255", 255, {0x10, 0xFF}},
        {"256", 256, {0x11, 0x01, 0x00}},
        {"65535", 65535, {0x11, 0xFF, 0xFF}},
        {"65536", 65536, {0x12, 0, 1, 0, 0}},
        {"2^32-1", std::uint32_t{0xFFFFFFFF}, {0x12, 0xFF, 0xFF, 0xFF, 0xFF}},
        {"2^32", std::int64_t{1} << 32, {0x13, 0, 0, 0, 1, 0, 0, 0, 0}},
        {"-1", -1, {0x13, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}},
        {"least", least, {0x13, 0x80, 0, 0, 0, 0, 0, 0, 0}},
        {"most signed", most, {0x13, 0x7F, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}},
        {"2^63", std::uint64_t{1} << 63, {0x14, 0, 0, 0, 0, 0, 0, 0, 0, 0x80, 0, 0, 0, 0, 0, 0, 0}},
        {"2^64-1", ~std::uint64_t{0}, {0x14, 0, 0, 0, 0, 0, 0, 0, 0, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}},
        {"1.5", 1.5, {0x23, 0x3F, 0xF8, 0, 0, 0, 0, 0, 0}},
        {"no number", nan, {0x23, 0x7F, 0xF8, 0, 0, 0, 0, 0, 0}},
        {"no date", Date{nan}, {0x33, 0x7F, 0xF8, 0, 0, 0, 0, 0, 0}},
        {"date", Date{1.0}, {0x33, 0x3F, 0xF0, 0, 0, 0, 0, 0, 0}},
        {"empty string", "", {0x50}},
        {"string of 14", "abcdefghijklmn", Data{0x5E} + bytesOf("abcdefghijklmn")},
        {"string of 15", "abcdefghijklmno", Data{0x5F, 0x10, 0x0F} + bytesOf("abcdefghijklmno")},
        {"string of 300", std::string(300, 'x'), Data{0x5F, 0x11, 0x01, 0x2C} + Data(300, 'x')},
        {"e acute", "\u00E9", {0x61, 0x00, 0xE9}},
        {"last below surrogates", "\uD7FF", {0x61, 0xD7, 0xFF}},
        {"surrogate pair", "a\U0001F600", {0x63, 0x00, 0x61, 0xD8, 0x3D, 0xDE, 0x00}},
        {"last character", "\U0010FFFF", {0x62, 0xDB, 0xFF, 0xDF, 0xFF}},
        {"data", Data{1, 2, 3}, {0x43, 1, 2, 3}},
        {"empty array", Array{}, {0xA0}},
        {"empty dictionary", Dictionary{}, {0xD0}},
    };
    return rows;
}

} // namespace

// Goal: a scalar has exactly the bytes of the format. Method: hand-derived object bytes, both directions.
TEST(BinaryForm, ScalarsBothWays) {
    for (const Scalar& row : scalars()) {
        const auto written = writeBinary(row.value);
        ASSERT_TRUE(written) << row.name;
        EXPECT_EQ(*written, wholeListOf(row.object)) << row.name;
        const auto read = readBinary(wholeListOf(row.object));
        ASSERT_TRUE(read) << row.name << ": " << read.error().text();
        EXPECT_EQ(*read, row.value) << row.name;
    }
}

// Goal: a whole file is right to the byte, and follows what a buffer already holds. Method: one message, by hand.
TEST(BinaryForm, WholeMessageBothWays) {
    const Value message(Dictionary{{"b", Array{Value(true), Value("x")}}, {"a", 7}});
    const Data expected = bytesOf("bplist00") + Data{0xD2, 1, 3, 2, 4} + // at 8: two keys, two values
                          Data{0x51, 'a'} + Data{0x10, 7} +              // at 13, 15
                          Data{0x51, 'b'} + Data{0xA2, 5, 6} +           // at 17, 19
                          Data{0x09} + Data{0x51, 'x'} +                 // at 22, 23
                          Data{8, 13, 15, 17, 19, 22, 23} +              // at 25: the table
                          Data{0, 0, 0, 0, 0, 0, 1, 1} + Data{0, 0, 0, 0, 0, 0, 0, 7} + Data(8, 0) +
                          Data{0, 0, 0, 0, 0, 0, 0, 25};
    Data buffer{0xAA, 0xBB};
    ASSERT_TRUE(appendBinary(message, buffer));
    EXPECT_EQ(buffer, Data({0xAA, 0xBB}) + expected);
    const auto read = readBinary(expected);
    ASSERT_TRUE(read) << read.error().text();
    EXPECT_EQ(*read, message);
}

// Goal: forms that only other writers make are read. Method: objects by hand, with the value they stand for.
TEST(BinaryForm, FormsOfOtherWriters) {
    const struct {
        const char* name;
        Data bytes;
        Value value;
    } rows[] = {
        {"real of four bytes", wholeListOf({0x22, 0x3F, 0xC0, 0, 0}), 1.5},
        {"small number in 16 bytes", wholeListOf(Data{0x14} + Data(15, 0) + Data{9}), 9},
        {"small number in 8 bytes", wholeListOf({0x13, 0, 0, 0, 0, 0, 0, 0, 9}), 9},
        {"short count spelled out", wholeListOf({0x5F, 0x13, 0, 0, 0, 0, 0, 0, 0, 1, 'a'}), "a"},
        {"ASCII in UTF-16", wholeListOf({0x61, 0, 'a'}), "a"},
        {"root is not the first", assemble({{0x08}, {0xA1, 0}}, {.root = 1}), Array{Value(false)}},
        {"offsets of 8, references of 3", assemble({{0xA1, 0, 0, 1}, {0x09}}, {.offsetWidth = 8, .referenceWidth = 3}),
         Array{Value(true)}},
        {"one string as key and values", assemble({{0xD1, 1, 2}, {0x51, 'k'}, {0xA3, 1, 1, 1}}),
         Dictionary{{"k", Array{Value("k"), Value("k"), Value("k")}}}},
        {"shared empty container", assemble({{0xA2, 1, 1}, {0xD0}}), Array{Value(Dictionary{}), Value(Dictionary{})}},
        {"keys out of order, one twice: the later counts",
         assemble({{0xD3, 1, 2, 1, 3, 3, 4}, {0x51, 'z'}, {0x51, 'a'}, {0x10, 1}, {0x10, 2}}),
         Dictionary{{"a", 1}, {"z", 2}}},
    };
    for (const auto& row : rows) {
        const auto read = readBinary(row.bytes);
        ASSERT_TRUE(read) << row.name << ": " << read.error().text();
        EXPECT_EQ(*read, row.value) << row.name;
    }
}

// Goal: what cannot be read back is not written, and the caller's buffer stays as it was. Method: strings that are no
// UTF-8 (cut off, overlong, surrogates, above the last character) or hold NUL, and too deep a value.
TEST(BinaryForm, RefusesToWrite) {
    using namespace std::string_literals;
    std::vector<Value> values = {Dictionary{{"\xFF", 1}}, Array{Value("fine"), Value("\xFF")}, nestedArrays(65)};
    for (const std::string& text : {"\xC3"s, "a\x80"s, "\xC0\xAF"s, "\xE0\x9F\xBF"s, "\xF0\x8F\xBF\xBF"s,
                                    "\xED\xA0\x80"s, "\xF4\x90\x80\x80"s, "a\0b"s, "\u00E9\0"s})
        values.emplace_back(text);
    for (const Value& value : values) {
        Data buffer{1, 2, 3};
        const auto done = appendBinary(value, buffer);
        ASSERT_FALSE(done) << describe(&value);
        EXPECT_STRNE(done.error().reason, "");
        EXPECT_EQ(buffer, Data({1, 2, 3}));
    }
}

// Goal: widths of offsets and references grow where they must. Method: arrays on both sides of each step, read back.
TEST(BinaryForm, WidthSteps) {
    for (const std::size_t count : {14U, 15U, 254U, 255U, 65534U, 65535U}) {
        const Value value(Array(count, Value(true)));
        const auto written = writeBinary(value);
        ASSERT_TRUE(written);
        EXPECT_EQ((*written)[written->size() - 32 + 7], count < 255 ? 1 : count < 65535 ? 2 : 4) << count;
        EXPECT_TRUE(readBinary(*written) == value) << count;
    }
}

namespace {

Value randomValue(std::mt19937& random, int depth = 0) {
    const std::size_t kind = random() % (depth < 5 ? 9 : 7);
    const auto scalar = [&]() -> const Value& { return scalars()[random() % scalars().size()].value; };
    if (kind < 7)
        return scalar();
    Array values;
    Dictionary entries;
    for (std::size_t i = random() % 20; i > 0; --i) {
        if (kind == 7)
            values.push_back(randomValue(random, depth + 1));
        else
            entries.set(describe(&scalar()), randomValue(random, depth + 1));
    }
    return kind == 7 ? Value(values) : Value(entries);
}

} // namespace

// Goal: any value survives, and equal values have equal bytes. Method: seeded random trees of the scalars, written,
// read, written again.
TEST(BinaryForm, RandomRoundTrip) {
    for (std::uint32_t seed = 1; seed <= 1000; ++seed) {
        std::mt19937 random(seed);
        const Value value = randomValue(random);
        const auto written = writeBinary(value);
        ASSERT_TRUE(written) << "seed " << seed;
        const auto read = readBinary(*written);
        ASSERT_TRUE(read) << "seed " << seed << ": " << read.error().text();
        ASSERT_EQ(*read, value) << "seed " << seed;
        ASSERT_EQ(*writeBinary(*read), *written) << "seed " << seed;
    }
}

} // namespace zor::plist::test
