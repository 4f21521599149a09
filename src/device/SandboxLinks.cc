// SPDX-License-Identifier: Apache-2.0
#include "device/SandboxLinks.h"

#include "os/DirectoryNames.h"
#include "os/Names.h"
#include "os/Openat2.h"

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

} // namespace zor::platform
