// SPDX-License-Identifier: Apache-2.0
#include "Output.h"

#include "Screen.h"
#include "plist/Value.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cwchar>
#include <iterator>
#include <numeric>
#include <unistd.h>

namespace zorvanectl {

namespace {

// Names are bytes; what is not UTF-8 is shown as a replacement character rather than ending the program. In ASCII: some
// characters beyond it steer terminals, and programs read either form.
std::string dumped(const nlohmann::json& document, int indent = 2) {
    return document.dump(indent, ' ', true, nlohmann::json::error_handler_t::replace);
}

const char* kindName(zorvane::Error::Kind kind) {
    using Kind = zorvane::Error::Kind;
    switch (kind) {
    case Kind::unreachable:
        return "unreachable";
    case Kind::refused:
        return "refused";
    case Kind::timedOut:
        return "timed-out";
    case Kind::protocol:
        return "protocol";
    case Kind::daemon:
        return "daemon";
    }
    return "unknown";
}

std::string adviceFor(const zorvane::Error& error) {
    using Kind = zorvane::Error::Kind;
    if (!error.advice.empty())
        return error.advice;
    switch (error.kind) {
    case Kind::unreachable:
        return "start the daemon (systemctl start zorvaned), or name its root with --root";
    case Kind::refused:
        return "'zorvanectl status' shows whom the daemon takes this program for; "
               "programs are named in etc/zorvane/identities.d";
    case Kind::timedOut:
        return "look at the daemon's log, or wait longer with --timeout";
    case Kind::protocol:
        return "check that client and daemon are of one version";
    case Kind::daemon:
        return zorvane::errorText(error.code).advice;
    }
    return "";
}

int exitCodeOf(const zorvane::Error& error) {
    using Kind = zorvane::Error::Kind;
    switch (error.kind) {
    case Kind::unreachable:
        return exitUnreachable;
    case Kind::refused:
        return exitRefused;
    case Kind::timedOut:
        return exitTimedOut;
    case Kind::protocol:
        break;
    case Kind::daemon:
        if (zorvane::isNotFound(error))
            return exitNotFound;
    }
    return exitDaemonError;
}

constexpr const char* underlined = "\033[4m";
constexpr const char* boldRed = "\033[1;31m";
constexpr const char* plain = "\033[0m";

std::string padded(const std::string& text, std::size_t columns) {
    const std::size_t taken = columnsOf(text);
    return text + std::string(columns > taken ? columns - taken : 0, ' ');
}

constexpr std::size_t gap = 2;
constexpr std::size_t continuationIndent = 4;

using Row = std::vector<std::string>;

/// The places of the cells of a table.
struct Layout {
    std::vector<std::size_t> widths;
    std::size_t columns = SIZE_MAX; // of the terminal
    bool lastBelow = false;         // the last cell of each row has a line to itself
};

std::size_t widthOf(const Row& cells, const std::vector<std::size_t>& widths) {
    std::size_t taken = 0;
    for (std::size_t column = 0; column + 1 < cells.size(); ++column)
        taken += std::max(widths[column], columnsOf(cells[column])) + gap;
    return taken + columnsOf(cells.back());
}

Layout layoutOf(const Row& header, const std::vector<Row>& rows) {
    Layout layout;
    if (const std::size_t columns = Screen::ofOutput().columns(); columns != 0)
        layout.columns = columns;
    for (std::size_t column = 0; column < header.size(); ++column) {
        layout.widths.push_back(columnsOf(header[column]));
        for (const Row& row : rows)
            layout.widths.back() = std::max(layout.widths.back(), columnsOf(row[column]));
    }
    if (std::accumulate(layout.widths.begin(), layout.widths.end(), gap * (header.size() - 1)) <= layout.columns)
        return layout;
    // A cell that is wider than its column is to be moves the rest of its own row alone.
    for (std::size_t column = 0; column < header.size(); ++column) {
        std::size_t narrowest = layout.widths[column];
        for (const Row& row : rows)
            narrowest = std::min(narrowest, columnsOf(row[column]));
        layout.widths[column] =
            std::max({columnsOf(header[column]), narrowest, std::min(layout.widths[column], layout.columns / 3)});
    }
    const auto tooWide =
        std::ranges::count_if(rows, [&](const Row& row) { return widthOf(row, layout.widths) > layout.columns; });
    layout.lastBelow = 2 * static_cast<std::size_t>(tooWide) > rows.size();
    return layout;
}

/// The cells of a row, on as many lines as the terminal's width makes of them.
std::string textOf(const Row& cells, const Layout& layout) {
    std::string text;
    std::size_t taken = 0;
    for (std::size_t column = 0; column < cells.size(); ++column) {
        const bool isLast = column + 1 == cells.size();
        const std::size_t width = std::max(layout.widths[column], columnsOf(cells[column]));
        const bool isBelow = isLast && layout.lastBelow && column != 0;
        if (isBelow ||
            (taken > continuationIndent && taken + (isLast ? columnsOf(cells[column]) : width) > layout.columns)) {
            text.erase(text.find_last_not_of(' ') + 1);
            text += "\n" + std::string(continuationIndent, ' ');
            taken = continuationIndent;
        }
        text += isLast ? cells[column] : padded(cells[column], width + gap);
        taken += width + gap;
    }
    return text;
}

std::string shown(const zorvane::Value& value) {
    // A string that reads like another kind of value is told apart from it: as an entitlement it grants nothing.
    if (const auto* text = std::get_if<std::string>(&value.content))
        return *text == "yes" || *text == "no" || *text == "true" || *text == "false" ? "the string \"" + *text + "\""
                                                                                      : printable(*text);
    if (const auto* boolean = std::get_if<bool>(&value.content))
        return *boolean ? "yes" : "no";
    return dumped(zorvanectl::toJson(value), -1);
}

bool holdsMaps(const zorvane::List& list) {
    return !list.empty() && std::ranges::all_of(list, [](const zorvane::Value& element) {
        return std::holds_alternative<zorvane::Map>(element.content);
    });
}

/// A text that is the only one among numbers names the rest of them.
std::string onOneLine(const zorvane::Map& map) {
    const auto isText = [](const auto& entry) { return std::holds_alternative<std::string>(entry.second.content); };
    const bool hasName = std::ranges::count_if(map, isText) == 1;
    std::string text = hasName ? shown(std::ranges::find_if(map, isText)->second) + ": " : "";
    const char* separator = "";
    for (const auto& entry : map) {
        if (hasName && isText(entry))
            continue;
        text += separator + printable(entry.first) + " " + shown(entry.second);
        separator = ", ";
    }
    return text;
}

} // namespace

void Output::json(nlohmann::json document) const {
    document["version"] = jsonVersion;
    std::printf("%s\n", dumped(document).c_str());
}

void Output::line(const std::string& text) const {
    std::printf("%s\n", text.c_str());
}

void Output::page() const {
    if (!isJson())
        Screen::ofOutput().page();
}

void Output::remark(const std::string& text) const {
    std::fprintf(stderr, "zorvanectl: %s\n", printable(text).c_str());
}

void Output::table(const std::vector<std::string>& header, const std::vector<std::vector<std::string>>& rows) const {
    page();
    const Layout layout = layoutOf(header, rows);
    const std::string names = textOf(header, layout);
    line(Screen::ofOutput().isColoured() ? underlined + names + plain : names);
    for (const Row& row : rows)
        line(textOf(row, layout));
}

void Output::tree(const std::string& name, const zorvane::Value& value, const std::string& indent) const {
    if (const auto* list = std::get_if<zorvane::List>(&value.content); list && holdsMaps(*list)) {
        line(indent + printable(name) + ":");
        for (const zorvane::Value& element : *list)
            line(indent + "  " + onOneLine(std::get<zorvane::Map>(element.content)));
        return;
    }
    const auto* map = std::get_if<zorvane::Map>(&value.content);
    if (!map) {
        line(indent + printable(name) + ": " + shown(value));
        return;
    }
    line(indent + printable(name) + ":");
    for (const auto& [key, element] : *map)
        tree(key, element, indent + "  ");
}

bool Output::agreed(const std::string& question, const std::string& while_) const {
    if (isJson() || ::isatty(STDIN_FILENO) == 0 || ::isatty(STDERR_FILENO) == 0) {
        (void)localError(exitUsage, question + " Nothing was done", "say --yes to have it done", while_);
        return false;
    }
    std::fprintf(stderr, "%s [y/N] ", question.c_str());
    const int answer = std::getchar();
    return answer == 'y' || answer == 'Y';
}

int Output::sayError(int exitCode, const std::string& message, const std::string& advice, const std::string& while_,
                     nlohmann::json details) const {
    if (isJson()) {
        details.update({{"message", message}, {"advice", advice}, {"while", while_}, {"exitCode", exitCode}});
        std::fprintf(stderr, "%s\n", dumped({{"version", jsonVersion}, {"error", std::move(details)}}).c_str());
        return exitCode;
    }
    const auto code = details.find("code");
    const std::string number = code == details.end() ? "" : " (code " + code->dump() + ")";
    const bool coloured = isColoured(STDERR_FILENO);
    std::fprintf(stderr, "zorvanectl: %s: %s%s%s%s\n  What to do: %s.\n", printable(while_).c_str(),
                 coloured ? boldRed : "", message.c_str(), coloured ? plain : "", number.c_str(), advice.c_str());
    return exitCode;
}

int Output::error(const zorvane::Error& error, const std::string& while_) const {
    nlohmann::json details = {{"kind", kindName(error.kind)}};
    if (error.kind == zorvane::Error::Kind::daemon)
        details["code"] = error.code;
    return sayError(exitCodeOf(error), error.message, adviceFor(error), while_, std::move(details));
}

int Output::localError(int exitCode, const std::string& message, const std::string& advice,
                       const std::string& while_) const {
    return sayError(exitCode, message, advice, while_, {{"kind", "local"}});
}

int Output::finished(int exitCode) const {
    errno = 0;
    const bool written = std::fflush(stdout) == 0 && std::ferror(stdout) == 0;
    const bool wasPaged = Screen::ofOutput().isPaged();
    const int error = errno;
    Screen::ofOutput().end();
    if (written || wasPaged)
        return exitCode;
    errno = error;
    const char* reason = errno == 0 ? nullptr : ::strerrordesc_np(errno);
    return localError(
        exitOutputLost,
        std::string("standard output cannot be written to") + (reason ? ": " : "") + (reason ? reason : ""),
        "what was asked for was done, or failed, all the same; make room, or have the output go elsewhere, "
        "and ask again with a command that only shows",
        "write the result");
}

bool fits(const std::vector<std::string>& header, const std::vector<std::vector<std::string>>& rows) {
    const Layout layout = layoutOf(header, rows);
    return std::ranges::all_of(rows, [&](const Row& row) { return widthOf(row, layout.widths) <= layout.columns; });
}

std::size_t columnsOf(const std::string& text) {
    std::size_t columns = 0;
    std::mbstate_t state{};
    for (std::size_t at = 0; at < text.size();) {
        wchar_t character = 0;
        const std::size_t bytes = std::mbrtowc(&character, text.data() + at, text.size() - at, &state);
        if (bytes == 0 || bytes > text.size() - at)
            return text.size(); // a locale that knows no such characters
        columns += static_cast<std::size_t>(std::max(::wcwidth(character), 0));
        at += bytes;
    }
    return columns;
}

std::optional<zorvane::Value> fromJson(const nlohmann::json& json) {
    zorvane::Value value;
    if (json.is_boolean()) {
        value.content = json.get<bool>();
    } else if (json.is_number_unsigned()) {
        value.content = json.get<std::uint64_t>();
    } else if (json.is_number_integer()) {
        value.content = json.get<std::int64_t>();
    } else if (json.is_number_float()) {
        value.content = json.get<double>();
    } else if (json.is_string()) {
        value.content = json.get<std::string>();
    } else if (json.is_array()) {
        zorvane::List& list = value.content.emplace<zorvane::List>();
        for (const auto& element : json) {
            auto converted = fromJson(element);
            if (!converted)
                return std::nullopt;
            list.push_back(std::move(*converted));
        }
    } else if (json.is_object()) {
        zorvane::Map& map = value.content.emplace<zorvane::Map>();
        for (const auto& [key, element] : json.items()) {
            auto converted = fromJson(element);
            if (!converted)
                return std::nullopt;
            map.emplace(key, std::move(*converted));
        }
    } else {
        return std::nullopt;
    }
    return value;
}

std::string shownBytes(const std::optional<std::uint64_t>& bytes) {
    if (!bytes)
        return "an unknown number of bytes";
    static constexpr const char* units[] = {"bytes", "KiB", "MiB", "GiB", "TiB"};
    auto shown = static_cast<double>(*bytes);
    std::size_t unit = 0;
    for (; shown >= 1024 && unit + 1 < std::size(units); ++unit)
        shown /= 1024;
    char text[32];
    std::snprintf(text, sizeof text, unit == 0 ? "%.0f %s" : "%.1f %s", shown, units[unit]);
    return text;
}

nlohmann::json toJson(const std::optional<std::uint64_t>& bytes) {
    return bytes ? nlohmann::json(*bytes) : nlohmann::json();
}

nlohmann::json toJson(const zorvane::Value& value) {
    return std::visit(
        [](const auto& content) -> nlohmann::json {
            using Content = std::decay_t<decltype(content)>;
            if constexpr (std::is_same_v<Content, zorvane::List>) {
                nlohmann::json array = nlohmann::json::array();
                for (const auto& element : content)
                    array.push_back(toJson(element));
                return array;
            } else if constexpr (std::is_same_v<Content, zorvane::Map>) {
                nlohmann::json object = nlohmann::json::object();
                for (const auto& [key, element] : content)
                    object[key] = toJson(element);
                return object;
            } else if constexpr (std::is_same_v<Content, zorvane::Data>) {
                const zor::plist::Value data(content);
                return zor::plist::describe(&data);
            } else if constexpr (std::is_same_v<Content, zorvane::Date>) {
                const zor::plist::Value date(zor::plist::Date{content.seconds});
                return zor::plist::describe(&date);
            } else {
                return content;
            }
        },
        value.content);
}

} // namespace zorvanectl
