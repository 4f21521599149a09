// SPDX-License-Identifier: Apache-2.0
// Goal: a page that says which test holds a promise is believed, so it may name none that is gone. Method: every
// `Suite.Name` in docs/security.md is looked for among the tests, and every row has one.
#include "house/SourceTree.h"

#include <gtest/gtest.h>

#include <regex>
#include <set>

namespace zor::house {
namespace {

TEST(SecurityPage, NamesTestsThatExist) {
    static const std::regex named(R"(`(\w+\.\w+)`)");
    const std::set<std::string> tests = testNames();
    ASSERT_TRUE(tests.contains("SecurityPage.NamesTestsThatExist"));
    const std::string page = readFile(checkoutRoot() + "/docs/security.md");
    int rows = 0;
    for (const std::string_view view : splitLines(page)) {
        const std::string line(view);
        if (!line.starts_with("| **"))
            continue;
        ++rows;
        std::sregex_iterator at(line.begin(), line.end(), named);
        EXPECT_NE(at, std::sregex_iterator()) << "no test: " << line;
        for (; at != std::sregex_iterator(); ++at)
            EXPECT_TRUE(tests.contains((*at)[1].str())) << (*at)[1].str();
    }
    EXPECT_GE(rows, 10);
}

} // namespace
} // namespace zor::house
