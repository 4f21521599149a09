// SPDX-License-Identifier: Apache-2.0
// Users by name, from the user database that the daemon of a root goes by.
#pragma once

#include <cstdint>
#include <expected>
#include <string>
#include <vector>

namespace zorvanectl {

/// A number, a name of the root's user database, or "current"; else what is wrong with it.
[[nodiscard]] std::expected<std::uint32_t, std::string> userNumber(const std::string& root, const std::string& text);
/// "501 mobile"; the number alone where it has no name.
[[nodiscard]] std::string shownUser(const std::string& root, std::uint32_t number);

struct NamedUser {
    std::uint32_t number = 0;
    /// Empty: the database does not name it.
    std::string name;
};
/// Those who may own containers of a class: all that have an account, or every one where that cannot be told.
[[nodiscard]] std::vector<NamedUser> ownersOfClass(const std::string& root, std::uint64_t containerClass);

} // namespace zorvanectl
