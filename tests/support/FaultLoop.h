// SPDX-License-Identifier: Apache-2.0
// Runs an operation again and again in a fresh world, with the fault one call later each time, until a run meets no
// fault: complete without counting calls or choosing points.
//
// With FaultKind::exit the operation runs in a forked child, so the world must not have started a thread by then.
#pragma once

#include "support/FaultDisk.h"

#include <string>
#include <sys/types.h>
#include <unistd.h>

namespace zor::support {

struct FaultOutcome {
    Fault fault;
    /// False in the last run, which went through.
    bool met = false;
    /// The operation was left by ProcessStopped, or its process ended.
    bool stopped = false;
    /// The call that met the fault; unknown (empty) when its process ended.
    std::string call;

    [[nodiscard]] std::string describe() const;
};

/// Waits for the child. Empty when it went through or met its fault, which `met` tells; else how it ended.
std::string waitForFaultChild(pid_t child, bool& met);

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
        std::string complaint;
        disk.arm(fault);
        if (fault.kind == FaultKind::exit) {
            const pid_t child = ::fork();
            if (child == 0) {
                operation(world);
                ::_exit(0);
            }
            complaint = waitForFaultChild(child, outcome.met);
            outcome.stopped = outcome.met;
        } else {
            try {
                operation(world);
            } catch (const ProcessStopped&) {
                outcome.stopped = true;
            }
            outcome.met = disk.met();
            outcome.call = outcome.met ? disk.metCall().describe() : "";
        }
        disk.disarm();
        if (complaint.empty())
            complaint = check(world, outcome);
        if (complaint.empty() && fault.point == pointsMax)
            complaint = "the operation meets fault points without end";
        if (!complaint.empty())
            return {.examined = fault.point, .complaint = outcome.describe() + ": " + complaint};
        if (!outcome.met)
            return {.examined = fault.point, .complaint = ""};
    }
}

} // namespace zor::support
