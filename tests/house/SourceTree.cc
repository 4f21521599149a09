// SPDX-License-Identifier: Apache-2.0
// Reads the checkout for the house tests. A lexer of a few states is enough here: what it has to know of C++ is where
// comments and literals begin and end.
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
    if (!stream) {
        throw std::runtime_error("cannot read " + path);
    }
    return {std::istreambuf_iterator<char>(stream), {}};
}

std::vector<SourceFile> filesBelow(const std::vector<std::string>& folders, const std::vector<std::string>& endings) {
    const std::string root = checkoutRoot() + "/";
    std::vector<SourceFile> files;
    const auto take = [&](const std::filesystem::path& path) {
        const std::string name = path.string();
        if (std::ranges::any_of(endings, [&](const std::string& ending) { return name.ends_with(ending); })) {
            files.push_back({name.substr(root.size()), readFile(name)});
        }
    };
    for (const std::string& folder : folders) {
        if (std::filesystem::is_regular_file(root + folder)) {
            take(root + folder);
        } else if (std::filesystem::is_directory(root + folder)) {
            for (const auto& entry : std::filesystem::recursive_directory_iterator(root + folder)) {
                if (entry.is_regular_file()) {
                    take(entry.path());
                }
            }
        }
    }
    std::ranges::sort(files, {}, &SourceFile::path);
    return files;
}

std::string withoutComments(std::string_view text, Literals literals) {
    enum class State { code, lineComment, blockComment, string, character, rawString };
    State state = State::code;
    std::string out(text);
    std::string rawEnd;
    const auto blank = [&](std::size_t at) {
        if (out[at] != '\n') {
            out[at] = ' ';
        }
    };
    for (std::size_t i = 0; i < text.size(); ++i) {
        const std::string_view rest = text.substr(i);
        switch (state) {
        case State::code:
            if (rest.starts_with("//")) {
                state = State::lineComment;
                blank(i);
            } else if (rest.starts_with("/*")) {
                state = State::blockComment;
                blank(i);
                blank(++i);
            } else if (rest.starts_with("R\"") && rest.find('(') != rest.npos) {
                const std::size_t open = rest.find('(');
                rawEnd = ")" + std::string(rest.substr(2, open - 2)) + "\"";
                state = State::rawString;
                i += open;
            } else if (rest.front() == '"') {
                state = State::string;
            } else if (rest.front() == '\'' && (i == 0 || std::isalnum(static_cast<unsigned char>(text[i - 1])) == 0)) {
                // A quote behind a digit separates digits.
                state = State::character;
            }
            break;
        case State::lineComment:
            if (rest.front() == '\n') {
                state = State::code;
            }
            blank(i);
            break;
        case State::blockComment:
            if (rest.starts_with("*/")) {
                state = State::code;
                blank(i++);
            }
            blank(i);
            break;
        case State::string:
        case State::character:
            if (rest.front() == (state == State::string ? '"' : '\'') || rest.front() == '\n') {
                state = State::code;
                break;
            }
            if (literals == Literals::blank) {
                blank(i);
            }
            if (rest.front() == '\\' && i + 1 < text.size()) {
                ++i;
                if (literals == Literals::blank) {
                    blank(i);
                }
            }
            break;
        case State::rawString:
            if (rest.starts_with(rawEnd)) {
                state = State::code;
                i += rawEnd.size() - 1;
            } else if (literals == Literals::blank) {
                blank(i);
            }
            break;
        }
    }
    return out;
}

std::set<std::string> testNames() {
    static const std::regex macro(R"(TEST(?:_F|_P)?\((\w+), (\w+)\))");
    std::set<std::string> names;
    for (const SourceFile& file : filesBelow({"tests"}, {"Test.cc"}))
        for (std::sregex_iterator at(file.text.begin(), file.text.end(), macro); at != std::sregex_iterator(); ++at)
            names.insert((*at)[1].str() + "." + (*at)[2].str());
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

std::vector<Include> quotedIncludes(std::string_view text) {
    const std::string code = withoutComments(text, Literals::keep);
    std::vector<Include> includes;
    int number = 0;
    for (std::string_view line : splitLines(code)) {
        ++number;
        const std::size_t hash = line.find_first_not_of(" \t");
        if (hash == line.npos || line[hash] != '#') {
            continue;
        }
        line.remove_prefix(hash + 1);
        const std::size_t word = line.find_first_not_of(" \t");
        if (word == line.npos || !line.substr(word).starts_with("include")) {
            continue;
        }
        const std::size_t open = line.find('"');
        const std::size_t close = line.find('"', open == line.npos ? open : open + 1);
        if (close != line.npos) {
            includes.push_back({std::string(line.substr(open + 1, close - open - 1)), number});
        }
    }
    return includes;
}

} // namespace zor::house
