// SPDX-License-Identifier: Apache-2.0
// Which containers a program gets: those that are registered for its identifier, or those of them that were named by
// hand. An error, too, where it may not have the sockets that were passed for it. Containers that nothing registered
// refers to are never asked for: the next boot would delete them.
//
// This program learns what is registered by asking as a peer without power over others: such a peer is told exactly
// that. The containers are made where they are missing.
#pragma once

#include "Failure.h"
#include "Options.h"
#include "PassedSockets.h"
#include "ToldContainers.h"

namespace zorvanerun {

[[nodiscard]] Result<WantedContainers> chooseContainers(const Options& options, const PassedSockets& passed);

} // namespace zorvanerun
