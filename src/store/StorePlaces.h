// SPDX-License-Identifier: Apache-2.0
// The places of everything in the store, below a system root, and their names. Paths are put together here and nothing
// else: nothing is made, nothing is looked at. ZORGlobalConfiguration makes the directories; a reader that only looks
// needs no more than this.
//
// Immutable after it is made; any thread.
#pragma once

#include "base/ContainerClass.h"
#include "fs/Names.h"
#include "fs/PathResolver.h"
#include "fs/ZORFileManager.h"
#include "ipc/Identifiers.h"
#include "os/SystemRoot.h"

#include <array>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <sys/types.h>
#include <vector>

namespace zor::names {

// Every name that the store has on disk, spelled here and nowhere else, but for the names that the file manager knows
// too (fs/Names.h).

// Fixed places, below the system root.
inline constexpr std::string_view rootHome = "/private/var/root";
inline constexpr std::string_view brevadHome = "/private/var/brevad";
inline constexpr std::string_view sharedContainers = "/private/var/containers";
inline constexpr std::string_view temporary = "/tmp";
/// The place where an older system kept the bundle containers too.
inline constexpr std::string_view formerContainers = "/private/var/mobile/Containers";

// Below a home.
inline constexpr std::string_view logs = "Library/Logs/Zorvane";
inline constexpr std::string_view caches = "Library/Caches/com.veltra.zorvaned";
inline constexpr std::string_view library = "Library/Zorvane";
inline constexpr std::string_view userContainers = "Containers";
/// The levels of the caches directory, for where each is made by itself.
inline constexpr std::array<std::string_view, 3> cachesLevels = {"Library", "Caches", "com.veltra.zorvaned"};

// Below the caches and library directories.
inline constexpr std::string_view transient = "Temp";
inline constexpr std::string_view staging = "Staging";
inline constexpr std::string_view deathrow = "Dead";
inline constexpr std::string_view replace = "Replace";
inline constexpr std::string_view bundle = "Bundle";

/// Extended attribute of what a deletion pass could not remove and moved to the directory for temporary files: the
/// first where the daemon is root.
inline constexpr const char* undeletedAttribute = "trusted.zorvane.undeleted";
inline constexpr const char* undeletedAttributeUser = "user.zorvane.undeleted";

/// In every data container: what is there for the while that its process runs.
inline constexpr const char* containerTemporary = "tmp";

/// In the library directory: what each identifier is entitled to.
inline constexpr const char* entitlementFile = "zor_entitlements.plist";
/// The name that an entitlement file gets that cannot be read; its presence stops every pass that deletes on its word.
inline constexpr const char* unreadableEntitlementFile = "zor_entitlements.plist.unreadable";

/// In the library directory: what has been migrated, once for the device.
inline constexpr std::string_view bundleMigrationMarker = "zor_bundle_migration_complete.plist";
inline constexpr std::string_view groupIdMigrationMarker = "zor_group_id_migration_complete.plist";

} // namespace zor::names

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

/// The directory that a container lies in: many share one.
struct ContainerParent {
    std::string path;
    /// The name of the one container that has it for itself, because that is no UUID in canonical form; else empty.
    std::string childName{};
};

/// The place of a container: its directory, and its own name in it.
class ContainerPlace {
public:
    ContainerPlace() = default;
    /// `parent` has no name of a child.
    ContainerPlace(std::shared_ptr<const ContainerParent> parent, std::string_view name);
    explicit ContainerPlace(const FileURL& url);

    [[nodiscard]] bool empty() const { return !parent_; }
    [[nodiscard]] std::string name() const { return hasOtherName() ? parent_->childName : uuid_.string(); }
    [[nodiscard]] const std::string& parentPath() const { return parent_->path; }
    [[nodiscard]] FileURL url() const;

private:
    [[nodiscard]] bool hasOtherName() const { return parent_ && !parent_->childName.empty(); }

    std::shared_ptr<const ContainerParent> parent_;
    UUID uuid_;
};

// The things that a system root has to hold before a daemon can serve it, and which the daemon does not make: they
// belong to the builder of the device. Immutable; any thread.

struct RootDirectory {
    std::string_view path; // from the root, without a leading slash
    mode_t mode;
    /// Belongs to the installer, else to root.
    bool isInstallers;
};

/// Parents before children.
inline constexpr std::array<RootDirectory, 4> rootDirectories = {{
    {"private", 0755, false},
    {"private/var", 0755, false},
    {"private/var/brevad", 0755, true},
    {"tmp", 01777, false},
}};

/// The paths of these directories, and of the user database, that are not there. An entry that cannot be looked at
/// counts as there: the daemon says later what it failed on.
[[nodiscard]] std::vector<std::string> missingOf(const platform::SystemRoot& root);
/// One line about them, with the command that makes them.
[[nodiscard]] std::string lineAboutMissing(const platform::SystemRoot& root, const std::vector<std::string>& missing);
/// That command.
[[nodiscard]] std::string initCommand(const platform::SystemRoot& root);

// The inside of a container of each class: its standard subdirectories, their mode and owner.

struct ContainerLayout {
    /// Relative to the container, parents before children; NUL-terminated.
    std::span<const char* const> subdirectories;
    mode_t subdirectoryMode = 0755;
    std::uint32_t subdirectoryOwner = ownerUnchanged;
    mode_t topLevelMode = 0755;
    std::uint32_t topLevelOwner = ownerUnchanged;
    int topLevelProtectionClass = 0;
};

/// The layout of a valid class for a container of `userId`.
[[nodiscard]] ContainerLayout layoutOf(ContainerClass containerClass, std::uint32_t userId);

/// The owner of a container's directory. Absent: nobody but root can put anything in its place.
[[nodiscard]] std::optional<std::uint32_t> topLevelOwnerOf(ContainerClass containerClass, std::uint32_t userId);

} // namespace zor
