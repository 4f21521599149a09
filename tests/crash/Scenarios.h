// SPDX-License-Identifier: Apache-2.0
// The daemon's changes of the disk, one scenario each, for the loops over faults and power cuts.
#pragma once

#include "crash/StoreWorld.h"

#include <gtest/gtest.h>

namespace zor::support {

inline constexpr std::uint32_t mobileUser = 501;
inline constexpr std::uint32_t bundleUser = 33;
inline constexpr std::uint32_t systemUser = 499;

/// The entitlements of an application.
plist::Dictionary entitlements(plist::Array appGroups, plist::Array systemGroups = {}, bool systemContainer = false);

/// Ends a test whose start could not be made.
void must(bool happened, const char* what);

struct Scenario {
    std::string name;
    bool worksAtHome = false;
    /// Whether the device's file systems exchange names.
    bool exchanges = true;
    /// Runs before the first fault or cut, on a launched daemon. Containers that it puts into `promised` stay promised.
    std::function<void(Device&)> prepare;
    /// Puts what was acknowledged into `promised`.
    std::function<void(Device&)> act;
    /// The containers that a client may ask for afterwards.
    std::vector<Request> requests;
    /// Whether the daemon that met an error must serve the requests at once. A daemon cannot be asked for what a test
    /// took from under it.
    bool goesOnAfterErrors = true;
    /// Calls of act that change or sync the disk, at the least: less means that nothing was tested.
    std::size_t pointsMin = 6;
    /// Calls for each state that a power cut may leave, at the most: a call that only syncs leaves what the one before
    /// it left, and where few others are made that counts.
    std::size_t callsPerStateMax = 1;
    /// Whether a complaint is about the damage that the scenario starts from and is there to mend.
    std::function<bool(const std::string& complaint)> isDamage;
    /// `complaint` unless it is about that.
    [[nodiscard]] std::string withoutDamage(const std::string& complaint) const {
        return isDamage && isDamage(complaint) ? "" : complaint;
    }
    /// Judges what an operation must have put right itself when one call of it failed; the daemon still runs.
    std::function<std::string(const std::string& root)> afterOneError;
    /// Judges what only this scenario knows of; after a restart. `acted` when act came to its end without an error.
    std::function<std::string(const std::string& root, bool acted)> also;
};

/// Creation in each group of classes, transient creation again, death row, the entitlement file, the launch.
std::vector<Scenario> storeScenarios();
/// Changes of a container that is there.
std::vector<Scenario> changeScenarios();
/// Deletion, the loss of last references, and the first use of groups.
std::vector<Scenario> deletionScenarios();
/// All of them, or those that work in the user's home: in a run that is not a long one only the ones named.
std::vector<Scenario> allScenarios();
std::vector<Scenario> homeScenarios(const std::set<std::string>& always);
/// `scenario`, as one of these.
Scenario atHome(Scenario scenario);
/// As test names are spelled.
std::string scenarioName(const ::testing::TestParamInfo<Scenario>& parameter);

} // namespace zor::support
