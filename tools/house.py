#!/usr/bin/env python3
# SPDX-License-Identifier: Apache-2.0
"""The rules of the house that no compiler knows, as a part of ./dev lint.

Calls that pass by the layer that owns them, includes that go up (the table is docs/architecture.md's), circles of headers,
standard headers that are used and not included, sources without a head, sentences that come late to their subject, checks that
were silenced, a page of threats that names tests which do not exist, and a page that names sources which do not. Prints one line for each fault and ends with 1. Before
it judges the tree it breaks each rule once and ends with 2 where that stays unseen.
"""
import re
import sys
from pathlib import Path

ROOT = Path(__file__).resolve().parent.parent
SYSTEM = ("src/os/", "src/service/", "src/identity/", "src/device/")
KERNEL = ("src/fs/", *SYSTEM, "client/", "tools/")  # tools run with their user's rights, on their user's paths
DISK = (*SYSTEM, "client/", "tools/")
PATHS = "a descriptor and src/fs: a path can be swapped between two calls"
MUTEX = "base/Mutex.h: ./dev lint checks its locks"
# Words of the programs' code, folders or files in which they may stand, what to use instead. "::f(" is the global function.
CALLS = [
    ("std::filesystem <filesystem> std::ifstream std::ofstream std::fstream", (), PATHS),
    ("::open( ::creat( ::fopen( ::stat( ::lstat( ::access( ::opendir( ::readlink(", KERNEL, PATHS),
    # A home may be reached through links that its administrator made; it is resolved once.
    ("::realpath(", (*KERNEL[:5], "src/store/Configuration.cc"), PATHS),
    ("::truncate( ::rename( ::unlink( ::remove( ::rmdir( ::mkdir( ::link( ::symlink( ::chmod( ::chown( ::lchown( ::renameat( "
     "::renameat2( ::unlinkat( ::mkdirat( ::linkat( ::symlinkat( ::fchmod( ::fchmodat( ::fchown( ::fchownat( ::ftruncate( "
     "::fsetxattr( ::futimens( ::utimensat( ::fsync( ::fdatasync( ::syncfs( ::sync_file_range(",
     DISK, "platform/Disk.h: crash tests have to see every change"),
    ("std::mutex std::recursive_mutex std::lock_guard std::unique_lock std::scoped_lock std::condition_variable",
     ("src/base/Mutex.h",), MUTEX),
    # Locks that are looked up by identifier are beyond what the analysis can follow.
    ("std::shared_mutex", ("src/base/Mutex.h", "src/base/ZORLocks"), MUTEX),
    ("::accept( ::dup( ::dup2( ::pipe( ::epoll_create( ::inotify_init(", (), "the call that takes a flag for CLOEXEC"),
    ("sprintf strcpy strcat strtok", (), "what knows the buffer's size"),
    ("atoi", (), "std::from_chars, which tells a failure"),
    ("localtime gmtime", (), "localtime_r, gmtime_r"),
    ("getpwuid getpwnam", (), "the user database of the system root"),
    ("system( popen(", (), "nothing: no shell is started by a daemon that serves hostile strings"),
    ("const_cast", (), "a type that says what is changed"),
]
# In any text of the checkout; written so that this file holds none of them.
TEXTS = [(r"#if [0]", "removing the code: history keeps it"), (r"\b(FIX[M]E|TO[D]O)\b", "doing it"),
         (r"\bDISABLED[_]", "a test that runs, or none"), (r"specif[i]cation", "this system's own words"),
         (r"Part [0-9]\.[0-9]", "this system's own words"), (r"NO[L]INT(NEXTLINE|BEGIN|END)?(?![\w(])", "the check's name")]
# Standard headers that the builds precompile (cmake/ZorvaneTargets.cmake), so that no compiler misses them, and names of theirs.
STANDARD = {
    "algorithm": r"(ranges::)?(all_of|any_of|binary_search|clamp|contains|copy|count|count_if|equal|fill|find|find_if|for_each|"
                 r"lower_bound|max|max_element|min|min_element|mismatch|none_of|remove_if|reverse|search|sort|stable_sort|"
                 r"transform|unique|upper_bound)",
    "atomic": r"atomic\w*", "condition_variable": "condition_variable", "deque": "deque", "expected": "(un)?expected",
    "functional": "(bind_front|c?ref|function|greater|hash|invoke|less)", "map": "(multi)?map",
    "memory": r"(enable_shared_from_this|make_shared|make_unique\w*|shared_ptr|unique_ptr|weak_ptr)",
    "mutex": "(call_once|lock_guard|mutex|once_flag|unique_lock)", "optional": "(nullopt|optional)", "set": "(multi)?set",
    "span": "span", "string": "(string|to_string)", "string_view": "string_view", "thread": "(this_thread|thread)",
    "unordered_set": "unordered_set", "variant": "(get_if|holds_alternative|monostate|variant|visit)", "vector": "vector"}
STANDARD = {header: re.compile(rf"(?<![\w:])std::{names}(?!\w)") for header, names in STANDARD.items()}
TOKEN = re.compile(r'R"([^(\s]*)\((?:.|\n)*?\)\1"|//[^\n]*|/\*(?:.|\n)*?\*/|"(?:\\.|[^"\\\n])*"|(?<!\w)\'(?:\\.|[^\'\\\n])*\'')


def code_of(text, keep_literals=False, keep_comments=False):
    """The text with its comments and its literals blanked, where they are not kept; lines keep their numbers."""
    def blank(match):
        token = match[0]
        return token if (keep_comments if token[0] == "/" else keep_literals) else re.sub(r"[^\n]", " ", token)
    return TOKEN.sub(blank, text)


def pattern_of(word):
    before = r"(?<![\w>])" if word.startswith("::") else r"(?<!\w)" if word[0].isalpha() else ""
    return re.compile(before + re.escape(word) + (r"(?!\w)" if word[-1].isalnum() else ""))


PATTERNS = [(pattern_of(word), word, allowed, instead) for words, allowed, instead in CALLS for word in words.split()]


def lines_with(pattern, text):
    return [text.count("\n", 0, match.start()) + 1 for match in pattern.finditer(text)]


def call_faults(path, text):
    code = code_of(re.sub(r"(?m)^\s*#\s*include\s*<(filesystem)>", r"<\1>", text))
    return [f"{path}:{line}: {word} stands here; use {instead}" for pattern, word, allowed, instead in PATTERNS
            if not path.startswith(allowed or ("\0",)) for line in lines_with(pattern, code)]


def text_faults(path, text):
    return [f"{path}:{line}: use {instead}" for pattern, instead in TEXTS for line in lines_with(re.compile(pattern), text)]


LATE_OPENERS = ("What", "Who", "Where", "Of")


def sentence_faults(path, text):
    """Strangers read comments: the noun that a sentence is about opens it."""
    faults, before = [], "."
    for number, line in enumerate(code_of(text, keep_comments=True).splitlines(), 1):
        code, _, comment = line.partition("//")
        words = comment.strip("/< ")
        opened = re.findall(rf"(?<=[.:?!] )(?:{'|'.join(LATE_OPENERS)})\b", ("." if code.strip() else before[-1]) + " " + words)
        faults += [f"{path}:{number}: a sentence opens with {word}; name its subject first" for word in opened]
        before = "." if code.strip() or not words or words.startswith("SPDX-") else words
    return faults


def head_faults(path, text, has_header):
    lines = text.splitlines()
    faults = []
    if lines[:1] != ["// SPDX-License-Identifier: Apache-2.0"]:
        faults.append(f"{path}:1: does not begin with the licence line")
    if not has_header and not (lines[1:2] and lines[1].startswith("// ")):
        faults.append(f"{path}:2: does not say what the file is for")
    if path.endswith(".h") and "#pragma once" not in lines:
        faults.append(f"{path}: has no #pragma once")
    if path.startswith("src/") and len(lines) > 500:
        faults.append(f"{path}: has {len(lines)} lines; over 500, a second thing lives in it")
    return faults


def rules_of(page):
    """Rows are "| `folder` | may include |": for each folder, what its files may include."""
    rules, above = {}, set()
    for cells in re.findall(r"(?m)^\|([^|\n]*)\|([^|\n]*)\|$", page):
        first, allowed = (set(re.findall(r"`([^`]*)`", cell)) for cell in cells)
        if len(first) != 1:
            continue
        folder = first.pop()
        rules[folder] = allowed | {folder} | (above if "all above" in cells[1].lower() else set())
        if folder.startswith("src/"):
            above = above | {folder}
    return rules


def rule_folder(rules, path):
    if path.startswith("src/"):
        return path.rpartition("/")[0]
    return next((folder for folder in sorted(rules, key=len, reverse=True) if path.startswith(folder + "/")), "")


def includes_of(files, path):
    own = [] if path.startswith("src/") else [path.rpartition("/")[0] + "/"]
    bases = own + ["src/"] + ([] if path.startswith("src/") else ["client/include/", "client/"])
    for name in re.findall(r'(?m)^\s*#\s*include\s*"([^"]*)"', code_of(files[path], keep_literals=True)):
        yield name, next((base + name for base in bases if base + name in files), "")


def include_faults(rules, files):
    faults, reaches = [], {}
    for path in files:
        folder = rule_folder(rules, path)
        if folder not in rules:
            faults.append(f"{path}: its folder is not in docs/architecture.md")
            continue
        allowed = rules[folder]
        for name, target in includes_of(files, path):
            if path.endswith(".h"):
                reaches.setdefault(path, set()).add(target)
            if not target or not {target, rule_folder(rules, target)} & allowed:
                faults.append(f'{path}: "{name}" may not be included from {folder} (docs/architecture.md)')
    left = {path for path in files if path.endswith(".h")}
    while end := {path for path in left if not reaches.get(path, set()) & left}:
        left -= end  # those that remain at last are on a circle of includes, or lead to one
    return faults + [f"{path}: is on a circle of includes" for path in sorted(left)]


def standard_faults(files):
    own = {path: [target for _, target in includes_of(files, path) if target] for path in files}
    faults = []
    for path, text in files.items():
        reached = [path]  # and what it includes of ours, and so on
        for one in reached:
            reached += [target for target in own[one] if target not in reached]
        headers = {header for one in reached for header in re.findall(r"(?m)^#include <([^>]*)>", files[one])}
        code = code_of(text)
        faults += [f"{path}: uses {used[0]} and does not include <{header}>" for header, names in STANDARD.items()
                   if header not in headers and (used := names.search(code))]
    return faults


def page_faults(page, tests):
    rows = [line for line in page.splitlines() if line.startswith("| **")]
    faults = [f"docs/security.md: no test: {row[:60]}" for row in rows if not re.search(r"`\w+\.\w+`", row)]
    return faults + [f"docs/security.md: no test has the name {name}" for row in rows
                     for name in re.findall(r"`(\w+\.\w+)`", row) if name not in tests]


def below(folders, endings):
    paths = [path for folder in folders for path in ([ROOT / folder] if (ROOT / folder).is_file() else (ROOT / folder).rglob("*"))
             if path.is_file() and path.name.endswith(endings)]
    return {str(path.relative_to(ROOT)): path.read_text() for path in sorted(paths)}


def blind_rules():
    """The rules that a broken line passes."""
    blind = [word for _, word, _, _ in PATTERNS if len(call_faults("src/store/A.cc", f"auto x = {word}(a);\n")) != 1
             or call_faults("src/store/A.cc", f'// {word}(a)\nauto s = R"({word}()"; char c = \'"\'; f("{word}(");\n')]
    head = "// SPDX-License-Identifier: Apache-2.0\n// Purpose.\n"
    rules = rules_of("| `src/low` | nothing |\n| `src/top` | all above |\n")
    pairs = {"src/low/A.h": '#include "top/B.h"\n', "src/top/B.h": '#include "low/A.h"\n', "src/new/C.h": ""}
    checks = {
        "texts": all(len(text_faults("a", text)) == 1 for text in
                     ["#if " + "0", "FIX" + "ME", "DISABLED" + "_A", "Specif".lower() + "ication", "Part " + "3.4", "NO" + "LINT"]),
        "texts that only look like it": not text_faults("a", "NO" + "LINTNEXTLINE(bugprone-x)\n"),
        "heads": [len(head_faults("src/A.h", text, False)) for text in
                  (head + "#pragma once\n", head, "#pragma once\n", head + "#pragma once\n" * 600)] == [0, 1, 2, 1],
        "sentences": all(len(sentence_faults("a", "// SPDX-1\n// W a.\n//\n// W b. W\n// c.\n// W d.\nf();  // W e\n".replace("W", word)))
                         == 5 for word in LATE_OPENERS),
        "sentences that only look like it": not sentence_faults("a", '// Says\n// Who: of A.\nf("// Of b"); // what\nWhat c;\n'),
        "includes": len(include_faults(rules, pairs)) == 4,
        "standard headers": len(standard_faults({"src/low/A.cc": '#include "low/A.h"\nstd::map<int, std::string> a;\n',
                                                "src/low/A.h": "#include <map>\n", "src/top/B.h": "Astd::map a; // std::map\n"})) == 1,
        "tests of the page": len(page_faults("| **A** | b | `No.Test` |\n| **A** | b | c |\n", {"A.B"})) == 2,
    }
    return blind + [name for name, holds in checks.items() if not holds]


def main():
    if blind := blind_rules():
        print("tools/house.py: these rules cannot fail: " + ", ".join(blind))
        return 2
    code = ("src", "client", "tools", "tests", "bench", "fuzz")
    sources = below(code, (".h", ".cc"))
    programs = {path: text for path, text in sources.items() if path.startswith(("src/", "client/", "tools/"))}
    rules = rules_of((ROOT / "docs/architecture.md").read_text())
    tests = {f"{suite}.{name}" for path, text in sources.items() if path.startswith("tests/")
             for suite, name in re.findall(r"(?m)^TEST(?:_F|_P)?\((\w+), (\w+)\)", text)}
    faults = include_faults(rules, programs) + page_faults((ROOT / "docs/security.md").read_text(), tests)
    faults += [f"docs/architecture.md: there is no {name}" for folder, allowed in rules.items()
               for name in {folder} | allowed if not (ROOT / name).exists()]
    faults += [f"{path}: there is no {name}" for path, text in below(("docs",), (".md",)).items()
               for name in re.findall(r"`((?:src|client|tools|tests|fuzz|bench)/[\w./-]+\.(?:h|cc|py|sh))`", text)
               if not (ROOT / name).exists()]
    faults += standard_faults(programs)
    targets = (ROOT / "cmake/ZorvaneTargets.cmake").read_text().partition("target_precompile_headers(")[2]
    if set(re.findall(r"<(\w+)>", targets.partition(")")[0])) != set(STANDARD):
        faults.append("tools/house.py: STANDARD has other headers than cmake/ZorvaneTargets.cmake precompiles")
    for path, text in programs.items():
        faults += call_faults(path, text)
    for path, text in sources.items():
        faults += head_faults(path, text, path[:-3] + ".h" in sources or path.endswith("Test.cc"))
    for path, text in (sources | below(code, (".hpp",))).items():
        faults += sentence_faults(path, text)
    everything = code + ("docs", "packaging", "cmake", "dev", ".ci/run", "CMakeLists.txt", "README.md", "CHANGELOG.md",
                         "CONTRIBUTING.md", "SECURITY.md")
    endings = (".h", ".cc", ".py", ".md", ".txt", ".cmake", ".sh", ".service", ".socket", ".in", ".1", ".3", ".5", ".8", "dev", "run")
    for path, text in below(everything, endings).items():
        faults += text_faults(path, text)
    if len(rules) < 10 or len(tests) < 100 or not programs:
        faults.append("tools/house.py: the table, the tests or the sources were not found")
    print("\n".join(faults), end="\n" if faults else "")
    return 1 if faults else 0


if __name__ == "__main__":
    sys.exit(main())
