// SPDX-License-Identifier: Apache-2.0
#include "ItemRules.h"

#include "fs/Names.h"
#include "zorvane/Text.h"

#include <algorithm>
#include <sys/stat.h>

namespace zorvanectl::content {

namespace {

/// The next component of a path, which loses it; empty ones are skipped. nullopt at the end.
std::optional<std::string_view> nextComponent(std::string_view& path) {
    path.remove_prefix(std::min(path.find_first_not_of('/'), path.size()));
    if (path.empty())
        return std::nullopt;
    const std::string_view component = path.substr(0, path.find('/'));
    path.remove_prefix(component.size());
    return component;
}

std::optional<std::string> whyLinkRefused(std::string_view name, std::string_view target) {
    if (target.empty())
        return "a symbolic link without a target";
    if (target.size() > nameBytesMax)
        return "its target is too long";
    if (target.front() == '/')
        return "a symbolic link to an absolute path leads out of the container";
    // Directories between the top and the link.
    auto above = std::ranges::count(name, '/');
    bool named = false;
    while (const auto component = nextComponent(target)) {
        if (*component != "..") {
            named = named || *component != ".";
        } else if (named) {
            return "a symbolic link with .. behind a name may lead out of the container";
        } else if (above-- == 0) {
            return "a symbolic link that leads out of the container";
        }
    }
    return std::nullopt;
}

} // namespace

std::expected<std::string, std::string> plainName(std::string_view name) {
    if (name.empty())
        return std::unexpected("it has no name");
    if (name.front() == '/')
        return std::unexpected("the name is absolute");
    std::string plain;
    while (const auto component = nextComponent(name)) {
        if (*component == "..")
            return std::unexpected("the name leads up with ..");
        if (*component == ".")
            continue;
        if (component->find('\0') != component->npos)
            return std::unexpected("the name holds a NUL");
        if (component->size() > componentBytesMax)
            return std::unexpected("a name of more than " + std::to_string(componentBytesMax) + " bytes");
        if (!plain.empty())
            plain += '/';
        plain += *component;
        if (plain.size() > nameBytesMax)
            return std::unexpected("a path of more than " + std::to_string(nameBytesMax) + " bytes");
    }
    return plain;
}

std::optional<std::string> whyRefused(const Item& item) {
    if (item.name.substr(0, item.name.find('/')) == zor::names::metadataFile)
        return "this is the name of the container's own metadata file";
    switch (item.mode & S_IFMT) {
    case S_IFREG:
        if ((item.mode & (S_ISUID | S_ISGID)) != 0)
            return "it would run with the powers of its owner (set-user-ID or set-group-ID)";
        return std::nullopt;
    case S_IFDIR:
        return std::nullopt;
    case S_IFLNK:
        return whyLinkRefused(item.name, item.linkTarget);
    case S_IFIFO:
        return "a FIFO is no content";
    case S_IFSOCK:
        return "a socket is no content";
    case S_IFCHR:
    case S_IFBLK:
        return "a device is no content";
    default:
        return "it is neither file, directory nor symbolic link";
    }
}

std::string refusal(std::string_view name, std::string_view reason) {
    return zorvane::printable(std::string(name)) + " is refused: " + std::string(reason);
}

} // namespace zorvanectl::content
