// SPDX-License-Identifier: Apache-2.0
#include "operations/SandboxMappings.h"

namespace zor {

bool SandboxMappings::_setSandboxContainerMappingForUser(std::uint32_t userId, const std::string& identifier,
                                                         ContainerClass containerClass,
                                                         const std::optional<FileURL>& url) {
    const auto classNumber = static_cast<unsigned long long>(containerClass);
    if (!isPerUserClass(containerClass)) {
        log_.write(logLevelError, __func__, "Unsupported class for setting sandbox container mapping: %llu",
                   classNumber);
        return false;
    }
    const auto type = containerClass == ContainerClass::sharedAppGroup ? platform::SandboxItemType::groupContainer
                                                                       : platform::SandboxItemType::dataContainer;
    const auto typeNumber = static_cast<unsigned long long>(type);
    if (const Errno error = sandbox_.setMapping(userId, type, identifier, std::nullopt)) {
        log_.write(logLevelError, __func__,
                   "Failed to remove mapping for user: %u, itemType: %llu, identifier: %s, class: %llu, path: %s : %d",
                   userId, typeNumber, ZOR_SHOWN(identifier), classNumber, "(null)", error.number());
        return false;
    }
    if (!url)
        return true;
    if (const Errno error = sandbox_.setMapping(userId, type, identifier, url->path())) {
        log_.write(logLevelError, __func__,
                   "Failed to set mapping for user: %u, itemType: %llu, identifier %s, class: %llu, path: %s : %d",
                   userId, typeNumber, ZOR_SHOWN(identifier), classNumber, url->c_str(), error.number());
        return false;
    }
    return true;
}

} // namespace zor
