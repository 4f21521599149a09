// SPDX-License-Identifier: Apache-2.0
#include "os/DirectoryNames.h"

#include "os/FileDescriptor.h"

#include <algorithm>
#include <cerrno>
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

std::expected<std::vector<std::string>, int> directoryNames(int directory) {
    std::vector<std::string> names;
    FileDescriptor own(::openat(directory, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    const std::unique_ptr<DIR, DirectoryCloser> stream(own.valid() ? ::fdopendir(own.get()) : nullptr);
    if (!stream)
        return std::unexpected(errno);
    (void)own.release();
    for (;;) {
        errno = 0;
        const dirent* const entry = ::readdir(stream.get());
        if (!entry && errno != 0)
            return std::unexpected(errno);
        if (!entry)
            break;
        const std::string_view name = entry->d_name;
        if (name != "." && name != "..")
            names.emplace_back(name);
    }
    std::ranges::sort(names);
    return names;
}

std::vector<std::string> directoryNamesIfAny(int directory) {
    return directoryNames(directory).value_or(std::vector<std::string>());
}

} // namespace zor::platform
