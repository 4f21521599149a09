// SPDX-License-Identifier: Apache-2.0
// Asks the daemon, as the kernel's agent, for the containers of a process: one packet there, one back.
#pragma once

#include "Failure.h"
#include "Options.h"
#include "Root.h"
#include "ToldContainers.h"

namespace zorvanerun {

[[nodiscard]] Result<ToldContainers> askForContainers(const Root& root, const Options& options,
                                                      const WantedContainers& wanted);

} // namespace zorvanerun
