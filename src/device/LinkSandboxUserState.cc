// SPDX-License-Identifier: Apache-2.0
#include "device/LinkSandboxUserState.h"

#include "base/PercentEncoding.h"
#include "device/SandboxLinks.h"
#include "os/DirectoryNames.h"
#include "os/Names.h"
#include "os/Openat2.h"

#include <cerrno>
#include <fcntl.h>

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

unsigned LinkSandboxUserState::removeDanglingMappings(const std::function<bool(std::uint32_t userId)>& mayConclude,
                                                      const std::function<bool(const std::string& path)>& isGone) {
    unsigned removed = 0;
    forEachSandboxDirectory(root_, [&](const SandboxDirectory& directory) {
        const auto userId = directory.userId();
        const bool concludes = !userId || mayConclude(*userId);
        for (const std::string& name : directoryNamesIfAny(directory.descriptor)) {
            if (isSandboxLeftover(name))
                (void)disk_.unlinkFile(directory.descriptor, name.c_str());
            else if (concludes && isDanglingSandboxLink(root_, directory.descriptor, name.c_str(), isGone) &&
                     disk_.unlinkFile(directory.descriptor, name.c_str()) == 0)
                ++removed;
        }
    });
    return removed;
}

} // namespace zor::platform
