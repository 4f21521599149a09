// SPDX-License-Identifier: Apache-2.0
#include "plist/Value.h"
#include "plist/Samples.h"

#include <gtest/gtest.h>

namespace zor::plist::test {

// Goal: a dictionary stays sorted with unique keys through every change. Method: changes in a bad order, then a walk.
TEST(Value, DictionaryStaysSorted) {
    Dictionary entries{{"m", 1}, {"z", 2}, {"a", 3}, {"m", 4}};
    entries.set("b", 5);
    entries.set("z", 6);
    entries.set("zz", 7);
    EXPECT_TRUE(entries.erase("a"));
    EXPECT_FALSE(entries.erase("a"));
    EXPECT_FALSE(entries.erase("n"));
    std::string walk;
    for (const auto& [key, value] : entries)
        walk += key + "=" + describe(&value) + " ";
    EXPECT_EQ(walk, "b=5 m=4 z=6 zz=7 ");
    EXPECT_EQ(entries.find("mm"), nullptr);
    EXPECT_EQ(entries, (Dictionary{{"zz", 7}, {"z", 6}, {"m", 4}, {"b", 5}}));
}

// Goal: typed reads never take one type for another. Method: every getter on a key of every type.
TEST(Value, TypedReads) {
    const Dictionary entries{{"boolean", true},
                             {"string", "s"},
                             {"data", Data{1}},
                             {"array", Array{}},
                             {"dictionary", Dictionary{}},
                             {"one", 1},
                             {"negative", -1},
                             {"big", ~std::uint64_t{0}}};
    for (const auto& [key, value] : entries) {
        EXPECT_EQ(entries.string(key) != nullptr, key == "string");
        EXPECT_EQ(entries.data(key) != nullptr, key == "data");
        EXPECT_EQ(entries.array(key) != nullptr, key == "array");
        EXPECT_EQ(entries.dictionary(key) != nullptr, key == "dictionary");
        EXPECT_EQ(entries.isTrue(key), key == "boolean");
        EXPECT_EQ(entries.unsignedInteger(key).has_value(), key == "one" || key == "big");
        EXPECT_EQ(value.asSigned().has_value(), key == "one" || key == "negative");
    }
    EXPECT_EQ(Value(std::uint64_t{5}), Value(5));
    EXPECT_EQ(entries.unsignedInteger("big"), ~std::uint64_t{0});
    EXPECT_EQ(entries.string("missing"), nullptr);
}

// Goal: a description is one line of bounded length whatever the value holds. Method: a table of values and texts.
TEST(Value, Descriptions) {
    const struct {
        Value value;
        std::size_t bytesMax;
        const char* text;
    } rows[] = {
        {Dictionary{{"k", Array{Value(1), Value(0.5), Value(true), Value(Date{2})}}}, 100,
         "{\"k\" = [1, 0.5, true, date 2]}"},
        {"a\"\\\n\r\x1B\x7F\u0085\u2028\u00E9", 100, "\"a\\\"\\\\\\n\\u000d\\u001b\\u007f\\u0085\\u2028\u00E9\""},
        {std::string("\xFF\0", 2), 100, "\"\\xff\\u0000\""},
        {Data{0x00, 0xAB}, 100, "<00ab>"},
        {"0123456789", 12, "\"0123456789\""},
        {"0123456789", 11, "\"0123456..."},
        {"0123\u00E9", 9, "\"0123\u00E9\""},
        {"01234\u00E9\u00E9\u00E9", 10, "\"01234..."},
        {Data(1000000, 0xAA), 8, "<aaaa..."},
        {"abc", 2, ".."},
        {"abc", 0, ""},
    };
    for (const auto& row : rows)
        EXPECT_EQ(describe(&row.value, row.bytesMax), row.text);
    EXPECT_EQ(describe(nullptr), "(null)");
    const Value deep = nestedArrays(1000);
    EXPECT_EQ(describe(&deep), std::string(64, '[') + "[...]" + std::string(64, ']'));
}

} // namespace zor::plist::test
