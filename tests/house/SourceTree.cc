// SPDX-License-Identifier: Apache-2.0
// Reads the checkout for the house tests. What it has to know of C++ is where comments and literals begin and end.
#include "house/SourceTree.h"

#include <algorithm>
#include <cctype>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <regex>
#include <stdexcept>

namespace zor::house {

std::string checkoutRoot() {
    return ZORVANE_SOURCE_DIR;
}

std::string readFile(const std::string& path) {
    std::ifstream stream(path, std::ios::binary);
    if (!stream)
        throw std::runtime_error("cannot read " + path);
    return {std::istreambuf_iterator<char>(stream), {}};
}

std::vector<SourceFile> filesBelow(const std::vector<std::string>& folders, const std::vector<std::string>& endings) {
    const std::string root = checkoutRoot() + "/";
    std::vector<SourceFile> files;
    const auto take = [&](const std::filesystem::path& path) {
        const std::string name = path.string();
        if (std::filesystem::is_regular_file(path) &&
            std::ranges::any_of(endings, [&](const std::string& ending) { return name.ends_with(ending); }))
            files.push_back({name.substr(root.size()), readFile(name)});
    };
    for (const std::string& folder : folders) {
        take(root + folder);
        if (std::filesystem::is_directory(root + folder))
            for (const auto& entry : std::filesystem::recursive_directory_iterator(root + folder))
                take(entry.path());
    }
    std::ranges::sort(files, {}, &SourceFile::path);
    return files;
}

bool isWordCharacter(char c) {
    return std::isalnum(static_cast<unsigned char>(c)) != 0 || c == '_';
}

std::size_t literalEnd(std::string_view text, std::size_t at) {
    const char quote = text[at++];
    while (at < text.size() && text[at] != quote && text[at] != '\n')
        at += text[at] == '\\' ? 2 : 1;
    return std::min(at + 1, text.size());
}

std::string withoutComments(std::string_view text, Literals literals) {
    std::string out(text);
    const auto blank = [&](std::size_t from, std::size_t to) {
        for (; from < to; ++from)
            out[from] = out[from] == '\n' ? '\n' : ' ';
    };
    const auto behind = [&](std::string_view ending, std::size_t from) {
        const std::size_t found = text.find(ending, from);
        return found == text.npos ? text.size() : found + ending.size();
    };
    for (std::size_t at = 0, end = 0; at < text.size(); at = end) {
        const std::string_view rest = text.substr(at);
        end = at + 1;
        if (rest.starts_with("//") || rest.starts_with("/*")) {
            end = rest[1] == '/' ? std::min(text.find('\n', at), text.size()) : behind("*/", at + 2);
            blank(at, end);
            continue;
        }
        // A quote behind a digit separates digits.
        if (rest.starts_with("R\"") && rest.find('(') != rest.npos)
            end = behind(")" + std::string(rest.substr(2, rest.find('(') - 2)) + "\"", at);
        else if (rest[0] == '"' || (rest[0] == '\'' && (at == 0 || !isWordCharacter(text[at - 1]))))
            end = literalEnd(text, at);
        if (literals == Literals::blank)
            blank(at + 1, end - 1);
    }
    return out;
}

std::set<std::string> testNames() {
    static const std::regex macro(R"(TEST(?:_F|_P)?\((\w+), (\w+)\))");
    std::set<std::string> names;
    for (const SourceFile& file : filesBelow({"tests"}, {"Test.cc"}))
        for (const std::string_view line : splitLines(file.text))
            if (std::cmatch name; line.starts_with("TEST") && std::regex_search(line.begin(), line.end(), name, macro))
                names.insert(name[1].str() + "." + name[2].str());
    return names;
}

std::vector<std::string_view> splitLines(std::string_view text) {
    std::vector<std::string_view> lines;
    while (!text.empty()) {
        const std::size_t end = text.find('\n');
        lines.push_back(text.substr(0, end));
        text.remove_prefix(end == text.npos ? text.size() : end + 1);
    }
    return lines;
}

std::string joinLines(const std::vector<std::string>& lines) {
    std::string text;
    for (const std::string& line : lines)
        text += line + "\n";
    return text;
}

std::vector<Include> quotedIncludes(std::string_view text) {
    static const std::regex directive("\\s*#\\s*include\\s*\"([^\"]*)\".*");
    const std::string code = withoutComments(text, Literals::keep);
    std::vector<Include> includes;
    int number = 0;
    for (const std::string_view line : splitLines(code)) {
        ++number;
        std::cmatch name;
        if (line.find('#') != line.npos && std::regex_match(line.begin(), line.end(), name, directive))
            includes.push_back({name[1], number});
    }
    return includes;
}

} // namespace zor::house
