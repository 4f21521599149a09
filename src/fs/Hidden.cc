// SPDX-License-Identifier: Apache-2.0
#include "fs/Hidden.h"

#include "os/Openat2.h"

#include <cerrno>
#include <fcntl.h>

namespace zor::fs {

std::optional<FileURL> hiddenBy(const PathResolver& resolver, platform::Disk& disk, const FileURL& url) {
    FileURL place = url;
    for (;;) {
        const auto opened = resolver.openDirectoryPath(place);
        if (opened)
            return disk.hidesNames(opened->get()) ? std::optional(std::move(place)) : std::nullopt;
        if (opened.error() != ENOENT)
            return std::nullopt;
        FileURL parent = place.deletingLastPathComponent();
        if (parent == place)
            return std::nullopt;
        place = std::move(parent);
    }
}

bool hidesNamesBelow(platform::Disk& disk, int directory, const char* name) {
    const auto below = platform::openBeneathOnMount(directory, name, O_PATH | O_DIRECTORY | O_NOFOLLOW);
    return below && disk.hidesNames(below->get());
}

} // namespace zor::fs
