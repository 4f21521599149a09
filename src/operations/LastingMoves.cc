// SPDX-License-Identifier: Apache-2.0
#include "operations/LastingMoves.h"

#include "base/BlockingScope.h"
#include "os/Openat2.h"

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
        const int status = directory ? durability_.afterMove(directory->get()) : -directory.error().number();
        if (status < 0)
            return posixError(ZOR_HERE, -status, "sync of %s failed: %s", url.c_str(), errorText(-status));
    }
    return std::nullopt;
}

std::optional<ZORError> LastingMoves::syncDirectory(const platform::FileDescriptor& directory,
                                                    const FileURL& moved) const {
    const platform::BlockingScope blocking;
    const auto listing = platform::openBeneath(directory.get(), ".", O_RDONLY | O_DIRECTORY);
    const int status = listing ? durability_.afterMove(listing->get()) : -listing.error().number();
    if (status < 0)
        return posixError(ZOR_HERE, -status, "sync of %s failed: %s", moved.deletingLastPathComponent().c_str(),
                          errorText(-status));
    return std::nullopt;
}

int LastingMoves::orderBetween(const FileURL& changed, const FileURL& next) const {
    const auto first = fileManager_.resolver().openDirectory(changed);
    const auto second = fileManager_.resolver().openDirectory(next);
    if (!first || !second)
        return -(first ? second.error() : first.error()).number();
    return durability_.between(first->get(), second->get());
}

ZORError LastingMoves::notLasting(const char* function, ErrorCode code, const FileURL& container,
                                  const ZORError& cause) const {
    return makeError(log_, {function, __LINE__}, code, &cause, LogFlag::yes,
                     "%s is in its place, but a power cut may undo that (%s); ask for it again", container.c_str(),
                     cause.text().c_str());
}

} // namespace zor
