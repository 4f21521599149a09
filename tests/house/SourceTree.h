// SPDX-License-Identifier: Apache-2.0
// The checkout as the house tests read it: files below it, their text with and without comments, and what they include.
#pragma once

#include <set>
#include <string>
#include <string_view>
#include <vector>

namespace zor::house {

/// One file of the checkout. `path` is relative to the root of the checkout, with slashes.
struct SourceFile {
    std::string path;
    std::string text;
};

/// An include directive and the line it stands on, counted from 1.
struct Include {
    std::string name;
    int line = 0;
};

/// The root of the checkout, without a slash at its end.
std::string checkoutRoot();

/// Files below the named folders (or the named files themselves) whose name ends with one of `endings`, sorted by path.
std::vector<SourceFile> filesBelow(const std::vector<std::string>& folders, const std::vector<std::string>& endings);

std::string readFile(const std::string& path);

/// Of a name; digits too.
bool isWordCharacter(char c);
/// Behind a literal whose quote is at `at`; a line's end ends it, too.
std::size_t literalEnd(std::string_view text, std::size_t at);

/// The text with comments blanked and, unless kept, the insides of literals too. Lines keep their numbers.
enum class Literals { keep, blank };
std::string withoutComments(std::string_view text, Literals literals);

/// The `#include "..."` directives outside comments.
std::vector<Include> quotedIncludes(std::string_view text);

/// `Suite.Name` of every test.
std::set<std::string> testNames();

std::vector<std::string_view> splitLines(std::string_view text);
/// One line for each.
std::string joinLines(const std::vector<std::string>& lines);

} // namespace zor::house
