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
    const Dictionary entries{{"boolean", true}, {"string", "s"},
                             {"data", Data{1}}, {"array", Array{}},
                             {"one", 1},        {"dictionary", Dictionary{}},
                             {"negative", -1},  {"big", ~std::uint64_t{0}}};
    for (const auto& [key, value] : entries) {
        EXPECT_EQ(entries.string(key) != nullptr, key == "string");
        EXPECT_EQ(entries.data(key) != nullptr, key == "data");
        EXPECT_EQ(entries.array(key) != nullptr, key == "array");
        EXPECT_EQ(entries.dictionary(key) != nullptr, key == "dictionary");
        EXPECT_EQ(entries.isTrue(key), key == "boolean");
        EXPECT_EQ(entries.unsignedInteger(key).has_value(), key == "one" || key == "big");
        EXPECT_EQ(value.asSigned().has_value(), key == "one" || key == "negative");
    }
}

} // namespace zor::plist::test
