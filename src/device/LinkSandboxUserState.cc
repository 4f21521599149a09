// SPDX-License-Identifier: Apache-2.0
#include "device/LinkSandboxUserState.h"

#include "ipc/Identifiers.h"
#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"
#include "platform/Errno.h"

#include <cerrno>
#include <charconv>
#include <climits>
#include <fcntl.h>
#include <unistd.h>

namespace zor::platform {

void forEachSandboxDirectory(const SystemRoot& root, const std::function<void(const SandboxDirectory&)>& found) {
    constexpr int flags = O_RDONLY | O_DIRECTORY;
    const auto top = openBeneath(root.runtimeDirectory(), names::sandboxDirectory, flags);
    if (!top)
        return;
    for (const std::string& user : directoryNamesIfAny(top->get())) {
        const auto userDirectory = openBeneath(top->get(), user.c_str(), flags);
        if (!userDirectory)
            continue;
        for (const std::string& itemType : directoryNamesIfAny(userDirectory->get()))
            if (const auto directory = openBeneath(userDirectory->get(), itemType.c_str(), flags))
                found({.descriptor = directory->get(), .user = user, .itemType = itemType});
    }
}

std::optional<std::uint32_t> SandboxDirectory::userId() const {
    std::uint32_t number = 0;
    const char* const end = user.data() + user.size();
    const auto [last, error] = std::from_chars(user.data(), end, number);
    return error == std::errc() && last == end ? std::optional(number) : std::nullopt;
}

bool isDanglingSandboxLink(const SystemRoot& root, int directory, const char* name,
                           const std::function<bool(const std::string& path)>& isGone) {
    char buffer[PATH_MAX];
    const ssize_t bytes = ::readlinkat(directory, name, buffer, sizeof buffer);
    if (bytes < 0 || bytes == sizeof buffer)
        return false;
    std::string_view below(buffer, static_cast<std::size_t>(bytes));
    if (!root.isDeviceRoot()) {
        const std::string inRoot = root.path("/");
        if (!below.starts_with(inRoot))
            return true;
        below.remove_prefix(inRoot.size());
    }
    if (!below.starts_with('/'))
        return true;
    return isGone(std::string(buffer, static_cast<std::size_t>(bytes)));
}

namespace {
constexpr mode_t directoryMode = 0755;
}

ErrnoOr<FileDescriptor> LinkSandboxUserState::openDirectory(int parent, const char* name, Missing missing) {
    constexpr int flags = O_RDONLY | O_DIRECTORY;
    auto opened = openBeneath(parent, name, flags);
    if (opened || opened.error() != ENOENT || missing == Missing::fail)
        return opened;
    const Errno made = disk_.makeDirectory(parent, name, directoryMode);
    if (made && made != EEXIST)
        return made;
    opened = openBeneath(parent, name, flags);
    if (opened && !made)
        TRY(disk_.changeMode(opened->get(), directoryMode));
    return opened;
}

ErrnoOr<FileDescriptor> LinkSandboxUserState::directoryOf(std::uint32_t userId, SandboxItemType type, Missing missing) {
    const std::string user = std::to_string(userId);
    const std::string kind = std::to_string(static_cast<std::uint64_t>(type));
    auto directory = openDirectory(root_.runtimeDirectory(), names::sandboxDirectory, missing);
    if (directory)
        directory = openDirectory(directory->get(), user.c_str(), missing);
    if (directory)
        directory = openDirectory(directory->get(), kind.c_str(), missing);
    return directory;
}

Errno LinkSandboxUserState::setMapping(std::uint32_t userId, SandboxItemType type, std::string_view identifier,
                                       const std::optional<std::string>& path) {
    const std::string name = ipc::percentEncode(identifier);
    if (name.empty())
        return Errno(EINVAL);
    if (name.size() > ipc::componentBytesMax)
        return Errno(ENAMETOOLONG);
    const auto directory = directoryOf(userId, type, path ? Missing::make : Missing::fail);
    if (!path) {
        if (!directory)
            return directory.error() == ENOENT ? Errno() : directory.error();
        const Errno removed = disk_.unlinkFile(directory->get(), name.c_str());
        return removed == ENOENT ? Errno() : removed;
    }
    if (!directory)
        return directory.error();
    const std::string temporary = ".new-" + std::to_string(temporaryNames_.fetch_add(1, std::memory_order_relaxed));
    Errno made = disk_.makeSymbolicLink(path->c_str(), directory->get(), temporary.c_str());
    if (made == EEXIST) {
        // Left by a daemon that was killed here.
        (void)disk_.unlinkFile(directory->get(), temporary.c_str());
        made = disk_.makeSymbolicLink(path->c_str(), directory->get(), temporary.c_str());
    }
    if (made)
        return made;
    const Errno renamed = disk_.rename(directory->get(), temporary.c_str(), directory->get(), name.c_str(), 0);
    if (renamed)
        (void)disk_.unlinkFile(directory->get(), temporary.c_str());
    return renamed;
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
                     !disk_.unlinkFile(directory.descriptor, name.c_str()))
                ++removed;
        }
    });
    return removed;
}

} // namespace zor::platform
