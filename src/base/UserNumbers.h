// SPDX-License-Identifier: Apache-2.0
// Which uids the system knows: its own, and those of the users whose containers it keeps. Pure functions.
#pragma once

#include <cstdint>

namespace zor {

/// Clients up to this uid belong to the system and may act for other users; the ones above only as themselves.
inline constexpr std::uint32_t lastSystemClientUserId = 500;
inline constexpr std::uint32_t firstMobileUserId = 501;
inline constexpr std::uint32_t lastMobileUserId = 510;

/// Stands for all users outside those numbers. No user has it: the kernel takes it for "no uid".
inline constexpr std::uint32_t strangersUserId = UINT32_MAX;

/// The number under which a user's shares and turns are counted. An owner of a range of subordinate uids can connect as
/// each of them, so all that the system does not know are one.
[[nodiscard]] constexpr std::uint32_t countedUserId(std::uint32_t userId) {
    return userId <= lastMobileUserId ? userId : strangersUserId;
}
static_assert(firstMobileUserId == lastSystemClientUserId + 1, "else there are strangers between them");

} // namespace zor
