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
    return makeError(log_, {function, __LINE__}, code, &cause, LogFlag::yes,
                     "%s is in its place, but a power cut may undo that (%s); ask for it again", container.c_str(),
                     cause.text().c_str());
}

} // namespace zor
