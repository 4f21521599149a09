// SPDX-License-Identifier: Apache-2.0
// The powers that a process gives up before it looks at hostile bytes: all but computing, and what it has open.
//
// As root it becomes nobody. Its terminal is no longer its own, and it ends with its parent. Limits keep it from
// opening anything, and the kernel refuses (EPERM) every call but the few that memory, time and open descriptors need:
// so it cannot signal, trace, rename, remove or execute either, whoever runs it. None of it can be taken back.
#pragma once

#include <sys/types.h>

namespace zorvanectl::content {

/// In a process that was forked by `parent` and has one thread. False when something could not be given up; the process
/// is to end then.
[[nodiscard]] bool becomePowerless(pid_t parent);

} // namespace zorvanectl::content
