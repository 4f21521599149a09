// SPDX-License-Identifier: Apache-2.0
// The system calls that the kernel refuses to the program in the sandbox, because they lead to what the sandbox's
// namespaces do not hold apart.
//
// Those are: keys (the caller's, and those that all processes of one user share); namespaces of the program's own, in
// which it would have every capability; the kernel's log; typing into the caller's terminal; and, without the host's
// network, sockets of families that no network namespace holds apart. io_uring is refused with them, for its calls pass
// by the filter; and what only root has a use for, or large parts of the kernel behind it that programs can do without:
// mounts, modules, the clock, BPF, performance counters, userfaultfd, fanotify.
#pragma once

#include "Options.h"

namespace zorvanerun {

/// Leaves the caller's session keyring for an empty one. To be called as root: a user's own share of keys may be used
/// up.
[[nodiscard]] bool leaveKeys();

/// For this process and all that it starts. It must have given up new privileges before.
[[nodiscard]] bool fence(Network network);

} // namespace zorvanerun
