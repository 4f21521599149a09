// SPDX-License-Identifier: Apache-2.0
// The steps that put findings right, as a list: it is shown, or gone through, and is the same in both cases.
//
// Only what a running daemon does when it is asked is ever done. The work of its next start is left to that, and what
// needs a person to a person: in doubt nothing is deleted.
#pragma once

#include "check/Finding.h"

#include <string>
#include <vector>

namespace zor::check {

struct RepairStep {
    enum class Act : std::uint8_t {
        /// Nothing is done here.
        none,
        /// The standard subdirectories of the container below are made again, with their owner and mode.
        recreateStructure,
        /// The items that wait for their deletion are deleted.
        emptyDeathRow,
    };
    Act act = Act::none;
    Mender mender = Mender::person;
    /// One line for people: what is done, or has to be. May quote names.
    std::string text;
    /// The command that a person may type to have it done; empty when there is nothing to type.
    std::string command;
    // The container that it is done to.
    ContainerClass containerClass = ContainerClass::undefined;
    std::uint32_t user = 0;
    std::string identifier;
    UUID uuid;

    /// Whether something is gone for good when it is done.
    [[nodiscard]] bool destroys() const { return act == Act::emptyDeathRow; }
};

/// In the order in which they are to be done: first what the daemon does now. `root` is the system root's path.
[[nodiscard]] std::vector<RepairStep> repairSteps(const std::vector<Finding>& findings, const std::string& root);

} // namespace zor::check
