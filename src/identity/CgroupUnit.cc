// SPDX-License-Identifier: Apache-2.0
#include "identity/CgroupUnit.h"

namespace zor::platform {

namespace {

/// The path in a line of the unified hierarchy, or of the manager's own one on systems that still have several.
std::string_view managerPath(std::string_view line) {
    const std::size_t first = line.find(':');
    const std::size_t second = line.find(':', first == line.npos ? first : first + 1);
    if (second == line.npos)
        return {};
    const std::string_view controllers = line.substr(first + 1, second - first - 1);
    const bool isUnified = line.substr(0, first) == "0" && controllers.empty();
    return isUnified || controllers == "name=systemd" ? line.substr(second + 1) : std::string_view();
}

std::string unitInPath(std::string_view path) {
    while (!path.empty()) {
        path.remove_prefix(path.front() == '/' ? 1 : 0);
        std::string_view name = path.substr(0, path.find('/'));
        path.remove_prefix(name.size());
        if (name.ends_with(".slice"))
            continue;
        // The manager puts an underscore before names that the kernel could mistake for its own files.
        name.remove_prefix(name.starts_with('_') ? 1 : 0);
        return std::string(name);
    }
    return {};
}

} // namespace

std::string systemUnitInCgroups(std::string_view cgroups) {
    std::string unit;
    while (!cgroups.empty()) {
        const std::string_view line = cgroups.substr(0, cgroups.find('\n'));
        cgroups.remove_prefix(line.size() < cgroups.size() ? line.size() + 1 : line.size());
        const std::string_view path = managerPath(line);
        // With several hierarchies the unified one may know no units; the manager's own line counts wherever it stands.
        if (std::string found = unitInPath(path); !found.empty())
            unit = std::move(found);
    }
    return unit;
}

} // namespace zor::platform
