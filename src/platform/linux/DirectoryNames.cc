// SPDX-License-Identifier: Apache-2.0
#include "platform/linux/DirectoryNames.h"

#include "platform/FileDescriptor.h"

#include <algorithm>
#include <dirent.h>
#include <fcntl.h>
#include <memory>
#include <string_view>

namespace zor::platform {

namespace {
struct DirectoryCloser {
    void operator()(DIR* directory) const { ::closedir(directory); }
};
} // namespace

std::vector<std::string> directoryNames(int directory) {
    std::vector<std::string> names;
    FileDescriptor own(::openat(directory, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    const std::unique_ptr<DIR, DirectoryCloser> stream(own.valid() ? ::fdopendir(own.get()) : nullptr);
    if (!stream)
        return names;
    (void)own.release();
    while (const dirent* const entry = ::readdir(stream.get())) {
        const std::string_view name = entry->d_name;
        if (name != "." && name != "..")
            names.emplace_back(name);
    }
    std::ranges::sort(names);
    return names;
}

} // namespace zor::platform
