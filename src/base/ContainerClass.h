// SPDX-License-Identifier: Apache-2.0
// Container classes inside the daemon: the numbers and names of the protocol, and the sets that operations ask about.
#pragma once

#include "ipc/ContainerClasses.h"

#include <cstdint>

namespace zor {

using ipc::ContainerClass;
using ipc::isBundleClass;
using ipc::isSystemClass;

[[nodiscard]] constexpr bool isValidClass(ContainerClass containerClass) {
    return ipc::isContainerClass(static_cast<std::uint64_t>(containerClass));
}

/// Classes whose containers lie in a mobile user's home. They are also the ones that carry a sandbox mapping.
[[nodiscard]] constexpr bool isPerUserClass(ContainerClass containerClass) {
    return isValidClass(containerClass) && !isBundleClass(containerClass) && !isSystemClass(containerClass);
}

/// The class's name, which is also its path below a base directory. Only for valid classes; NUL-terminated.
[[nodiscard]] constexpr const char* className(ContainerClass containerClass) {
    return ipc::containerClassNames[static_cast<std::size_t>(containerClass)].data();
}

} // namespace zor
