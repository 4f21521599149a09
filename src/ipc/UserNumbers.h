// SPDX-License-Identifier: Apache-2.0
// Which users own containers: the one home of their numbers, and of the configuration that may give others.
//
// A daemon reads the configuration once, at its start; what it has read is handed on by value and never changes. Pure
// functions, any thread.
#pragma once

#include "ipc/Protocol.h"
#include "platform/Errno.h"

#include <algorithm>
#include <cstdint>
#include <expected>
#include <functional>
#include <string>
#include <string_view>
#include <vector>

namespace zor::ipc {

/// In a request: the current mobile user, whoever that is. Never an owner.
inline constexpr std::uint32_t currentMobileUser = 1;
/// Stands for all users outside the numbers. No user has it: the kernel takes it for "no uid".
inline constexpr std::uint32_t strangersUserId = UINT32_MAX;

struct UserNumbers {
    /// Owns the bundle containers.
    std::uint32_t installer = 33;
    /// Owns the system's containers.
    std::uint32_t system = 499;
    /// The mobile users: each has containers of their own.
    std::uint32_t first = 501;
    std::uint32_t last = 510;

    /// Accounts of persons begin at 1000 on every Linux; none of them belongs to the system.
    static constexpr std::uint32_t lastSystemAccount = 999;
    /// Above it lie numbers that systemd and ranges of subordinate users give to processes that nobody knows.
    static constexpr std::uint32_t configuredMax = 60'000;
    /// Each of them is looked for at every start, and may have a share of the daemon's threads.
    static constexpr std::uint32_t mobileUsersMax = 100;

    /// Clients up to this uid belong to the system and may act for other users; the ones above only as themselves.
    [[nodiscard]] constexpr std::uint32_t lastSystemClient() const { return std::min(first - 1, lastSystemAccount); }
    [[nodiscard]] constexpr bool isMobile(std::uint32_t user) const { return user >= first && user <= last; }
    [[nodiscard]] constexpr std::uint32_t mobileUsers() const { return last - first + 1; }
    /// Under which number a user's shares and turns are counted. Whoever has a range of subordinate uids can connect as
    /// each of them, so all that the system does not know are one.
    [[nodiscard]] constexpr std::uint32_t counted(std::uint32_t user) const {
        return user <= last || user == installer || user == system ? user : strangersUserId;
    }
    /// Whether the user may own containers of the class. Classes outside 1 to 13 have no owner.
    [[nodiscard]] constexpr bool mayOwn(ContainerClass containerClass, std::uint32_t user) const {
        if (isBundleClass(containerClass))
            return user == installer;
        if (isSystemClass(containerClass))
            return user == system;
        return isContainerClass(static_cast<std::uint64_t>(containerClass)) && isMobile(user);
    }
    [[nodiscard]] bool operator==(const UserNumbers&) const = default;
};

struct Account {
    std::string name;
    std::uint32_t number = 0;
};

/// The accounts that packages make for the two owners; a number that is theirs is nobody else's.
inline constexpr std::string_view installerAccount = "zorvane-installer";
inline constexpr std::string_view systemAccount = "zorvane-system";

/// The accounts of the root. ENOENT where there is none.
struct Accounts {
    std::function<ErrnoOr<Account>(std::string_view name)> named;
    std::function<ErrnoOr<Account>(std::uint32_t number)> numbered;
};

struct ConfiguredUsers {
    UserNumbers numbers;
    /// Things that are served as they are but should not stay so; each is a sentence that says what to do.
    std::vector<std::string> doubts;
};

/// Reads what the configuration says of users; an empty text leaves the numbers above. Else one line that says what is
/// wrong, where, and what to do.
[[nodiscard]] std::expected<ConfiguredUsers, std::string> readUserNumbers(std::string_view text,
                                                                          const Accounts& accounts);
/// The same numbers as a text that readUserNumbers takes, whatever accounts there are.
[[nodiscard]] std::string textOf(const UserNumbers& numbers);

} // namespace zor::ipc
