// SPDX-License-Identifier: Apache-2.0
// Reading what the entitlement file holds, without a word about what follows from it. Changes nothing; any thread.
#pragma once

#include "base/ZORError.h"
#include "fs/ZORFileManager.h"
#include "ipc/Protocol.h"
#include "plist/Value.h"

#include <cstddef>
#include <map>
#include <string>
#include <string_view>
#include <vector>

namespace zor {

/// Keys of the map that are no identifiers.
namespace entitlementMapKeys {
inline constexpr std::string_view childPluginBundleIds = "com.veltra.Zorvane.ChildPluginBundleIDs";
// The flags are kept under the names of the options that set them.
inline constexpr std::string_view registeredByCaller = ipc::keys::registeredByCallerOption;
inline constexpr std::string_view placeholder = ipc::keys::placeholderOption;

[[nodiscard]] constexpr bool isOne(std::string_view key) {
    return key == childPluginBundleIds || key == registeredByCaller || key == placeholder;
}
} // namespace entitlementMapKeys

/// Keys inside an identifier's entitlements.
namespace entitlementKeys {
inline constexpr std::string_view applicationGroups = "com.veltra.security.application-groups";
inline constexpr std::string_view systemGroups = "com.veltra.security.system-groups";
inline constexpr std::string_view systemGroupContainers = "com.veltra.security.system-group-containers";
inline constexpr std::string_view systemContainer = "com.veltra.security.system-container";
} // namespace entitlementKeys

inline constexpr std::string_view systemGroupPrefix = "systemgroup.";

/// Far above any device's map (a thousand identifiers take about a megabyte), far below what reading could not bear.
inline constexpr std::size_t entitlementFileBytesMax = std::size_t{64} << 20;

/// Groups of one type that an identifier may be entitled to. Their containers are made, and looked up, in one go for
/// whoever asks for their paths; nobody has more than a few.
inline constexpr std::size_t groupsMax = 1'000;

/// The map. POSIX error, not logged: ENOENT when there is no file.
Result<plist::Dictionary> readEntitlementFile(const FileURL& url, ZORFileManager& fileManager);

[[nodiscard]] bool ownsSystemContainer(const plist::Dictionary& map, std::string_view identifier);

enum class GroupType : std::int32_t { application = 0, system = 1 };

/// Group identifier to the identifiers whose entitlements list it, one for each time that they do: as many as there
/// are references.
using GroupReferences = std::map<std::string, std::vector<std::string>, std::less<>>;
/// The identifiers that refer to each group, as deletions count them. `log` says which lists do not count; nullptr:
/// nobody is told.
[[nodiscard]] GroupReferences groupReferencesIn(const plist::Dictionary& map, GroupType type, const Log* log);

} // namespace zor
