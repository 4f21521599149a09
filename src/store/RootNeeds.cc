// SPDX-License-Identifier: Apache-2.0
#include "store/RootNeeds.h"

#include "os/Names.h"
#include "os/Openat2.h"

#include <cerrno>
#include <fcntl.h>

namespace zor {

namespace {

bool isMissing(const platform::SystemRoot& root, const std::string& path, int flags) {
    const auto opened = platform::openInRoot(root.descriptor(), path.c_str(), O_PATH | flags);
    return !opened && (opened.error() == ENOENT || opened.error() == ENOTDIR);
}

} // namespace

std::vector<std::string> missingOf(const platform::SystemRoot& root) {
    std::vector<std::string> missing;
    if (!root.isDeviceRoot() && isMissing(root, platform::names::passwordFile, 0))
        missing.emplace_back(platform::names::passwordFile);
    for (const RootDirectory& directory : rootDirectories)
        if (std::string path(directory.path); isMissing(root, path, O_DIRECTORY))
            missing.push_back(std::move(path));
    return missing;
}

std::string initCommand(const platform::SystemRoot& root) {
    return root.isDeviceRoot() ? "zorvanectl init" : "zorvanectl init --root " + root.canonicalPath();
}

std::string lineAboutMissing(const platform::SystemRoot& root, const std::vector<std::string>& missing) {
    std::string names;
    for (const std::string& path : missing)
        names += (names.empty() ? "" : ", ") + path;
    return "the root " + root.canonicalPath() + " lacks " + names + "; make what it has to hold: " + initCommand(root);
}

} // namespace zor
