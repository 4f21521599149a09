// SPDX-License-Identifier: Apache-2.0
// Goal: no folder includes what lies above it. Method: every quoted include below src/, client/ and tools/ is resolved
// to a file and its folder looked up in the table of docs/architecture.md; a table row that names no folder fails as
// well.
#include "house/SourceTree.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <map>
#include <set>

namespace zor::house {
namespace {

/// What one row of the table allows: folders, or single headers.
struct Rule {
    std::set<std::string> all;
    std::set<std::string> sourcesToo;
};

using Rules = std::map<std::string, Rule>;

std::vector<std::string> backticked(std::string_view cell) {
    std::vector<std::string> names;
    while (true) {
        const std::size_t open = cell.find('`');
        const std::size_t close = cell.find('`', open == cell.npos ? open : open + 1);
        if (close == cell.npos) {
            return names;
        }
        names.emplace_back(cell.substr(open + 1, close - open - 1));
        cell.remove_prefix(close + 1);
    }
}

/// Rows are "| `folder` | may include | sources also |" with a folder below src/, client/ or tools/ in the first cell.
Rules rulesOf(std::string_view page) {
    Rules rules;
    std::vector<std::string> above;
    for (std::string_view line : splitLines(page)) {
        std::vector<std::string_view> cells;
        while (line.starts_with('|') && line.size() > 1) {
            line.remove_prefix(1);
            cells.push_back(line.substr(0, line.find('|')));
            line.remove_prefix(cells.back().size());
        }
        if (cells.size() != 3 || backticked(cells[0]).size() != 1) {
            continue;
        }
        const std::string folder = backticked(cells[0]).front();
        Rule& rule = rules[folder];
        rule.all.insert(folder);
        for (std::string& name : backticked(cells[1])) {
            rule.all.insert(std::move(name));
        }
        if (cells[1].find("all above") != cells[1].npos) {
            rule.all.insert(above.begin(), above.end());
        }
        for (std::string& name : backticked(cells[2])) {
            rule.sourcesToo.insert(std::move(name));
        }
        if (folder.starts_with("src/") && folder != "src/platform/linux") {
            above.push_back(folder);
        }
    }
    return rules;
}

std::string folderOf(const std::string& path) {
    return path.substr(0, path.rfind('/'));
}

/// The row a file falls under: its folder, or the nearest one above it that the table names.
std::string ruleFolderOf(const Rules& rules, const std::string& path) {
    for (std::string folder = folderOf(path); folder.find('/') != folder.npos; folder = folderOf(folder)) {
        if (rules.contains(folder)) {
            return folder;
        }
        if (folder.starts_with("src/")) {
            break; // below src/ every folder has its own row
        }
    }
    return path.starts_with("client/") ? "client" : "";
}

/// The file that an include names; empty when there is none. Below src/ only names relative to src/ count.
std::string resolve(const std::set<std::string>& paths, const std::string& from, const std::string& name) {
    std::vector<std::string> bases = {"src/", "client/include/", "client/"};
    if (from.starts_with("src/")) {
        bases = {"src/"};
    } else {
        bases.insert(bases.begin(), folderOf(from) + "/");
    }
    for (const std::string& base : bases) {
        if (paths.contains(base + name)) {
            return base + name;
        }
    }
    return {};
}

/// One line for each include that the rules do not allow.
std::vector<std::string> judge(const Rules& rules, const std::vector<SourceFile>& files) {
    std::set<std::string> paths;
    for (const SourceFile& file : files) {
        paths.insert(file.path);
    }
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
            if (!names(rule.all) && !(file.path.ends_with(".cc") && names(rule.sourcesToo))) {
                faults.push_back(place + "may not be included from " + folder + " (docs/architecture.md)");
            }
        }
    }
    return faults;
}

/// Headers that include each other, directly or through others: one line for each header on a circle.
std::vector<std::string> circles(const std::vector<SourceFile>& files) {
    std::set<std::string> paths;
    for (const SourceFile& file : files) {
        paths.insert(file.path);
    }
    std::map<std::string, std::set<std::string>> reaches;
    for (const SourceFile& file : files) {
        for (const Include& include : quotedIncludes(file.text)) {
            reaches[file.path].insert(resolve(paths, file.path, include.name));
        }
    }
    // Headers that include none of those left are taken away until nothing changes; what stays is on a circle or behind
    // one.
    std::set<std::string> left = paths;
    const auto isDone = [&](const std::string& path) {
        return std::ranges::none_of(reaches[path], [&](const std::string& to) { return left.contains(to); });
    };
    while (std::erase_if(left, isDone) != 0) {
    }
    return {left.begin(), left.end()};
}

std::string joined(const std::vector<std::string>& lines) {
    std::string text;
    for (const std::string& line : lines) {
        text += line + "\n";
    }
    return text;
}

const std::vector<std::string> codeFolders = {"src", "client", "tools"};

TEST(IncludeDirection, EveryIncludeFollowsTheTable) {
    const Rules rules = rulesOf(readFile(checkoutRoot() + "/docs/architecture.md"));
    ASSERT_GE(rules.size(), 10U) << "the table was not found";
    const std::vector<SourceFile> files = filesBelow(codeFolders, {".h", ".cc"});
    ASSERT_FALSE(files.empty());
    EXPECT_EQ(joined(judge(rules, files)), "");
}

TEST(IncludeDirection, TheTableNamesOnlyWhatExists) {
    for (const auto& [folder, rule] : rulesOf(readFile(checkoutRoot() + "/docs/architecture.md"))) {
        std::set<std::string> names = rule.all;
        names.insert(rule.sourcesToo.begin(), rule.sourcesToo.end());
        for (const std::string& name : names) {
            EXPECT_TRUE(std::filesystem::exists(checkoutRoot() + "/" + name)) << folder << " names " << name;
        }
    }
}

TEST(IncludeDirection, HeadersFormNoCircle) {
    EXPECT_EQ(joined(circles(filesBelow(codeFolders, {".h"}))), "");
}

// The judge itself on a made-up tree: one row for each verdict it can give.
TEST(IncludeDirection, TheJudgeTellsGoodFromBad) {
    const Rules rules = rulesOf("| `src/low` | nothing | |\n"
                                "| `src/platform/linux` | all above | |\n"
                                "| `src/mid` | all above | `src/top/Hub.h` |\n"
                                "| `src/top` | all above, `src/platform/linux` | |\n"
                                "| `client` | `src/low` | |\n");
    struct Case {
        const char* path;
        const char* include;
        bool allowed;
    };
    const Case cases[] = {
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
    for (const Case& row : cases) {
        std::vector<SourceFile> files = {{"src/low/Low.h", ""},
                                         {"src/mid/Mid.h", ""},
                                         {"src/top/Hub.h", ""},
                                         {"src/top/Top.h", ""},
                                         {"src/platform/linux/P.h", ""}};
        files.push_back({row.path, "// #include \"no/such.h\"\n#include \"" + std::string(row.include) + "\"\n"});
        EXPECT_EQ(judge(rules, files).empty(), row.allowed) << row.path << " includes " << row.include;
    }
    const std::vector<SourceFile> circle = {
        {"src/low/A.h", "#include \"low/B.h\"\n"}, {"src/low/B.h", "#include \"low/A.h\"\n"}, {"src/low/C.h", ""}};
    EXPECT_EQ(joined(circles(circle)), "src/low/A.h\nsrc/low/B.h\n");
}

} // namespace
} // namespace zor::house
