// SPDX-License-Identifier: Apache-2.0
// The kinds of container and their names. The number is what requests carry and metadata files hold; the name is also
// the path of the class's directory, relative to the directory that holds all of them.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <string_view>

namespace zor::ipc {

enum class ContainerClass : std::uint64_t {
    undefined = 0,
    bundleApplication = 1,
    dataApplication = 2,
    bundleKolvexPlugin = 3,
    dataKolvexPlugin = 4,
    bundleVPNPlugin = 5,
    dataVPNPlugin = 6,
    sharedAppGroup = 7,
    bundleFramework = 8,
    dataIpsiService = 9,
    dataInternalDaemon = 10,
    dataTempDir = 11,
    dataSystem = 12,
    sharedSystemGroup = 13,
    /// The bound: valid classes are below it, and above undefined.
    max = 14,
};

/// Names by number. Index 0 is no class.
inline constexpr std::array<std::string_view, 14> containerClassNames = {
    "Undefined",           "Bundle/Application", "Data/Application", "Bundle/KolvexPlugin", "Data/KolvexPlugin",
    "Bundle/VPNPlugin",    "Data/VPNPlugin",     "Shared/AppGroup",  "Bundle/Framework",    "Data/IpsiService",
    "Data/InternalDaemon", "Data/TempDir",       "Data/System",      "Shared/SystemGroup",
};
static_assert(containerClassNames.size() == static_cast<std::size_t>(ContainerClass::max));

[[nodiscard]] constexpr bool isContainerClass(std::uint64_t number) {
    return number > static_cast<std::uint64_t>(ContainerClass::undefined) &&
           number < static_cast<std::uint64_t>(ContainerClass::max);
}

/// The exact name of a valid class, nothing else.
[[nodiscard]] constexpr std::optional<ContainerClass> containerClassOfName(std::string_view name) {
    for (std::size_t number = 1; number < containerClassNames.size(); ++number)
        if (containerClassNames[number] == name)
            return static_cast<ContainerClass>(number);
    return std::nullopt;
}

/// Containers of these classes hold code; they belong to one user for the whole system.
[[nodiscard]] constexpr bool isBundleClass(ContainerClass containerClass) {
    return containerClass == ContainerClass::bundleApplication ||
           containerClass == ContainerClass::bundleKolvexPlugin || containerClass == ContainerClass::bundleVPNPlugin ||
           containerClass == ContainerClass::bundleFramework;
}

[[nodiscard]] constexpr bool isSystemClass(ContainerClass containerClass) {
    return containerClass == ContainerClass::dataSystem || containerClass == ContainerClass::sharedSystemGroup;
}

} // namespace zor::ipc
