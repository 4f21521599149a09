// SPDX-License-Identifier: Apache-2.0
// Command lines for people to type.
#pragma once

#include "check/Finding.h"

#include <string>
#include <string_view>
#include <vector>

namespace zor::check {

/// One word of a shell's, whatever bytes it holds; nothing in it steers a terminal.
[[nodiscard]] std::string shellQuoted(std::string_view text);

/// A program of the system's that takes "--root", for this root.
[[nodiscard]] std::string programFor(std::string_view program, std::string_view root);

/// `command`, in this directory and nowhere else: the directory lies where a client may put a link in its place
/// meanwhile, and root types this.
[[nodiscard]] std::string inDirectory(std::string_view directory, std::string_view command);

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
