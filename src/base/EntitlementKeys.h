// SPDX-License-Identifier: Apache-2.0
// The entitlements that give power over what belongs to others. The dispatcher judges by them, and the identity
// registry fences whoever is granted one of them; both take the names from here.
#pragma once

#include <string_view>

namespace zor::platform::entitlementKeys {

/// Boolean: every command.
inline constexpr std::string_view allowed = "com.veltra.private.Zorvane.allowed";
/// Boolean: look up containers of other identifiers.
inline constexpr std::string_view otherIdLookup = "com.veltra.private.Zorvane.otherIdLookup";
/// Array of strings: the identifiers whose containers may be wiped.
inline constexpr std::string_view wipeContainer = "com.veltra.private.Zorvane.wipeContainer";

} // namespace zor::platform::entitlementKeys
