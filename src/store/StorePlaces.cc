// SPDX-License-Identifier: Apache-2.0
#include "store/StorePlaces.h"

#include "fs/ZORFileManager.h"
#include "store/Names.h"

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

} // namespace zor
