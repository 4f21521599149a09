// SPDX-License-Identifier: Apache-2.0
// The losses of a container's record when a new container takes the place of the content: info values go; the
// data-protection class is set again.
//
// A stop between the two leaves the new content in class 3, which the class asked for before is weaker or stricter
// than.
#pragma once

#include "Commands.h"

#include <optional>
#include <string>
#include <vector>

namespace zorvanectl {

struct LostRecord {
    /// Set if one is recorded that a new container does not have.
    std::optional<std::int32_t> protectionClass;
    /// The keys of info values that were set by somebody.
    std::vector<std::string> infoKeys;
};
/// Nothing of a record that cannot be read.
[[nodiscard]] LostRecord lostRecordOf(zorvane::Client& client, const zorvane::Client::Address& address);

/// "; info values a, b of it go with it", or nothing.
[[nodiscard]] std::string lostInfoText(const LostRecord& lost);
/// If --keep-class is given and the class cannot be set again because the device is locked: says so, and the exit
/// code.
[[nodiscard]] std::optional<int> refuseToLoseClass(const zorvane::ConnectOptions& connect, const Output& output,
                                                   const LostRecord& lost, KeepClass keep, const std::string& what);
/// Sets the class of the container again. A failure is said, and false returned; for KeepClass::always the exit code is
/// to be exitLocalError then.
[[nodiscard]] bool setClassAgain(zorvane::Client& client, const Output& output, const Target& target,
                                 const LostRecord& lost);
/// Adds "infoLost", "protectionClass" and "classKept" to what a command prints.
void addLost(nlohmann::json& document, const LostRecord& lost, bool classKept);

} // namespace zorvanectl
