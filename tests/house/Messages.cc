// SPDX-License-Identifier: Apache-2.0
// Finds the calls that print messages and reads their format: the literals of one argument, one behind the other.
#include "house/Messages.h"

#include "house/SourceTree.h"

#include <algorithm>
#include <regex>

namespace zor::house {

namespace {

struct Printer {
    const char* name;
    std::size_t formatIndex;
};

constexpr Printer printers[] = {{"formatted", 0}, {"formattedList", 0}, {"posixError", 2}, {"makeError", 5},
                                {"write", 2},     {"ZOR_LOG", 2},       {"ZOR_REFUSE", 1}};

/// The arguments of the call whose parenthesis opens at `open`.
std::vector<std::string_view> argumentsOf(std::string_view text, std::size_t open) {
    std::vector<std::string_view> arguments;
    int depth = 0;
    std::size_t begin = open + 1;
    for (std::size_t at = open; at < text.size(); ++at) {
        const char c = text[at];
        if (c == '"' || (c == '\'' && !isWordCharacter(text[at - 1]))) {
            at = literalEnd(text, at) - 1;
        } else if (c == '(' || c == '{' || c == '[') {
            ++depth;
        } else if ((c == ')' || c == '}' || c == ']') && --depth == 0) {
            arguments.push_back(text.substr(begin, at - begin));
            break;
        } else if (c == ',' && depth == 1) {
            arguments.push_back(text.substr(begin, at - begin));
            begin = at + 1;
        }
    }
    return arguments;
}

/// The text of an argument that begins with a literal; a choice between two has two.
std::vector<std::string> formatsOf(std::string_view argument) {
    std::vector<std::string> formats;
    bool apart = true;
    for (std::size_t at = 0; at < argument.size(); ++at) {
        if (argument[at] == '"') {
            const std::size_t end = literalEnd(argument, at);
            if (apart)
                formats.emplace_back();
            formats.back() += argument.substr(at + 1, end - at - 2);
            apart = false;
            at = end - 1;
        } else if (argument[at] == ':' || argument[at] == '?') {
            apart = true;
        } else if (argument[at] == '(') {
            return {}; // a value that is computed, not a format
        }
    }
    return formats;
}

std::set<std::string> codesIn(std::string_view text) {
    static const std::regex code(R"(ErrorCode::(\w+))");
    std::set<std::string> codes;
    for (std::cregex_iterator at(text.begin(), text.end(), code); at != std::cregex_iterator(); ++at)
        codes.insert((*at)[1]);
    return codes;
}

/// The codes of the error that a call makes, or that the statement around a formatted text makes of it.
std::set<std::string> codesOf(const Printer& printer, std::string_view text, std::size_t call,
                              const std::vector<std::string_view>& arguments) {
    if (std::string_view(printer.name) == "makeError")
        return codesIn(arguments[2]);
    if (std::string_view(printer.name) == "ZOR_REFUSE")
        return {"metadataInvalid"};
    if (std::string_view(printer.name) != "formatted")
        return {};
    const std::size_t begin = text.substr(0, call).find_last_of(";{}") + 1;
    return codesIn(text.substr(begin, call - begin));
}

} // namespace

void addMessages(Messages& messages, std::string_view text) {
    for (const Printer& printer : printers) {
        const std::string opening = std::string(printer.name) + "(";
        for (std::size_t at = text.find(opening); at != text.npos; at = text.find(opening, at + 1)) {
            if (at > 0 && isWordCharacter(text[at - 1]))
                continue;
            const auto arguments = argumentsOf(text, at + opening.size() - 1);
            if (arguments.size() <= printer.formatIndex)
                continue;
            for (const std::string& format : formatsOf(arguments[printer.formatIndex]))
                messages[format].merge(codesOf(printer, text, at, arguments));
        }
    }
}

Messages messagesOfTheDaemon() {
    Messages messages;
    for (const SourceFile& file : filesBelow({"src"}, {".cc", ".h"}))
        if (!file.path.starts_with("src/check/")) // words of a tool's
            addMessages(messages, withoutComments(file.text, Literals::keep));
    return messages;
}

std::map<std::string, int> errorCodes() {
    static const std::regex code(R"((\w+) = (\d+),)");
    std::map<std::string, int> codes;
    const std::string text = readFile(checkoutRoot() + "/src/daemon/base/ErrorCode.h");
    for (std::sregex_iterator at(text.begin(), text.end(), code); at != std::sregex_iterator(); ++at)
        codes[(*at)[1]] = std::stoi((*at)[2]);
    return codes;
}

std::vector<std::string> unknownFormatFunctions() {
    static const std::regex declared(R"((\w+)\([^()]*\)\s*(?:const\s*)?__attribute__\(\(format\()");
    std::vector<std::string> unknown;
    for (const SourceFile& file : filesBelow({"src"}, {".h", ".cc"})) {
        if (file.text.find("__attribute__((format(") == file.text.npos)
            continue; // the expression is slow
        for (std::sregex_iterator at(file.text.begin(), file.text.end(), declared); at != std::sregex_iterator(); ++at)
            if (std::ranges::find(printers, (*at)[1].str(), &Printer::name) == std::end(printers))
                unknown.push_back((*at)[1]);
    }
    return unknown;
}

std::string printedForm(std::string_view format) {
    std::string printed;
    for (std::size_t at = 0; at < format.size(); ++at) {
        if (format[at] == '\\' && at + 1 < format.size() && format[at + 1] != 'n') {
            ++at;
            printed += format[at] == 't' ? '\t' : format[at];
        } else {
            printed += format[at];
        }
    }
    return printed;
}

} // namespace zor::house
