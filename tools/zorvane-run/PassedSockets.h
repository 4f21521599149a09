// SPDX-License-Identifier: Apache-2.0
// The sockets that a service manager opened for the program and passes to this one (LISTEN_FDS).
//
// They go into the sandbox with their numbers, where the daemon finds an entry of the registry for the identifier that
// allows it, and none of them leads elsewhere. A socket gives whoever holds it what its maker had: its name, its
// network, and whatever those who connect to it send along.
#pragma once

#include "Failure.h"
#include "Options.h"

#include <optional>
#include <string>
#include <vector>

namespace zorvanerun {

struct PassedSockets {
    int count = 0;
    /// LISTEN_FDNAMES as it came; empty without.
    std::string names;

    /// Those of the caller's environment; none where it speaks of another process.
    [[nodiscard]] static Result<PassedSockets> ofCaller();
    /// An error unless each of them is of a kind that may be passed on.
    [[nodiscard]] Result<void> judgeKinds(Network network) const;
    /// An error unless there are none, or the daemon's word allows the identifier's programs to have some; an older
    /// daemon says nothing.
    [[nodiscard]] Result<void> judgeAllowed(std::optional<bool> allowed, const std::string& identifier) const;
    /// "NAME=VALUE" each; the program's number is put beside them once there is one.
    [[nodiscard]] std::vector<std::string> environment() const;
};

} // namespace zorvanerun
