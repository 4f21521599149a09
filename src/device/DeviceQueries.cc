// SPDX-License-Identifier: Apache-2.0
#include "device/DeviceQueries.h"

#include "os/Names.h"
#include "os/Openat2.h"

#include <algorithm>
#include <fcntl.h>

namespace zor::platform {

namespace {

constexpr std::size_t releaseBytesMax = 64 * 1024;

/// Undoes the quoting of a shell assignment: '...' stands as it is, "..." has backslashes before " $ ` and itself.
std::string unquoted(std::string_view text) {
    while (!text.empty() && (text.back() == ' ' || text.back() == '\t' || text.back() == '\r'))
        text.remove_suffix(1);
    if (text.size() < 2 || text.front() != text.back() || (text.front() != '"' && text.front() != '\''))
        return std::string(text);
    const char quote = text.front();
    text = text.substr(1, text.size() - 2);
    if (quote == '\'')
        return std::string(text);
    std::string value;
    for (std::size_t i = 0; i < text.size(); ++i) {
        const bool escapes = text[i] == '\\' && i + 1 < text.size() &&
                             std::string_view("\"$`\\").find(text[i + 1]) != std::string_view::npos;
        value += text[escapes ? ++i : i];
    }
    return value;
}

} // namespace

std::string valueInRelease(std::string_view text, std::string_view key) {
    std::string value;
    while (!text.empty()) {
        const std::size_t end = text.find('\n');
        std::string_view line = text.substr(0, end);
        text = end == std::string_view::npos ? std::string_view() : text.substr(end + 1);
        line.remove_prefix(std::min(line.find_first_not_of(" \t"), line.size()));
        if (line.starts_with(key) && line.substr(key.size()).starts_with('='))
            value = unquoted(line.substr(key.size() + 1));
    }
    return value;
}

bool LinuxInternalBuildQuery::isInternalBuild() const {
    return openInRoot(root_.descriptor(), names::internalBuildMark, O_PATH).has_value();
}

std::string LinuxSystemVersionQuery::buildVersion() const {
    const auto file = openInRoot(root_.descriptor(), names::operatingSystemRelease, O_RDONLY | O_NONBLOCK);
    if (!file)
        return {};
    const auto text = readSmallFile(file->get(), releaseBytesMax);
    if (!text)
        return {};
    std::string build = valueInRelease(*text, "BUILD_ID");
    return build.empty() ? valueInRelease(*text, "VERSION_ID") : build;
}

} // namespace zor::platform
