// SPDX-License-Identifier: Apache-2.0
#include "Output.h"

#include <algorithm>
#include <cstdio>
#include <iterator>
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

const char* adviceFor(const zorvane::Error& error) {
    using Kind = zorvane::Error::Kind;
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
    return error.kind == zorvane::Error::Kind::daemon ? exitDaemonError : exitUnreachable;
}

std::string shown(const zorvane::Value& value) {
    if (const auto* text = std::get_if<std::string>(&value.content))
        return printable(*text);
    if (const auto* boolean = std::get_if<bool>(&value.content))
        return *boolean ? "yes" : "no";
    return dumped(toJson(value), -1);
}

bool holdsMaps(const zorvane::List& list) {
    return !list.empty() && std::ranges::all_of(list, [](const zorvane::Value& element) {
        return std::holds_alternative<zorvane::Map>(element.content);
    });
}

std::string onOneLine(const zorvane::Map& map) {
    std::string text;
    for (const auto& [key, element] : map)
        text += (text.empty() ? "" : ", ") + printable(key) + " " + shown(element);
    return text;
}

} // namespace

void Output::json(const nlohmann::json& document) const {
    std::printf("%s\n", dumped(document).c_str());
}

void Output::line(const std::string& text) const {
    std::printf("%s\n", text.c_str());
}

void Output::table(const std::vector<std::string>& header, const std::vector<std::vector<std::string>>& rows) const {
    std::vector<std::size_t> widths;
    for (std::size_t column = 0; column < header.size(); ++column) {
        widths.push_back(header[column].size());
        for (const auto& row : rows)
            widths.back() = std::max(widths.back(), row[column].size());
    }
    const auto print = [&](const std::vector<std::string>& row) {
        for (std::size_t column = 0; column + 1 < row.size(); ++column)
            std::printf("%-*s  ", static_cast<int>(widths[column]), row[column].c_str());
        std::printf("%s\n", row.back().c_str());
    };
    print(header);
    for (const auto& row : rows)
        print(row);
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

int Output::error(const zorvane::Error& error, const std::string& while_) const {
    const int exitCode = exitCodeOf(error);
    if (isJson()) {
        nlohmann::json document = {{"error",
                                    {{"kind", kindName(error.kind)},
                                     {"message", error.message},
                                     {"advice", adviceFor(error)},
                                     {"while", while_}}}};
        if (error.kind == zorvane::Error::Kind::daemon)
            document["error"]["code"] = error.code;
        std::fprintf(stderr, "%s\n", dumped(document).c_str());
        return exitCode;
    }
    const std::string code =
        error.kind == zorvane::Error::Kind::daemon ? " (code " + std::to_string(error.code) + ")" : "";
    std::fprintf(stderr, "zorvanectl: %s: %s%s\n  What to do: %s.\n", printable(while_).c_str(), error.message.c_str(),
                 code.c_str(), adviceFor(error));
    return exitCode;
}

int Output::localError(int exitCode, const std::string& message, const std::string& advice,
                       const std::string& while_) const {
    if (isJson()) {
        const nlohmann::json document = {
            {"error", {{"kind", "local"}, {"message", message}, {"advice", advice}, {"while", while_}}}};
        std::fprintf(stderr, "%s\n", dumped(document).c_str());
    } else {
        std::fprintf(stderr, "zorvanectl: %s: %s\n  What to do: %s.\n", printable(while_).c_str(), message.c_str(),
                     advice.c_str());
    }
    return exitCode;
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
            } else {
                return content;
            }
        },
        value.content);
}

} // namespace zorvanectl
