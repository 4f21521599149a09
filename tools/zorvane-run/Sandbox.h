// SPDX-License-Identifier: Apache-2.0
// The sandbox as its maker, bubblewrap, is told of it. Pure, but for the caller's environment and for a look whether
// the kernel lists keys.
//
// Inside there are namespaces of its own for mounts, processes, IPC, the host's name and, unless the host's is asked
// for, the network (of which the maker makes the first two); of capabilities only those with which Inside.h gives up
// the rest.
#pragma once

#include "Notifications.h"
#include "Options.h"
#include "PassedSockets.h"
#include "ToldContainers.h"

#include <string>
#include <vector>

namespace zorvanerun {

/// Handles for the maker, and for what runs first inside: this program, a socket on which it reports, and the end of a
/// pipe from which the maker reads the rest of its arguments.
struct InsideHandles {
    int program = -1;
    int channel = -1;
    int arguments = -1;
};

/// The command line of the maker: nothing of it depends on what the daemon answers.
[[nodiscard]] std::vector<std::string> makerCommand(const Options& options, const PassedSockets& passed,
                                                    InsideHandles handles);
/// The rest, when all is staged: what the sandbox is made of, and the program's environment.
[[nodiscard]] std::vector<std::string> sandboxArguments(const Options& options, const ToldContainers& told,
                                                        const Notifications& notifications,
                                                        const PassedSockets& passed);
/// "NAME=VALUE" each.
[[nodiscard]] std::vector<std::string> sandboxEnvironment(const Options& options, const ToldContainers& told);

} // namespace zorvanerun
