// SPDX-License-Identifier: Apache-2.0
// Goal: docs/coverage.md is believed, so it lists what the sources have, neither more nor less, and no test in it is
// named for what it does not provoke. Method: the formats and codes in the sources against the page's rows, on every
// run; with the recordings of `./dev coverage` ($ZORVANE_RECORDINGS: a file for each test, with the formats it
// printed), every row against its test's recording. $ZORVANE_COVERAGE_WRITE rewrites the rows instead, keeping tests
// and reasons that hold.
#include "house/Messages.h"
#include "house/SourceTree.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <set>

namespace zor::house {
namespace {

constexpr const char* pagePath = "/docs/coverage.md";
constexpr const char* codesHead = "| Code | Name | Test |\n|---|---|---|\n";
constexpr const char* messagesHead = "| Message | Codes | Test |\n|---|---|---|\n";
constexpr const char* noTest = "none: ";

std::string cell(std::string text) {
    for (std::size_t at = 0; (at = text.find('|', at)) != text.npos; at += 2)
        text.insert(at, "\\");
    return text;
}

std::string joined(const std::set<std::string>& words) {
    std::string text;
    for (const std::string& word : words)
        text += (text.empty() ? "" : ", ") + word;
    return text;
}

/// The last cell of every row, by what stands before it. A row that comes twice is noted as a fault.
std::map<std::string, std::string> rowsOf(const std::string& page, std::vector<std::string>& faults) {
    std::map<std::string, std::string> rows;
    for (const std::string_view line : splitLines(page)) {
        const std::size_t last = line.ends_with(" |") ? line.rfind("| ", line.size() - 3) : line.npos;
        if (!line.starts_with("| ") || last == line.npos || line.starts_with("| Code") || line.starts_with("| Message"))
            continue;
        const std::string before(line.substr(0, last + 2));
        if (!rows.emplace(before, line.substr(last + 2, line.size() - last - 4)).second)
            faults.push_back("twice: " + before);
    }
    return rows;
}

/// Formats in their printed form that each test printed. A test that is gone may have left its recording.
std::map<std::string, std::set<std::string>> recordings() {
    std::map<std::string, std::set<std::string>> all;
    const std::set<std::string> tests = testNames();
    for (const auto& file : std::filesystem::directory_iterator(std::getenv("ZORVANE_RECORDINGS"))) {
        const std::string text = tests.contains(file.path().filename()) ? readFile(file.path()) : "";
        for (const std::string_view line : splitLines(text))
            all[file.path().filename()].emplace(line);
    }
    return all;
}

/// A row and the formats of which its test has to print one.
struct Claim {
    std::string row;
    std::set<std::string> formats;
};

std::vector<Claim> codeClaims() {
    std::map<std::string, std::set<std::string>> formats;
    for (const auto& [format, codes] : messagesOfTheDaemon())
        for (const std::string& code : codes)
            formats[code].insert(printedForm(format));
    std::vector<Claim> claims;
    for (const auto& [name, number] : errorCodes())
        claims.push_back({"| " + std::to_string(number) + " | `" + name + "` | ", formats[name]});
    std::ranges::sort(claims, {}, [](const Claim& claim) { return std::stoi(claim.row.substr(2)); });
    return claims;
}

std::vector<Claim> messageClaims() {
    std::vector<Claim> claims;
    for (const auto& [format, codes] : messagesOfTheDaemon())
        claims.push_back({"| `" + cell(format) + "` | " + joined(codes) + " | ", {printedForm(format)}});
    return claims;
}

std::vector<Claim> allClaims() {
    std::vector<Claim> claims = codeClaims();
    std::ranges::move(messageClaims(), std::back_inserter(claims));
    return claims;
}

bool provokes(const std::set<std::string>& printed, const Claim& claim) {
    return std::ranges::any_of(claim.formats, [&](const std::string& format) { return printed.contains(format); });
}

/// A row's last cell: what it is while that holds; else the test that provokes it and prints the least besides, the one
/// that is about it.
std::string lastCell(const std::map<std::string, std::string>& rows, const Claim& claim,
                     const std::map<std::string, std::set<std::string>>& recorded) {
    const auto row = rows.find(claim.row);
    const std::string now = row == rows.end() ? noTest : row->second;
    if (const auto recording = recorded.find(now); recording != recorded.end() && provokes(recording->second, claim))
        return now;
    std::string best = now.starts_with(noTest) ? now : noTest;
    std::size_t least = SIZE_MAX;
    for (const auto& [test, printed] : recorded)
        if (provokes(printed, claim) && printed.size() < least) {
            best = test;
            least = printed.size();
        }
    return best;
}

TEST(CoveragePage, HasOneRowForEveryMessageAndCode) {
    if (std::getenv("ZORVANE_COVERAGE_WRITE"))
        GTEST_SKIP() << "it is being written";
    EXPECT_EQ(unknownFormatFunctions(), std::vector<std::string>{});
    std::vector<std::string> faults;
    auto rows = rowsOf(readFile(checkoutRoot() + pagePath), faults);
    const std::set<std::string> tests = testNames();
    const std::vector<Claim> claims = allClaims();
    ASSERT_GT(claims.size(), 200U);
    for (const Claim& claim : claims) {
        const auto row = rows.find(claim.row);
        if (row == rows.end())
            faults.push_back("missing: " + claim.row);
        else if (!row->second.starts_with(noTest) && !tests.contains(row->second))
            faults.push_back("no such test: " + row->second);
        else if (row->second == noTest)
            faults.push_back("no test and no reason: " + claim.row);
        rows.erase(claim.row);
    }
    for (const auto& [before, test] : rows)
        faults.push_back("nothing in the sources: " + before);
    EXPECT_EQ(faults, std::vector<std::string>{}) << "`./dev coverage --write` writes the page anew";
}

TEST(CoveragePage, NamesTestsThatProvoke) {
    if (!std::getenv("ZORVANE_RECORDINGS") || std::getenv("ZORVANE_COVERAGE_WRITE"))
        GTEST_SKIP() << "`./dev coverage` records the tests for it";
    std::vector<std::string> faults;
    const auto rows = rowsOf(readFile(checkoutRoot() + pagePath), faults);
    const auto recorded = recordings();
    for (const Claim& claim : allClaims())
        if (const std::string test = lastCell(rows, claim, recorded);
            rows.contains(claim.row) && rows.at(claim.row) != test)
            faults.push_back(rows.at(claim.row) + " should be " + test + ": " + claim.row);
    EXPECT_EQ(faults, std::vector<std::string>{});
}

TEST(CoveragePage, IsWritten) {
    if (!std::getenv("ZORVANE_RECORDINGS") || !std::getenv("ZORVANE_COVERAGE_WRITE"))
        GTEST_SKIP() << "`./dev coverage --write` does it";
    std::vector<std::string> faults;
    const std::string old = readFile(checkoutRoot() + pagePath);
    const auto rows = rowsOf(old, faults);
    const auto recorded = recordings();
    const auto table = [&](const std::vector<Claim>& claims) {
        std::string text;
        for (const Claim& claim : claims)
            text += claim.row + lastCell(rows, claim, recorded) + " |\n";
        return text;
    };
    const std::string head = old.substr(0, old.find("## Codes"));
    std::ofstream(checkoutRoot() + pagePath) << head << "## Codes\n\n"
                                             << codesHead << table(codeClaims()) << "\n## Messages\n\n"
                                             << messagesHead << table(messageClaims());
}

// Every form in which a message stands in a source, and what only looks like one.
TEST(CoveragePage, ReadsMessagesOfEveryForm) {
    Messages found;
    addMessages(
        found,
        "log.write(logLevelError, f, \"a \\\"%s\\\", \"\n    \"b (%u)\", g(1, 2));\n"
        "return makeError(log_, {f, __LINE__}, x ? ErrorCode::one : ErrorCode::two, nullptr, LogFlag::no, \"c\");\n"
        "fail(ErrorCode::three, formatted(late ? \"d\" : \"e\"));\n"
        "disk.write(fd, {\"f\", 1}); rewrite(a, b, \"g\"); posixError(here, 2, format); write(a, b, text(\"h\"));\n");
    std::string text;
    for (const auto& [format, codes] : found)
        text += format + "=" + joined(codes) + ";";
    EXPECT_EQ(text, "a \\\"%s\\\", b (%u)=;c=one, two;d=three;e=three;");
    EXPECT_EQ(printedForm("\\t\\\"%s\\\"\\n"), "\t\"%s\"\\n");
}

} // namespace
} // namespace zor::house
