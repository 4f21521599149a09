// SPDX-License-Identifier: Apache-2.0
// Goal: what reviewers would else have to look for: calls that pass by the layer that owns them, checks that were
// silenced, leftovers. Method: tables of words over the sources; each word has to be flagged in a line made of it.
#include "house/SourceTree.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <regex>

namespace zor::house {
namespace {

struct Rule {
    /// One that begins with "::" is the global function, not a member or another namespace's.
    std::vector<std::string> words;
    /// Folders (or files) in which they may stand.
    std::vector<std::string> except;
    const char* instead;
};

// Words of the code of the programs: src/, client/, tools/.
const std::vector<Rule>& programRules() {
    // Clients and tools run with their user's own rights, on their user's own paths.
    static const std::vector<std::string> kernelFolders = {"src/fs/", "src/platform/linux/", "client/", "tools/"};
    static const std::vector<std::string> diskFolders = {"src/platform/linux/", "client/", "tools/"};
    constexpr const char* descriptors = "a descriptor and src/fs: a path can be swapped between two calls";
    constexpr const char* annotated = "platform/Mutex.h: the lint build checks its locks";
    static const std::vector<Rule> rules = {
        {{"std::filesystem", "<filesystem>", "std::ifstream", "std::ofstream", "std::fstream"}, {}, descriptors},
        {{"::open(", "::creat(", "::fopen(", "::stat(", "::lstat(", "::access(", "::opendir(", "::readlink("},
         kernelFolders,
         descriptors},
        // A home may be reached through links that its administrator made; it is resolved once.
        {{"::realpath("}, {"src/fs/", "src/platform/linux/", "src/store/ZORPerUserConfiguration.cc"}, descriptors},
        {{"::truncate(",  "::rename(",   "::unlink(",    "::remove(",    "::rmdir(",          "::mkdir(",
          "::link(",      "::symlink(",  "::chmod(",     "::chown(",     "::lchown(",         "::renameat(",
          "::renameat2(", "::unlinkat(", "::mkdirat(",   "::linkat(",    "::symlinkat(",      "::fchmod(",
          "::fchmodat(",  "::fchown(",   "::fchownat(",  "::ftruncate(", "::fsetxattr(",      "::futimens(",
          "::utimensat(", "::fsync(",    "::fdatasync(", "::syncfs(",    "::sync_file_range("},
         diskFolders,
         "platform/Disk.h: crash tests have to see every change"},
        {{"std::mutex", "std::recursive_mutex", "std::lock_guard", "std::unique_lock", "std::scoped_lock",
          "std::condition_variable"},
         {"src/platform/Mutex.h"},
         annotated},
        // Locks that are looked up by identifier are beyond what the analysis can follow.
        {{"std::shared_mutex"}, {"src/platform/Mutex.h", "src/daemon/base/ZORLocks"}, annotated},
        {{"::accept(", "::dup(", "::dup2(", "::pipe(", "::epoll_create(", "::inotify_init("},
         {},
         "the call that takes a flag for CLOEXEC"},
        {{"sprintf", "strcpy", "strcat", "strtok"}, {}, "what knows the buffer's size"},
        {{"atoi"}, {}, "std::from_chars, which tells a failure"},
        {{"localtime", "gmtime"}, {}, "localtime_r, gmtime_r"},
        {{"getpwuid", "getpwnam"}, {}, "the user database of the system root"},
        {{"system(", "popen("}, {}, "nothing: no shell is started by a daemon that serves hostile strings"},
        {{"const_cast"}, {}, "a type that says what is changed"},
    };
    return rules;
}

/// Words that this file may not hold in one piece.
std::string word(const char* begin, const char* end) {
    return std::string(begin) + end;
}
const std::string silence = word("NO", "LINT");

// Words of every text in the checkout, comments included.
const std::vector<Rule>& textRules() {
    static const std::vector<Rule> rules = {
        {{word("#if ", "0")}, {}, "removing the code: history keeps it"},
        {{word("FIX", "ME"), word("TO", "DO")}, {}, "doing it, or an issue"},
        {{word("DISABLED", "_")}, {}, "a test that runs, or none"},
        {{word("specif", "ication")}, {}, "saying what this system does, in its own words"},
    };
    return rules;
}

/// Finds `word` where it stands alone: no letter, digit or underscore beside those ends that are one themselves, and no
/// name before a leading "::".
bool holds(std::string_view line, std::string_view word) {
    const bool isGlobal = word.starts_with("::");
    for (std::size_t at = line.find(word); at != line.npos; at = line.find(word, at + 1)) {
        const char before = at == 0 ? ' ' : line[at - 1];
        const std::size_t end = at + word.size();
        const char after = end == line.size() ? ' ' : line[end];
        const bool joinedBefore =
            ((isGlobal || isWordCharacter(word.front())) && isWordCharacter(before)) || (isGlobal && before == '>');
        if (!joinedBefore && !(isWordCharacter(word.back()) && isWordCharacter(after)))
            return true;
    }
    return false;
}

std::string place(const SourceFile& file, std::size_t line) {
    return file.path + ":" + std::to_string(line + 1) + ": ";
}

std::vector<std::string> wordFaults(const std::vector<Rule>& rules, const SourceFile& file) {
    std::vector<std::string> faults;
    const std::vector<std::string_view> lines = splitLines(file.text);
    for (const Rule& rule : rules) {
        if (std::ranges::any_of(rule.except, [&](const std::string& name) { return file.path.starts_with(name); }))
            continue;
        for (const std::string& word : rule.words)
            for (std::size_t i = 0; i < lines.size() && file.text.find(word) != file.text.npos; ++i)
                if (holds(lines[i], word))
                    faults.push_back(place(file, i) + word + " stands here; use " + rule.instead);
    }
    return faults;
}

std::vector<std::string> callFaults(const SourceFile& file) {
    return wordFaults(programRules(), {file.path, withoutComments(file.text, Literals::blank)});
}

/// Also a chapter number of some other text, or a silenced check that does not say which one.
std::vector<std::string> textFaults(const SourceFile& file) {
    static const std::regex chapter("Part [0-9]\\.[0-9]");
    static const std::regex unnamed(silence + "\\w*(?![\\w(])");
    std::vector<std::string> faults = wordFaults(textRules(), file);
    const std::vector<std::string_view> lines = splitLines(file.text);
    for (std::size_t i = 0; i < lines.size(); ++i) {
        const std::string_view line = lines[i];
        if (line.find("Part ") != line.npos && std::regex_search(line.begin(), line.end(), chapter))
            faults.push_back(place(file, i) + "a chapter number that no text of ours has");
        if (line.find(silence) != line.npos && std::regex_search(line.begin(), line.end(), unnamed))
            faults.push_back(place(file, i) + silence + " names no check");
    }
    return faults;
}

/// What a source is for stands in its header; in the source itself where there is none. Tests say it one by one.
enum class Purpose { here, inHeader };

std::vector<std::string> formFaults(const SourceFile& file, Purpose purpose) {
    std::vector<std::string> faults;
    const std::vector<std::string_view> lines = splitLines(file.text);
    if (lines.empty() || lines[0] != "// SPDX-License-Identifier: Apache-2.0")
        faults.push_back(file.path + ":1: does not begin with the licence line");
    if (purpose == Purpose::here && (lines.size() < 2 || !lines[1].starts_with("// ")))
        faults.push_back(file.path + ":2: does not say what the file is for");
    if (file.path.ends_with(".h") && std::ranges::find(lines, "#pragma once") == lines.end())
        faults.push_back(file.path + ": has no #pragma once");
    if (file.path.starts_with("src/") && lines.size() > 600)
        faults.push_back(file.path + ": has " + std::to_string(lines.size()) +
                         " lines; over 600, a second thing lives in it");
    return faults;
}

template <typename Judge>
void expectNoFaults(const std::vector<SourceFile>& files, const Judge& judge) {
    ASSERT_FALSE(files.empty());
    std::string faults;
    for (const SourceFile& file : files)
        faults += joinLines(judge(file));
    EXPECT_EQ(faults, "");
}

TEST(HouseRules, ProgramsGoThroughTheLayerThatOwnsACall) {
    expectNoFaults(filesBelow({"src", "client", "tools"}, {".h", ".cc"}), callFaults);
}

TEST(HouseRules, NothingIsLeftOverOrSilenced) {
    expectNoFaults(
        filesBelow({"src", "client", "tools", "tests", "bench", "fuzz", "docs", "packaging", "cmake", "dev", ".ci/run",
                    "CMakeLists.txt", "README.md", "CHANGELOG.md", "CONTRIBUTING.md", "SECURITY.md"},
                   {".h", ".cc", ".md", ".txt", ".cmake", ".sh", ".service", ".socket", ".in", ".1", ".5", ".8", "dev",
                    "run"}),
        textFaults);
}

TEST(HouseRules, EverySourceHasItsHead) {
    const auto files = filesBelow({"src", "client", "tools", "tests", "bench", "fuzz"}, {".h", ".cc"});
    expectNoFaults(files, [&](const SourceFile& file) {
        const std::string header = file.path.substr(0, file.path.rfind('.')) + ".h";
        const bool hasHeader =
            header != file.path && std::ranges::find(files, header, &SourceFile::path) != files.end();
        return formFaults(file, hasHeader || file.path.ends_with("Test.cc") ? Purpose::inHeader : Purpose::here);
    });
}

// Each word on a line that breaks its rule, in a folder where it holds, and on lines that only look like it.
TEST(HouseRules, EveryRuleCanFail) {
    const auto faultsIn = [](const std::string& text, const std::string& folder = "src/store/") {
        return callFaults({folder + "A.cc", text}).size();
    };
    for (const Rule& rule : programRules())
        for (const std::string& word : rule.words) {
            const std::string line = "    auto x = " + word + "(a, b);\n";
            EXPECT_EQ(faultsIn(line), 1U) << word;
            EXPECT_EQ(faultsIn("// " + line), 0U) << word;
            EXPECT_EQ(faultsIn("f(\"" + word + "\");\n"), 0U) << word;
            for (const std::string& folder : rule.except)
                EXPECT_EQ(faultsIn(line, folder), 0U) << word << " in " << folder;
        }
    EXPECT_EQ(faultsIn("fs::open(x); file.rename(y); other->unlink(z); mySystem(1); int atoiCount = 1'000;\n"
                       "/* ::open( */ auto s = R\"(::open()\"; char c = '\"'; f(\"std::mutex\"); // std::mutex\n"),
              0U);
    EXPECT_EQ(faultsIn("char c = '\"'; ::open(p, 0);\n"), 1U);
    EXPECT_EQ(faultsIn("f(\"\\\"\"); (void)::unlink(p);\n"), 1U);
    EXPECT_EQ(faultsIn("/* a\n*/ auto s = R\"x(\")\")x\"; ::open(p, 0);\n"), 1U);

    for (const Rule& rule : textRules())
        for (const std::string& word : rule.words)
            EXPECT_EQ(textFaults({"tests/a/A.cc", "// " + word + "\n"}).size(), 1U) << word;
    EXPECT_EQ(textFaults({"src/A.cc", "// see " + word("Part ", "3.4") + "\n"}).size(), 1U);
    EXPECT_EQ(textFaults({"src/A.cc", "// " + silence + "\n"}).size(), 1U);
    EXPECT_TRUE(textFaults({"src/A.cc", "// " + silence + "NEXTLINE(bugprone-x): why\n// Part 3 of it\n"}).empty());

    const std::string head = "// SPDX-License-Identifier: Apache-2.0\n// What it is.\n";
    EXPECT_TRUE(formFaults({"src/A.h", head + "#pragma once\n"}, Purpose::here).empty());
    EXPECT_EQ(formFaults({"src/A.h", head}, Purpose::here).size(), 1U);
    EXPECT_EQ(formFaults({"src/A.cc", "int x;\n"}, Purpose::here).size(), 2U);
    EXPECT_EQ(formFaults({"src/A.cc", "int x;\n"}, Purpose::inHeader).size(), 1U);
    EXPECT_EQ(formFaults({"src/A.cc", head + std::string(599, '\n')}, Purpose::here).size(), 1U);
}

} // namespace
} // namespace zor::house
