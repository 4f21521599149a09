// SPDX-License-Identifier: Apache-2.0
// The sandbox as its maker, bubblewrap, is told of it: arguments and environment. Pure, but for the caller's
// environment and for a look whether the kernel lists keys.
//
// Inside there are namespaces of its own for mounts, processes, IPC, the host's name and, unless the host's is asked
// for, the network; of capabilities only those with which Inside.h gives up the rest.
#pragma once

#include "Mounts.h"
#include "Notifications.h"
#include "Options.h"

#include <string>
#include <vector>

namespace zorvanerun {

/// Handles for what runs first inside: this program, through a descriptor, and a socket on which it reports.
struct InsideHandles {
    int program = -1;
    int channel = -1;
};

[[nodiscard]] std::vector<std::string> sandboxArguments(const Options& options, const std::vector<Mount>& mounts,
                                                        const ToldContainers& told, const Notifications& notifications,
                                                        InsideHandles handles);
/// "NAME=VALUE" each.
[[nodiscard]] std::vector<std::string> sandboxEnvironment(const Options& options, const ToldContainers& told);

} // namespace zorvanerun
