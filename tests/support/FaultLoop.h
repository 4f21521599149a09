// SPDX-License-Identifier: Apache-2.0
// Runs an operation again and again in a fresh world, with the fault one call later each time, until a run meets no
// fault: complete without counting calls or choosing points.
#pragma once

#include "support/FaultDisk.h"

#include <string>

namespace zor::support {

struct FaultOutcome {
    Fault fault;
    /// False in the last run, which went through.
    bool met = false;
    /// The operation was left by ProcessStopped.
    bool stopped = false;
    /// The call that met the fault.
    std::string call;

    [[nodiscard]] std::string describe() const;
};

/// `makeWorld(FaultDisk&)` returns what `operation(world)` works on, its disk being the one given, not yet armed.
/// `check(world, outcome)` judges what is left, the disk being disarmed again (one that stopped stays stopped), and
/// returns a complaint or nothing. The loop ends at the first complaint, which then says where the fault was.
template <typename MakeWorld, typename Operation, typename Check>
LoopReport forEachFaultPoint(platform::Disk& inner, Fault fault, MakeWorld makeWorld, Operation operation,
                             Check check) {
    constexpr std::size_t pointsMax = 100'000;
    for (fault.point = 1;; ++fault.point) {
        FaultDisk disk(inner);
        auto world = makeWorld(disk);
        FaultOutcome outcome{.fault = fault};
        disk.arm(fault);
        try {
            operation(world);
        } catch (const ProcessStopped&) {
            outcome.stopped = true;
        }
        outcome.met = disk.met();
        outcome.call = outcome.met ? disk.metCall().describe() : "";
        disk.disarm();
        std::string complaint = check(world, outcome);
        if (complaint.empty() && fault.point == pointsMax)
            complaint = "the operation meets fault points without end";
        if (!complaint.empty())
            return {.examined = fault.point, .complaint = outcome.describe() + ": " + complaint};
        if (!outcome.met)
            return {.examined = fault.point, .complaint = ""};
    }
}

} // namespace zor::support
