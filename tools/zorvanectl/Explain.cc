// SPDX-License-Identifier: Apache-2.0
// What a code means and what to do about it. Asks nobody: it works without a daemon.
#include "Commands.h"
#include "zorvane/Error.h"

#include <algorithm>
#include <charconv>
#include <cstdio>

namespace zorvanectl {

namespace {

nlohmann::json pageOf(std::uint64_t code) {
    const zorvane::ErrorText text = zorvane::errorText(code);
    return {{"code", code}, {"meaning", text.meaning}, {"whatToDo", text.advice}};
}

int listCodes(const Output& output, const std::vector<std::uint64_t>& codes) {
    if (output.isJson()) {
        nlohmann::json pages = nlohmann::json::array();
        for (const std::uint64_t code : codes)
            pages.push_back(pageOf(code));
        output.json(pages);
        return exitDone;
    }
    std::vector<std::vector<std::string>> rows;
    for (const std::uint64_t code : codes)
        rows.push_back({std::to_string(code), zorvane::errorText(code).meaning});
    output.table({"CODE", "MEANING"}, rows);
    return exitDone;
}

} // namespace

int explain(const Output& output, const std::string& text) {
    const std::vector<std::uint64_t> codes = zorvane::errorCodes();
    if (text.empty())
        return listCodes(output, codes);
    std::uint64_t code = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), code);
    if (error != std::errc() || end != text.data() + text.size() || !std::ranges::binary_search(codes, code)) {
        std::fprintf(stderr, "zorvanectl: '%s' is no code; 'zorvanectl explain' lists all\n", printable(text).c_str());
        return exitUsage;
    }
    if (output.isJson()) {
        output.json(pageOf(code));
        return exitDone;
    }
    output.line("code " + text + ": " + zorvane::errorText(code).meaning);
    output.line("  What to do: " + std::string(zorvane::errorText(code).advice));
    return exitDone;
}

} // namespace zorvanectl
