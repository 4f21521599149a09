// SPDX-License-Identifier: Apache-2.0
#include "store/StorePlaces.h"

#include "fs/ZORFileManager.h"
#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"
#include "platform/Errno.h"

#include <cerrno>
#include <fcntl.h>

namespace zor {

namespace {

FileURL place(const fs::PathResolver& resolver, std::string_view systemPath) {
    return FileURL::directory(resolver.root().path(systemPath));
}

} // namespace

StorePlaces::StorePlaces(const fs::PathResolver& resolver)
    : homeDirectory_(place(resolver, names::rootHome)), brevadHomeDirectory_(place(resolver, names::brevadHome)),
      sharedContainersDirectory_(place(resolver, names::sharedContainers)),
      temporaryDirectory_(place(resolver, names::temporary)),
      formerContainersDirectory_(place(resolver, names::formerContainers)) {}

void StorePlaces::fenceMounts(ZORFileManager& fileManager) const {
    using Kind = fs::MountFence::Kind;
    fileManager.fence(sharedContainersDirectory_, Kind::systemPlace);
    fileManager.fence(transientDirectory(), Kind::systemPlace);
    fileManager.fence(transientBundleDirectory(), Kind::systemPlace);
    fileManager.fence(formerContainersDirectory_.deletingLastPathComponent(), Kind::home);
}

FileURL StorePlaces::logDirectory() const {
    return homeDirectory_.appendingDirectory(names::logs);
}

FileURL StorePlaces::cachesDirectory() const {
    return homeDirectory_.appendingDirectory(names::caches);
}

FileURL StorePlaces::libraryDirectory() const {
    return homeDirectory_.appendingDirectory(names::library);
}

FileURL StorePlaces::transientDirectory() const {
    return cachesDirectory().appendingDirectory(names::transient);
}

FileURL StorePlaces::transientBundleDirectory() const {
    return brevadHomeDirectory_.appendingDirectory(names::caches);
}

FileURL StorePlaces::stagingDirectory() const {
    return cachesDirectory().appendingDirectory(names::staging);
}

FileURL StorePlaces::deathrowDirectory() const {
    return cachesDirectory().appendingDirectory(names::deathrow);
}

FileURL StorePlaces::replaceDirectory() const {
    return libraryDirectory().appendingDirectory(names::replace);
}

FileURL StorePlaces::bundleDirectory() const {
    return sharedContainersDirectory_.appendingDirectory(names::bundle);
}

FileURL StorePlaces::entitlementFile() const {
    return libraryDirectory().appendingFile(names::entitlementFile);
}

FileURL StorePlaces::unreadableEntitlementFile() const {
    return libraryDirectory().appendingFile(names::unreadableEntitlementFile);
}

FileURL StorePlaces::formerBundleDirectory() const {
    return formerContainersDirectory_.appendingDirectory(names::bundle);
}

FileURL StorePlaces::formerBundleDirectory(ContainerClass containerClass) const {
    return formerContainersDirectory_.appendingDirectory(className(containerClass));
}

std::vector<FileURL> StorePlaces::placesOfSharedContainers() const {
    return {homeDirectory_, sharedContainersDirectory_, brevadHomeDirectory_, formerContainersDirectory_};
}

FileURL StorePlaces::userBaseDirectory(const FileURL& home) {
    return home.appendingDirectory(names::userContainers);
}

FileURL StorePlaces::userTransientDirectory(const FileURL& home) {
    return userBaseDirectory(home).appendingDirectory(names::caches).appendingDirectory(names::transient);
}

std::optional<FileURL> StorePlaces::baseOfClass(ContainerClass containerClass, bool transient,
                                                const std::optional<FileURL>& userHome) const {
    if (isBundleClass(containerClass))
        return transient ? transientBundleDirectory() : sharedContainersDirectory_;
    if (isSystemClass(containerClass))
        return transient ? transientDirectory() : sharedContainersDirectory_;
    if (!userHome)
        return std::nullopt;
    return transient ? userTransientDirectory(*userHome) : userBaseDirectory(*userHome);
}

namespace {

bool isMissing(const platform::SystemRoot& root, const std::string& path, int flags) {
    const auto opened = platform::openInRoot(root.descriptor(), path.c_str(), O_PATH | flags);
    return !opened && (opened.error() == ENOENT || opened.error() == ENOTDIR);
}

} // namespace

ContainerPlace::ContainerPlace(std::shared_ptr<const ContainerParent> parent, std::string_view name)
    : parent_(std::move(parent)) {
    const auto uuid = UUID::parse(name);
    if (uuid && uuid->string() == name)
        uuid_ = *uuid;
    else
        parent_ = std::make_shared<const ContainerParent>(parent_->path, std::string(name));
}

ContainerPlace::ContainerPlace(const FileURL& url)
    : ContainerPlace(std::make_shared<const ContainerParent>(url.deletingLastPathComponent().path()),
                     url.lastPathComponent()) {}

FileURL ContainerPlace::url() const {
    if (empty())
        return {};
    const std::string own = name();
    std::string path;
    path.reserve(parentPath().size() + 1 + own.size());
    path += parentPath();
    path += '/';
    path += own;
    return FileURL::directory(std::move(path));
}

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

namespace {
constexpr const char* dataSubdirectories[] = {"Documents", "Library", "Library/Caches", "Library/Preferences",
                                              names::containerTemporary};
constexpr const char* groupSubdirectories[] = {"Library", "Library/Caches"};
} // namespace

ContainerLayout layoutOf(ContainerClass containerClass, std::uint32_t userId) {
    ZOR_ASSERT(isValidClass(containerClass));
    ContainerLayout layout;
    if (isBundleClass(containerClass)) {
        layout.topLevelOwner = userId;
        return layout;
    }
    const bool group =
        containerClass == ContainerClass::sharedAppGroup || containerClass == ContainerClass::sharedSystemGroup;
    layout.subdirectories =
        group ? std::span<const char* const>(groupSubdirectories) : std::span<const char* const>(dataSubdirectories);
    if (isSystemClass(containerClass)) {
        layout.subdirectoryMode = 0777; // services of several users work in them
    } else {
        layout.subdirectoryOwner = userId;
        layout.topLevelOwner = userId;
    }
    return layout;
}

std::optional<std::uint32_t> topLevelOwnerOf(ContainerClass containerClass, std::uint32_t userId) {
    const std::uint32_t owner = layoutOf(containerClass, userId).topLevelOwner;
    return owner == ownerUnchanged ? std::nullopt : std::optional(owner);
}

} // namespace zor
