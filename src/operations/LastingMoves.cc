// SPDX-License-Identifier: Apache-2.0
#include "operations/LastingMoves.h"

#include "base/Mutex.h"
#include "os/FileDescriptor.h"

#include <algorithm>
#include <fcntl.h>

namespace zor {

std::optional<ZORError> LastingMoves::syncDirectories(std::vector<FileURL> changed) const {
    const auto path = [](const FileURL& url) { return url.path(); };
    std::ranges::sort(changed, {}, path);
    changed.erase(std::ranges::unique(changed, {}, path).begin(), changed.end());
    const platform::BlockingScope blocking;
    for (const FileURL& url : changed) {
        const auto directory = fileManager_.resolver().openDirectory(url);
        const Errno error = directory ? durability_.afterMove(directory->get()) : directory.error();
        if (error)
            return posixError(ZOR_HERE, error, "sync of %s failed: %s", url.c_str(), error.text());
    }
    return std::nullopt;
}

std::optional<ZORError> LastingMoves::syncDirectory(const platform::FileDescriptor& directory,
                                                    const FileURL& moved) const {
    const platform::BlockingScope blocking;
    const auto listing = platform::openBeneath(directory.get(), ".", O_RDONLY | O_DIRECTORY);
    const Errno error = listing ? durability_.afterMove(listing->get()) : listing.error();
    if (error)
        return posixError(ZOR_HERE, error, "sync of %s failed: %s", moved.deletingLastPathComponent().c_str(),
                          error.text());
    return std::nullopt;
}

Errno LastingMoves::orderBetween(const FileURL& changed, const FileURL& next) const {
    const platform::FileDescriptor first = TRY(fileManager_.resolver().openDirectory(changed));
    const platform::FileDescriptor second = TRY(fileManager_.resolver().openDirectory(next));
    return durability_.between(first.get(), second.get());
}

ZORError LastingMoves::notLasting(const char* function, ErrorCode code, const FileURL& container,
                                  const ZORError& cause) const {
    return Reporter(log_, function)
        .error(code, &cause, "%s is in its place, but a power cut may undo that (%s); ask for it again",
               container.c_str(), cause.text().c_str());
}

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
