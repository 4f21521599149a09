// SPDX-License-Identifier: Apache-2.0
// Goal: what reviewers would else have to look for: calls that pass by the layer that owns them, checks that were
// silenced, leftovers. Method: tables of words over the sources; each table row carries text that it must flag.
#include "house/SourceTree.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cctype>

namespace zor::house {
namespace {

/// Where a word counts: in code, in code and literals, or anywhere, comments included.
enum class Within { code, codeAndLiterals, text };

struct Rule {
    const char* word;
    Within within;
    /// Folders (or files) in which the word may stand.
    std::vector<std::string> except;
    const char* instead;
};

// Clients and tools run with their user's own rights, on their user's own paths.
const std::vector<std::string> kernelFolders = {"src/fs/", "src/platform/linux/", "client/", "tools/"};
const std::vector<std::string> diskFolders = {"src/platform/linux/", "client/", "tools/"};
const std::vector<std::string> lockHeader = {"src/platform/Mutex.h"};
// Locks that are looked up by identifier are beyond what the analysis can follow.
const std::vector<std::string> sharedLocks = {"src/platform/Mutex.h", "src/daemon/base/ZORLocks"};
// A home may be reached through links that its administrator made; it is resolved once, from the password database.
const std::vector<std::string> homeFolders = {"src/fs/", "src/platform/linux/", "src/store/ZORPerUserConfiguration.cc"};
constexpr const char* descriptors = "a descriptor and src/fs: a path can be swapped between two calls";
constexpr const char* disk = "platform/Disk.h: crash tests have to see every change";
constexpr const char* annotated = "platform/Mutex.h: the lint build checks its locks";

// Words of the programs: src/, client/, tools/. A word that begins with "::" is the global function, not a member or
// another namespace's.
const std::vector<Rule>& programRules() {
    static const std::vector<Rule> rules = {
        {"std::filesystem", Within::code, {}, descriptors},
        {"<filesystem>", Within::code, {}, descriptors},
        {"std::ifstream", Within::code, {}, descriptors},
        {"std::ofstream", Within::code, {}, descriptors},
        {"std::fstream", Within::code, {}, descriptors},
        {"::open(", Within::code, kernelFolders, descriptors},
        {"::creat(", Within::code, kernelFolders, descriptors},
        {"::fopen(", Within::code, kernelFolders, descriptors},
        {"::stat(", Within::code, kernelFolders, descriptors},
        {"::lstat(", Within::code, kernelFolders, descriptors},
        {"::access(", Within::code, kernelFolders, descriptors},
        {"::opendir(", Within::code, kernelFolders, descriptors},
        {"::realpath(", Within::code, homeFolders, descriptors},
        {"::readlink(", Within::code, kernelFolders, descriptors},
        {"::truncate(", Within::code, diskFolders, disk},
        {"::rename(", Within::code, diskFolders, disk},
        {"::unlink(", Within::code, diskFolders, disk},
        {"::remove(", Within::code, diskFolders, disk},
        {"::rmdir(", Within::code, diskFolders, disk},
        {"::mkdir(", Within::code, diskFolders, disk},
        {"::link(", Within::code, diskFolders, disk},
        {"::symlink(", Within::code, diskFolders, disk},
        {"::chmod(", Within::code, diskFolders, disk},
        {"::chown(", Within::code, diskFolders, disk},
        {"::lchown(", Within::code, diskFolders, disk},
        {"::renameat(", Within::code, diskFolders, disk},
        {"::renameat2(", Within::code, diskFolders, disk},
        {"::unlinkat(", Within::code, diskFolders, disk},
        {"::mkdirat(", Within::code, diskFolders, disk},
        {"::linkat(", Within::code, diskFolders, disk},
        {"::symlinkat(", Within::code, diskFolders, disk},
        {"::fchmod(", Within::code, diskFolders, disk},
        {"::fchmodat(", Within::code, diskFolders, disk},
        {"::fchown(", Within::code, diskFolders, disk},
        {"::fchownat(", Within::code, diskFolders, disk},
        {"::ftruncate(", Within::code, diskFolders, disk},
        {"::fsetxattr(", Within::code, diskFolders, disk},
        {"::futimens(", Within::code, diskFolders, disk},
        {"::utimensat(", Within::code, diskFolders, disk},
        {"::fsync(", Within::code, diskFolders, disk},
        {"::fdatasync(", Within::code, diskFolders, disk},
        {"::syncfs(", Within::code, diskFolders, disk},
        {"::sync_file_range(", Within::code, diskFolders, disk},
        {"std::mutex", Within::code, lockHeader, annotated},
        {"std::recursive_mutex", Within::code, lockHeader, annotated},
        {"std::shared_mutex", Within::code, sharedLocks, annotated},
        {"std::lock_guard", Within::code, lockHeader, annotated},
        {"std::unique_lock", Within::code, lockHeader, annotated},
        {"std::scoped_lock", Within::code, lockHeader, annotated},
        {"std::condition_variable", Within::code, lockHeader, annotated},
        {"::accept(", Within::code, {}, "::accept4 with SOCK_CLOEXEC"},
        {"::dup(", Within::code, {}, "::fcntl with F_DUPFD_CLOEXEC"},
        {"::dup2(", Within::code, {}, "::dup3 with O_CLOEXEC"},
        {"::pipe(", Within::code, {}, "::pipe2 with O_CLOEXEC"},
        {"::epoll_create(", Within::code, {}, "::epoll_create1 with EPOLL_CLOEXEC"},
        {"::inotify_init(", Within::code, {}, "::inotify_init1 with IN_CLOEXEC"},
        {"sprintf", Within::code, {}, "std::snprintf, which knows the buffer's size"},
        {"strcpy", Within::code, {}, "std::string"},
        {"strcat", Within::code, {}, "std::string"},
        {"strtok", Within::code, {}, "std::string_view"},
        {"atoi", Within::code, {}, "std::from_chars, which tells a failure"},
        {"localtime", Within::code, {}, "localtime_r"},
        {"gmtime", Within::code, {}, "gmtime_r"},
        {"getpwuid", Within::code, {}, "the user database of the system root"},
        {"getpwnam", Within::code, {}, "the user database of the system root"},
        {"system(", Within::code, {}, "nothing: no shell is started by a daemon that serves hostile strings"},
        {"popen(", Within::code, {}, "nothing: no shell is started by a daemon that serves hostile strings"},
        {"const_cast", Within::code, {}, "a type that says what is changed"},
    };
    return rules;
}

// Words of every text in the checkout. Those that this file itself may not hold in one piece are split.
const std::vector<Rule>& textRules() {
    static const std::vector<Rule> rules = {
        {"#if "
         "0",
         Within::text,
         {},
         "removing the code: history keeps it"},
        {"FIX"
         "ME",
         Within::text,
         {},
         "doing it, or an issue"},
        {"TO"
         "DO",
         Within::text,
         {},
         "doing it, or an issue"},
        {"DISABLED"
         "_",
         Within::code,
         {},
         "a test that runs, or none"},
        {"specif"
         "ication",
         Within::text,
         {},
         "saying what this system does, in its own words"},
    };
    return rules;
}

bool isWordCharacter(char c) {
    return std::isalnum(static_cast<unsigned char>(c)) != 0 || c == '_';
}

/// Finds `word` where it stands alone: no letter, digit or underscore beside those ends that are one themselves, and no
/// name before a leading "::".
std::size_t findWord(std::string_view line, std::string_view word) {
    const bool wordBegins = isWordCharacter(word.front()) || word.starts_with("::");
    for (std::size_t at = line.find(word); at != line.npos; at = line.find(word, at + 1)) {
        const char before = at == 0 ? ' ' : line[at - 1];
        const std::size_t end = at + word.size();
        const char after = end == line.size() ? ' ' : line[end];
        const bool joinedBefore = wordBegins && (isWordCharacter(before) || (word.starts_with("::") && before == '>'));
        const bool joinedAfter = isWordCharacter(word.back()) && isWordCharacter(after);
        if (!joinedBefore && !joinedAfter) {
            return at;
        }
    }
    return line.npos;
}

std::string place(const SourceFile& file, std::size_t line) {
    return file.path + ":" + std::to_string(line + 1) + ": ";
}

std::vector<std::string> wordFaults(const std::vector<Rule>& rules, const SourceFile& file) {
    std::vector<std::string> faults;
    const bool isCode = file.path.ends_with(".h") || file.path.ends_with(".cc");
    const std::string code = isCode ? withoutComments(file.text, Literals::blank) : file.text;
    const std::string literals = isCode ? withoutComments(file.text, Literals::keep) : file.text;
    for (const Rule& rule : rules) {
        if (std::ranges::any_of(rule.except, [&](const std::string& name) { return file.path.starts_with(name); })) {
            continue;
        }
        const std::string_view text = rule.within == Within::code              ? code
                                      : rule.within == Within::codeAndLiterals ? literals
                                                                               : std::string_view(file.text);
        if (text.find(rule.word) == text.npos) {
            continue;
        }
        const std::vector<std::string_view> lines = splitLines(text);
        for (std::size_t i = 0; i < lines.size(); ++i) {
            if (findWord(lines[i], rule.word) != lines[i].npos) {
                faults.push_back(place(file, i) + rule.word + " stands here; use " + rule.instead);
            }
        }
    }
    return faults;
}

/// A chapter number of some other text ("Part" and two numbers), or a silenced check that does not say which one.
std::vector<std::string> referenceFaults(const SourceFile& file) {
    std::vector<std::string> faults;
    const std::vector<std::string_view> lines = splitLines(file.text);
    const auto isDigit = [](std::string_view text, std::size_t at) {
        return at < text.size() && text[at] >= '0' && text[at] <= '9';
    };
    for (std::size_t i = 0; i < lines.size(); ++i) {
        const std::string_view line = lines[i];
        for (std::size_t at = line.find("Part "); at != line.npos; at = line.find("Part ", at + 1)) {
            if (isDigit(line, at + 5) && line.substr(at + 6, 1) == "." && isDigit(line, at + 7)) {
                faults.push_back(place(file, i) + "a chapter number that no text of ours has");
            }
        }
        const std::string silence = "NO"
                                    "LINT";
        if (std::size_t at = line.find(silence); at != line.npos) {
            while (at < line.size() && isWordCharacter(line[at])) {
                ++at;
            }
            if (line.substr(at, 1) != "(") {
                faults.push_back(place(file, i) + silence + " names no check");
            }
        }
    }
    return faults;
}

/// What a source is for stands in its header; in the source itself where there is none. Tests say it one by one.
enum class Purpose { here, inHeader };

std::vector<std::string> formFaults(const SourceFile& file, Purpose purpose) {
    std::vector<std::string> faults;
    const std::vector<std::string_view> lines = splitLines(file.text);
    if (lines.empty() || lines[0] != "// SPDX-License-Identifier: Apache-2.0") {
        faults.push_back(file.path + ":1: does not begin with the licence line");
    }
    if (purpose == Purpose::here && (lines.size() < 2 || !lines[1].starts_with("// "))) {
        faults.push_back(file.path + ":2: does not say what the file is for");
    }
    if (file.path.ends_with(".h") && std::ranges::find(lines, "#pragma once") == lines.end()) {
        faults.push_back(file.path + ": has no #pragma once");
    }
    if (file.path.starts_with("src/") && lines.size() > 600) {
        faults.push_back(file.path + ": has " + std::to_string(lines.size()) +
                         " lines; over 600, a second thing lives in it");
    }
    return faults;
}

void append(std::vector<std::string>& to, std::vector<std::string> more) {
    to.insert(to.end(), std::make_move_iterator(more.begin()), std::make_move_iterator(more.end()));
}

std::string joined(const std::vector<std::string>& lines) {
    std::string text;
    for (const std::string& line : lines) {
        text += line + "\n";
    }
    return text;
}

const std::vector<std::string> codeEndings = {".h", ".cc"};

TEST(HouseRules, ProgramsGoThroughTheLayerThatOwnsACall) {
    const std::vector<SourceFile> files = filesBelow({"src", "client", "tools"}, codeEndings);
    ASSERT_FALSE(files.empty());
    std::vector<std::string> faults;
    for (const SourceFile& file : files) {
        append(faults, wordFaults(programRules(), file));
    }
    EXPECT_EQ(joined(faults), "");
}

TEST(HouseRules, NothingIsLeftOverOrSilenced) {
    const std::vector<SourceFile> files = filesBelow(
        {"src", "client", "tools", "tests", "bench", "fuzz", "docs", "packaging", "cmake", "dev", ".ci/run",
         "CMakeLists.txt", "README.md", "CHANGELOG.md", "CONTRIBUTING.md", "SECURITY.md"},
        {".h", ".cc", ".md", ".txt", ".cmake", ".sh", ".service", ".socket", ".in", ".1", ".5", ".8", "dev", "run"});
    ASSERT_FALSE(files.empty());
    std::vector<std::string> faults;
    for (const SourceFile& file : files) {
        append(faults, wordFaults(textRules(), file));
        append(faults, referenceFaults(file));
    }
    EXPECT_EQ(joined(faults), "");
}

TEST(HouseRules, EverySourceHasItsHead) {
    std::vector<std::string> faults;
    const std::vector<SourceFile> files = filesBelow({"src", "client", "tools", "tests", "bench", "fuzz"}, codeEndings);
    for (const SourceFile& file : files) {
        const std::string header = file.path.substr(0, file.path.rfind('.')) + ".h";
        const bool hasHeader =
            header != file.path && std::ranges::find(files, header, &SourceFile::path) != files.end();
        const bool isTest = file.path.ends_with("Test.cc");
        append(faults, formFaults(file, hasHeader || isTest ? Purpose::inHeader : Purpose::here));
    }
    EXPECT_EQ(joined(faults), "");
}

// Each rule on a line that breaks it, in a folder where it holds, and on lines that only look like it.
TEST(HouseRules, EveryRuleCanFail) {
    for (const Rule& rule : programRules()) {
        const std::string line = "    auto x = " + std::string(rule.word) + "(a, b);\n";
        EXPECT_EQ(wordFaults({rule}, {"src/store/A.cc", line}).size(), 1U) << rule.word;
        EXPECT_TRUE(wordFaults({rule}, {"src/store/A.cc", "// " + line}).empty()) << rule.word;
        EXPECT_TRUE(wordFaults({rule}, {"src/store/A.cc", "f(\"" + std::string(rule.word) + "\");\n"}).empty())
            << rule.word;
        for (const std::string& folder : rule.except) {
            EXPECT_TRUE(wordFaults({rule}, {folder + "A.cc", line}).empty()) << rule.word << " in " << folder;
        }
    }
    for (const Rule& rule : textRules()) {
        const std::string comment = rule.within == Within::text ? "// " : "";
        EXPECT_EQ(wordFaults({rule}, {"tests/a/A.cc", comment + rule.word + "\n"}).size(), 1U) << rule.word;
    }
    const char* innocent =
        "fs::open(x); file.rename(y); other->unlink(z); mySystem(1); int atoiCount = 1'000; /* ::open( */\n"
        "auto s = R\"(::open()\"; char c = '\"'; f(\"std::mutex\"); // std::mutex\n";
    EXPECT_EQ(joined(wordFaults(programRules(), {"src/store/A.cc", innocent})), "");
    EXPECT_EQ(wordFaults(programRules(), {"src/store/A.cc", "char c = '\"'; ::open(p, 0);\n"}).size(), 1U);
    EXPECT_EQ(wordFaults(programRules(), {"src/store/A.cc", "f(\"\\\"\"); (void)::unlink(p);\n"}).size(), 1U);
    const std::string silence = "// NO"
                                "LINT";
    EXPECT_EQ(referenceFaults({"src/A.cc", "// see Part "
                                           "3.4\n"})
                  .size(),
              1U);
    EXPECT_EQ(referenceFaults({"src/A.cc", silence + "\n"}).size(), 1U);
    EXPECT_TRUE(referenceFaults({"src/A.cc", silence + "NEXTLINE(bugprone-x): why\n// Part 3 of it\n"}).empty());
    const std::string head = "// SPDX-License-Identifier: Apache-2.0\n// What it is.\n";
    EXPECT_TRUE(formFaults({"src/A.h", head + "#pragma once\n"}, Purpose::here).empty());
    EXPECT_EQ(formFaults({"src/A.h", head}, Purpose::here).size(), 1U);
    EXPECT_EQ(formFaults({"src/A.cc", "int x;\n"}, Purpose::here).size(), 2U);
    EXPECT_EQ(formFaults({"src/A.cc", "int x;\n"}, Purpose::inHeader).size(), 1U);
    EXPECT_EQ(formFaults({"src/A.cc", head + std::string(599, '\n')}, Purpose::here).size(), 1U);
}

} // namespace
} // namespace zor::house
