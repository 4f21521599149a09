// SPDX-License-Identifier: Apache-2.0
// The meaning of a code and what to do about it. Asks nobody: the command works without a daemon.
#include "Explain.h"

#include "Commands.h"
#include "check/Finding.h"
#include "zorvane/Error.h"

#include <algorithm>
#include <charconv>
#include <cstdint>
#include <optional>
#include <string_view>

namespace zorvanectl {

namespace {

/// The parts that both kinds of code have.
struct Page {
    /// A number for the daemon's codes, a word for a check's.
    nlohmann::json code;
    std::string name;
    const char* meaning;
    const char* cause;
    const char* consequence;
    const char* whatToDo;
};

std::vector<Page> allPages() {
    std::vector<Page> pages;
    for (const std::uint64_t code : zorvane::errorCodes()) {
        const zorvane::ErrorText text = zorvane::errorText(code);
        pages.push_back({code, std::to_string(code), text.meaning, text.cause, text.consequence, text.advice});
    }
    for (const auto& page : zor::check::findingPages())
        pages.push_back({page.word, std::string(page.word), page.meaning, page.cause, page.consequence, page.whatToDo});
    return pages;
}

nlohmann::json toJson(const Page& page) {
    return {{"code", page.code},
            {"meaning", page.meaning},
            {"cause", page.cause},
            {"consequence", page.consequence},
            {"whatToDo", page.whatToDo}};
}

int listPages(const Output& output, const std::vector<Page>& pages) {
    if (output.isJson()) {
        nlohmann::json list = nlohmann::json::array();
        for (const Page& page : pages)
            list.push_back(toJson(page));
        output.json({{"codes", std::move(list)}});
        return exitDone;
    }
    std::vector<std::vector<std::string>> rows;
    for (const Page& page : pages)
        rows.push_back({page.name, page.meaning});
    output.table({"CODE", "MEANING"}, rows);
    return exitDone;
}

/// An errno of the system's, as the daemon answers it: plain, or with an offset where it would read as another code.
std::optional<Page> pageOfErrno(const std::string& text) {
    std::uint64_t number = 0;
    const auto [end, failure] = std::from_chars(text.data(), text.data() + text.size(), number);
    if (failure != std::errc() || end != text.data() + text.size())
        return std::nullopt;
    const zorvane::ErrorText found = zorvane::errorText(number);
    if (std::string_view(found.meaning) == zorvane::errorText(UINT64_MAX).meaning)
        return std::nullopt;
    return Page{number, text, found.meaning, found.cause, found.consequence, found.advice};
}

} // namespace

std::vector<std::pair<std::string, std::string>> explainedCodes() {
    std::vector<std::pair<std::string, std::string>> codes;
    for (const Page& page : allPages())
        codes.emplace_back(page.name, page.meaning);
    return codes;
}

int explain(const Output& output, const std::string& text) {
    std::vector<Page> pages = allPages();
    if (text.empty())
        return listPages(output, pages);
    if (auto found = pageOfErrno(text))
        pages.push_back(std::move(*found));
    const auto page = std::ranges::find(pages, text, &Page::name);
    if (page == pages.end())
        return output.localError(exitUsage, "this is no code", "'zorvanectl explain' lists all", "explain " + text);
    if (output.isJson()) {
        output.json(toJson(*page));
        return exitDone;
    }
    output.line(page->name + ": " + page->meaning);
    output.line(std::string("  Cause: ") + page->cause);
    output.line(std::string("  Consequence: ") + page->consequence);
    output.line(std::string("  What to do: ") + page->whatToDo);
    return exitDone;
}

} // namespace zorvanectl
