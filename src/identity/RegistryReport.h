// SPDX-License-Identifier: Apache-2.0
// What the identity registry makes of each of its files, for people: whether it counts, where it is wrong, and what in
// it does not do what its author may think. Reads with the daemon's own readers, asks no daemon, keeps nothing; any
// thread.
#pragma once

#include "identity/RegistryDirectory.h"

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zor::platform {

struct RegistryFileReport {
    std::string name;
    /// Why it does not count; nothing when it does.
    std::optional<std::string> problem;
    /// Where the problem is, from 1; 0 where it is not of a place in the file.
    std::size_t line = 0;
    std::size_t column = 0;
    std::optional<RegistryEntry> entry;
    /// Of the executable, where there is a regular file at its path.
    std::optional<FileId> executable;
    /// What is there, and grants less than it seems to.
    std::vector<std::string> remarks;
};

struct RegistryReport {
    /// What is wrong with the directory as a whole.
    std::optional<std::string> problem;
    /// In the order in which they count; those that have no name of the registry's, too.
    std::vector<RegistryFileReport> files;
};

[[nodiscard]] RegistryReport reportRegistry(const SystemRoot& root, uid_t daemonUserId);
/// What would be made of these bytes in a file of the registry.
[[nodiscard]] RegistryFileReport reportRegistryFile(std::string name, std::string_view bytes);

} // namespace zor::platform
