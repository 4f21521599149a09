// SPDX-License-Identifier: Apache-2.0
// Starts the sandbox, passes signals on to the program in it, and waits for its end.
//
// The sandbox's maker keeps a process of its own outside, which a signal would simply kill, and the program with it. So
// those signals are blocked there, caught here, and sent to the program itself, through a descriptor that can be no
// other process.
//
// All of that runs in a process namespace of this program's own. Its process 1 does nothing but end when this program
// does, and the kernel ends the others with it: at whatever instruction this program is killed, nothing is left. And
// nothing is left of a program when this one ends, for process 1 is gone only after the last of them.
#pragma once

#include "Failure.h"
#include "Mounts.h"
#include "Notifications.h"

namespace zorvanerun {

/// The exit code of the program, or why it never began.
[[nodiscard]] Result<int> runSandboxed(const Options& options, const std::vector<Mount>& mounts,
                                       const ToldContainers& told, Notifications notifications);

} // namespace zorvanerun
