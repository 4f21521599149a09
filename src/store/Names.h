// SPDX-License-Identifier: Apache-2.0
// Every name that the store has on disk, spelled here (and, for the one that the file manager knows
// too, in the header below) and nowhere else.
#pragma once

#include "fs/Names.h"

#include <array>
#include <string_view>

namespace zor::names {

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
