// SPDX-License-Identifier: Apache-2.0
// The places of everything in the store, below a system root. Paths are put together here and nothing else: nothing is
// made, nothing is looked at. ZORGlobalConfiguration makes the directories; a reader that only looks needs no more than
// this.
//
// Immutable after it is made; any thread.
#pragma once

#include "base/ContainerClass.h"
#include "base/FileURL.h"
#include "fs/PathResolver.h"

#include <optional>
#include <vector>

namespace zor {

class ZORFileManager;

class StorePlaces {
public:
    explicit StorePlaces(const fs::PathResolver& resolver);

    /// Sees to it that no mount is crossed where the system's containers lie, whoever works in them.
    void fenceMounts(ZORFileManager& fileManager) const;

    /// The home of the daemon's own directories.
    [[nodiscard]] const FileURL& homeDirectory() const { return homeDirectory_; }
    [[nodiscard]] const FileURL& brevadHomeDirectory() const { return brevadHomeDirectory_; }
    [[nodiscard]] const FileURL& sharedContainersDirectory() const { return sharedContainersDirectory_; }
    /// DIR/tmp; the system's.
    [[nodiscard]] const FileURL& temporaryDirectory() const { return temporaryDirectory_; }
    [[nodiscard]] FileURL logDirectory() const;
    [[nodiscard]] FileURL cachesDirectory() const;
    [[nodiscard]] FileURL libraryDirectory() const;
    [[nodiscard]] FileURL transientDirectory() const;
    [[nodiscard]] FileURL transientBundleDirectory() const;
    [[nodiscard]] FileURL stagingDirectory() const;
    [[nodiscard]] FileURL deathrowDirectory() const;
    [[nodiscard]] FileURL replaceDirectory() const;
    [[nodiscard]] FileURL bundleDirectory() const;
    [[nodiscard]] FileURL entitlementFile() const;
    /// The name that an entitlement file gets that cannot be read.
    [[nodiscard]] FileURL unreadableEntitlementFile() const;
    /// The place where an older system kept bundle containers, and that of one class.
    [[nodiscard]] FileURL formerBundleDirectory() const;
    [[nodiscard]] FileURL formerBundleDirectory(ContainerClass containerClass) const;

    /// Directories at or above all containers but those of mobile users.
    [[nodiscard]] std::vector<FileURL> placesOfSharedContainers() const;

    // Places of a mobile user with this home.
    [[nodiscard]] static FileURL userBaseDirectory(const FileURL& home);
    [[nodiscard]] static FileURL userTransientDirectory(const FileURL& home);

    /// The directory that holds the class's own; absent for a class of users without a home.
    [[nodiscard]] std::optional<FileURL> baseOfClass(ContainerClass containerClass, bool transient,
                                                     const std::optional<FileURL>& userHome) const;

private:
    const FileURL homeDirectory_;
    const FileURL brevadHomeDirectory_;
    const FileURL sharedContainersDirectory_;
    const FileURL temporaryDirectory_;
    const FileURL formerContainersDirectory_;
};

} // namespace zor
