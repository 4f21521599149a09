// SPDX-License-Identifier: Apache-2.0
// Reads a store as it lies, with the daemon's own readers, and says what is wrong with it.
//
// Nothing is ever written, no lock is taken, no link is followed, nothing that could block is opened. A thing that a
// request in flight shows is not reported: where a first look finds something, a second one follows, and only what both
// saw counts. Containers are looked at one after another; memory grows with the number of identifiers in one class
// directory and with the findings. One thread.
#pragma once

#include "check/CheckedSystem.h"
#include "check/Finding.h"

#include <chrono>
#include <cstdint>
#include <functional>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace zor::check {

struct CheckOptions {
    /// The daemon answers its clients: what its start makes must be there.
    bool daemonServes = false;
    /// The place of the live container that such a daemon gives its clients; nothing when it does not say. Asked only
    /// of an identifier that has several, for what a daemon remembers is not to be seen on the disk.
    std::function<std::optional<std::string>(ContainerClass, std::uint32_t user, const std::string& identifier)>
        servedPath;
    /// UUIDs of containers whose data-protection class is being changed.
    std::set<std::string> changingProtection;
    /// UUIDs of containers whose info values the daemon could not write.
    std::set<std::string> unsavedInfo;
    /// Between the two looks; 0: one look alone, for a store that nobody works on.
    std::chrono::milliseconds pause{200};
    /// In place of the system's own.
    const platform::BootMarker* bootMarker = nullptr;
};

/// By path; notes among them (FindingPage::isNote).
[[nodiscard]] std::vector<Finding> checkStore(CheckedSystem& system, const CheckOptions& options);

/// Whether something counts: notes alone leave a store whole.
[[nodiscard]] bool isWhole(const std::vector<Finding>& findings);

} // namespace zor::check
