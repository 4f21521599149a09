// SPDX-License-Identifier: Apache-2.0
// Telling the sandbox where a user's data and group containers are. A stop between the removal of a mapping and its new
// setting leaves none; the operation that sets it is repeated or rolled back by its own recovery.
#include "operations/StoreServices.h"
#include "operations/ZORClientConnection.h"

namespace zor {

bool ZORClientConnection::_setSandboxContainerMappingForUser(std::uint32_t userId, const std::string& identifier,
                                                             ContainerClass containerClass,
                                                             const std::optional<FileURL>& url) {
    const auto classNumber = static_cast<unsigned long long>(containerClass);
    if (!isPerUserClass(containerClass)) {
        services_.log.write(logLevelError, __func__, "Unsupported class for setting sandbox container mapping: %llu",
                            classNumber);
        return false;
    }
    const auto type = containerClass == ContainerClass::sharedAppGroup ? platform::SandboxItemType::groupContainer
                                                                       : platform::SandboxItemType::dataContainer;
    const auto typeNumber = static_cast<unsigned long long>(type);
    if (const int status = services_.sandbox.setMapping(userId, type, identifier, std::nullopt)) {
        services_.log.write(
            logLevelError, __func__,
            "Failed to remove mapping for user: %u, itemType: %llu, identifier: %s, class: %llu, path: %s : %d", userId,
            typeNumber, ZOR_SHOWN(identifier), classNumber, "(null)", status);
        return false;
    }
    if (!url)
        return true;
    if (const int status = services_.sandbox.setMapping(userId, type, identifier, url->path())) {
        services_.log.write(
            logLevelError, __func__,
            "Failed to set mapping for user: %u, itemType: %llu, identifier %s, class: %llu, path: %s : %d", userId,
            typeNumber, ZOR_SHOWN(identifier), classNumber, url->c_str(), status);
        return false;
    }
    return true;
}

} // namespace zor
