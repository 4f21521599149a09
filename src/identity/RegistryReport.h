// SPDX-License-Identifier: Apache-2.0
// The judgement of the identity registry on each of its files, for people: whether it counts, where it is wrong, and
// what in it does not do what its author may think. Reads with the daemon's own readers, asks no daemon, keeps nothing;
// any thread.
#pragma once

#include "identity/RegistryFiles.h"

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace zor::platform {

struct RegistryFileReport {
    std::string name;
    /// Why it does not count; nothing when it does.
    std::optional<std::string> problem;
    /// The place of the problem, from 1; 0 where it is not of a place in the file.
    std::size_t line = 0;
    std::size_t column = 0;
    std::optional<RegistryEntry> entry;
    /// The identity of the executable, where there is a regular file at its path.
    std::optional<FileId> executable;
    /// Things that are there, and grant less than they seem to.
    std::vector<std::string> remarks;
};

struct RegistryReport {
    /// The fault of the directory as a whole.
    std::optional<std::string> problem;
    /// In the order in which they count; those that have no name of the registry's, too.
    std::vector<RegistryFileReport> files;
};

[[nodiscard]] RegistryReport reportRegistry(const SystemRoot& root, uid_t daemonUserId);
/// The judgement on these bytes, were they a file of the registry.
[[nodiscard]] RegistryFileReport reportRegistryFile(std::string name, std::string_view bytes);

} // namespace zor::platform
