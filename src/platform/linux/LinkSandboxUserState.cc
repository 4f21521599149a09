// SPDX-License-Identifier: Apache-2.0
#include "platform/linux/LinkSandboxUserState.h"

#include "platform/PercentEncoding.h"
#include "platform/linux/DirectoryNames.h"
#include "platform/linux/Names.h"
#include "platform/linux/Openat2.h"

#include <cerrno>
#include <climits>
#include <fcntl.h>
#include <unistd.h>

namespace zor::platform {

namespace {
constexpr mode_t directoryMode = 0755;
}

std::expected<FileDescriptor, int> LinkSandboxUserState::openDirectory(int parent, const char* name, Missing missing) {
    constexpr int flags = O_RDONLY | O_DIRECTORY;
    auto opened = openBeneath(parent, name, flags);
    if (opened || opened.error() != ENOENT || missing == Missing::fail)
        return opened;
    const int made = disk_.makeDirectory(parent, name, directoryMode);
    if (made < 0 && made != -EEXIST)
        return std::unexpected(-made);
    opened = openBeneath(parent, name, flags);
    if (opened && made == 0) {
        if (const int changed = disk_.changeMode(opened->get(), directoryMode); changed < 0)
            return std::unexpected(-changed);
    }
    return opened;
}

std::expected<FileDescriptor, int> LinkSandboxUserState::directoryOf(std::uint32_t userId, SandboxItemType type,
                                                                     Missing missing) {
    const std::string user = std::to_string(userId);
    const std::string kind = std::to_string(static_cast<std::uint64_t>(type));
    auto directory = openDirectory(root_.runtimeDirectory(), names::sandboxDirectory, missing);
    if (directory)
        directory = openDirectory(directory->get(), user.c_str(), missing);
    if (directory)
        directory = openDirectory(directory->get(), kind.c_str(), missing);
    return directory;
}

int LinkSandboxUserState::setMapping(std::uint32_t userId, SandboxItemType type, std::string_view identifier,
                                     const std::optional<std::string>& path) {
    const std::string name = percentEncode(identifier);
    if (name.empty())
        return EINVAL;
    if (name.size() > componentBytesMax)
        return ENAMETOOLONG;
    const auto directory = directoryOf(userId, type, path ? Missing::make : Missing::fail);
    if (!path) {
        if (!directory)
            return directory.error() == ENOENT ? 0 : directory.error();
        const int removed = disk_.unlinkFile(directory->get(), name.c_str());
        return removed == -ENOENT ? 0 : -removed;
    }
    if (!directory)
        return directory.error();
    const std::string temporary = ".new-" + std::to_string(temporaryNames_.fetch_add(1, std::memory_order_relaxed));
    int made = disk_.makeSymbolicLink(path->c_str(), directory->get(), temporary.c_str());
    if (made == -EEXIST) {
        // Left by a daemon that was killed here.
        (void)disk_.unlinkFile(directory->get(), temporary.c_str());
        made = disk_.makeSymbolicLink(path->c_str(), directory->get(), temporary.c_str());
    }
    if (made < 0)
        return -made;
    const int renamed = disk_.rename(directory->get(), temporary.c_str(), directory->get(), name.c_str(), 0);
    if (renamed < 0)
        (void)disk_.unlinkFile(directory->get(), temporary.c_str());
    return -renamed;
}

unsigned LinkSandboxUserState::removeDanglingMappings() {
    unsigned removed = 0;
    const auto top = openDirectory(root_.runtimeDirectory(), names::sandboxDirectory, Missing::fail);
    if (!top)
        return 0;
    for (const std::string& user : directoryNames(top->get())) {
        const auto userDirectory = openDirectory(top->get(), user.c_str(), Missing::fail);
        if (!userDirectory)
            continue;
        for (const std::string& type : directoryNames(userDirectory->get())) {
            const auto directory = openDirectory(userDirectory->get(), type.c_str(), Missing::fail);
            if (directory)
                removed += removeDanglingIn(directory->get());
        }
    }
    return removed;
}

unsigned LinkSandboxUserState::removeDanglingIn(int directory) {
    unsigned removed = 0;
    for (const std::string& name : directoryNames(directory)) {
        if (name.front() == '.')
            (void)disk_.unlinkFile(directory, name.c_str());
        else if (isDangling(directory, name.c_str()) && disk_.unlinkFile(directory, name.c_str()) == 0)
            ++removed;
    }
    return removed;
}

bool LinkSandboxUserState::isDangling(int directory, const char* name) const {
    char buffer[PATH_MAX];
    const ssize_t bytes = ::readlinkat(directory, name, buffer, sizeof buffer);
    if (bytes < 0 || bytes == sizeof buffer)
        return false;
    const std::string_view target(buffer, static_cast<std::size_t>(bytes));
    const std::string inRoot = root_.path("/");
    std::string_view below = target;
    if (!root_.isDeviceRoot()) {
        if (!below.starts_with(inRoot))
            return true;
        below.remove_prefix(inRoot.size());
    }
    if (!below.starts_with('/'))
        return true;
    const auto found = openInRoot(root_.descriptor(), std::string(below).c_str(), O_PATH | O_NOFOLLOW);
    return !found && (found.error() == ENOENT || found.error() == ENOTDIR);
}

} // namespace zor::platform
