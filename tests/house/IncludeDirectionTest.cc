// SPDX-License-Identifier: Apache-2.0
// Goal: no folder includes what lies above it. Method: every quoted include below src/, client/ and tools/ is resolved
// to a file and its folder looked up in the table of docs/architecture.md; a table row that names no folder fails as
// well.
#include "house/SourceTree.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <map>
#include <regex>
#include <set>

namespace zor::house {
namespace {

/// What one row of the table allows: folders, or single headers.
struct Rule {
    std::set<std::string> all;
    std::set<std::string> sourcesToo;
};

using Rules = std::map<std::string, Rule>;

std::set<std::string> backticked(const std::string& cell) {
    static const std::regex quoted("`([^`]*)`");
    std::set<std::string> names;
    for (std::sregex_iterator at(cell.begin(), cell.end(), quoted); at != std::sregex_iterator(); ++at)
        names.insert((*at)[1]);
    return names;
}

/// Rows are "| `folder` | may include | sources also |" with a folder below src/, client/ or tools/ in the first cell.
Rules rulesOf(std::string_view page) {
    static const std::regex row("\\|([^|]*)\\|([^|]*)\\|([^|]*)\\|");
    Rules rules;
    std::set<std::string> above;
    for (const std::string_view line : splitLines(page)) {
        std::cmatch cells;
        if (!std::regex_match(line.begin(), line.end(), cells, row) || backticked(cells[1]).size() != 1)
            continue;
        const std::string folder = *backticked(cells[1]).begin();
        Rule& rule = rules[folder];
        rule.all = backticked(cells[2]);
        rule.all.insert(folder);
        if (cells[2].str().find("all above") != std::string::npos)
            rule.all.insert(above.begin(), above.end());
        rule.sourcesToo = backticked(cells[3]);
        if (folder.starts_with("src/") && folder != "src/platform/linux")
            above.insert(folder);
    }
    return rules;
}

std::string folderOf(const std::string& path) {
    return path.substr(0, path.rfind('/'));
}

/// The row a file falls under: its folder, or the nearest one above it that the table names.
std::string ruleFolderOf(const Rules& rules, const std::string& path) {
    for (std::string folder = folderOf(path); folder.find('/') != folder.npos; folder = folderOf(folder))
        if (rules.contains(folder))
            return folder;
        else if (folder.starts_with("src/"))
            break; // below src/ every folder has its own row
    return path.starts_with("client/") ? "client" : "";
}

/// The file that an include names; empty when there is none. Below src/ only names relative to src/ count.
std::string resolve(const std::set<std::string>& paths, const std::string& from, const std::string& name) {
    std::vector<std::string> bases = {"src/"};
    if (!from.starts_with("src/"))
        bases = {folderOf(from) + "/", "src/", "client/include/", "client/"};
    const auto base = std::ranges::find_if(bases, [&](const std::string& at) { return paths.contains(at + name); });
    return base == bases.end() ? "" : *base + name;
}

std::set<std::string> pathsOf(const std::vector<SourceFile>& files) {
    std::set<std::string> paths;
    for (const SourceFile& file : files)
        paths.insert(file.path);
    return paths;
}

/// One line for each include that the rules do not allow.
std::vector<std::string> judge(const Rules& rules, const std::vector<SourceFile>& files) {
    const std::set<std::string> paths = pathsOf(files);
    std::vector<std::string> faults;
    for (const SourceFile& file : files) {
        const std::string folder = ruleFolderOf(rules, file.path);
        if (folder.empty()) {
            faults.push_back(file.path + ": its folder is not in docs/architecture.md");
            continue;
        }
        const Rule& rule = rules.at(folder);
        for (const Include& include : quotedIncludes(file.text)) {
            const std::string place = file.path + ":" + std::to_string(include.line) + ": \"" + include.name + "\" ";
            const std::string target = resolve(paths, file.path, include.name);
            if (target.empty()) {
                faults.push_back(place + "is no file of ours (below src/, names are relative to src/)");
                continue;
            }
            const auto names = [&](const std::set<std::string>& allowed) {
                return allowed.contains(target) || allowed.contains(ruleFolderOf(rules, target));
            };
            if (!names(rule.all) && !(file.path.ends_with(".cc") && names(rule.sourcesToo)))
                faults.push_back(place + "may not be included from " + folder + " (docs/architecture.md)");
        }
    }
    return faults;
}

/// Headers that are on a circle of includes or behind one: what is left when those that include none of the others are
/// taken away until nothing changes.
std::vector<std::string> circles(const std::vector<SourceFile>& files) {
    const std::set<std::string> paths = pathsOf(files);
    std::map<std::string, std::set<std::string>> reaches;
    for (const SourceFile& file : files)
        for (const Include& include : quotedIncludes(file.text))
            reaches[file.path].insert(resolve(paths, file.path, include.name));
    std::set<std::string> left = paths;
    while (std::erase_if(left, [&](const std::string& path) {
               return std::ranges::none_of(reaches[path], [&](const std::string& to) { return left.contains(to); });
           }) != 0) {
    }
    return {left.begin(), left.end()};
}

const std::vector<std::string> codeFolders = {"src", "client", "tools"};

TEST(IncludeDirection, EveryIncludeFollowsTheTable) {
    const Rules rules = rulesOf(readFile(checkoutRoot() + "/docs/architecture.md"));
    ASSERT_GE(rules.size(), 10U) << "the table was not found";
    const std::vector<SourceFile> files = filesBelow(codeFolders, {".h", ".cc"});
    ASSERT_FALSE(files.empty());
    EXPECT_EQ(joinLines(judge(rules, files)), "");
}

TEST(IncludeDirection, TheTableNamesOnlyWhatExists) {
    for (const auto& [folder, rule] : rulesOf(readFile(checkoutRoot() + "/docs/architecture.md"))) {
        std::set<std::string> names = rule.all;
        names.insert(rule.sourcesToo.begin(), rule.sourcesToo.end());
        for (const std::string& name : names)
            EXPECT_TRUE(std::filesystem::exists(checkoutRoot() + "/" + name)) << folder << " names " << name;
    }
}

TEST(IncludeDirection, HeadersFormNoCircle) {
    EXPECT_EQ(joinLines(circles(filesBelow(codeFolders, {".h"}))), "");
}

// The judge itself on a made-up tree: one row for each verdict it can give.
TEST(IncludeDirection, TheJudgeTellsGoodFromBad) {
    const Rules rules = rulesOf("| `src/low` | nothing | |\n"
                                "| `src/platform/linux` | all above | |\n"
                                "| `src/mid` | all above | `src/top/Hub.h` |\n"
                                "| `src/top` | all above, `src/platform/linux` | |\n"
                                "| `client` | `src/low` | |\n");
    const struct {
        const char* path;
        const char* include;
        bool allowed;
    } cases[] = {
        {"src/mid/A.h", "low/Low.h", true},
        {"src/low/A.cc", "mid/Mid.h", false},
        {"src/mid/A.cc", "top/Hub.h", true},
        {"src/mid/A.h", "top/Hub.h", false},
        {"src/mid/A.cc", "top/Top.h", false},
        {"src/mid/A.cc", "Mid.h", false},
        {"src/mid/A.cc", "platform/linux/P.h", false},
        {"src/top/A.cc", "platform/linux/P.h", true},
        {"src/new/A.cc", "low/Low.h", false},
        {"client/A.cc", "low/Low.h", true},
        {"client/A.cc", "mid/Mid.h", false},
        {"src/top/A.cc", "top/Absent.h", false},
    };
    for (const auto& row : cases) {
        std::vector<SourceFile> files = {
            {row.path, "// #include \"no/such.h\"\n#include \"" + std::string(row.include) + "\"\n"}};
        for (const char* header :
             {"src/low/Low.h", "src/mid/Mid.h", "src/top/Hub.h", "src/top/Top.h", "src/platform/linux/P.h"})
            files.push_back({header, ""});
        EXPECT_EQ(judge(rules, files).empty(), row.allowed) << row.path << " includes " << row.include;
    }
    const std::vector<SourceFile> circle = {
        {"src/low/A.h", "#include \"low/B.h\"\n"}, {"src/low/B.h", "#include \"low/A.h\"\n"}, {"src/low/C.h", ""}};
    EXPECT_EQ(joinLines(circles(circle)), "src/low/A.h\nsrc/low/B.h\n");
}

} // namespace
} // namespace zor::house
