// SPDX-License-Identifier: Apache-2.0
#include "support/FaultLoop.h"

#include <sys/wait.h>

namespace zor::support {

std::string FaultOutcome::describe() const {
    std::string text = fault.describe();
    if (!met)
        return text + " (not met)";
    return call.empty() ? text : text + " at " + call;
}

std::string waitForFaultChild(pid_t child, bool& met) {
    int status = 0;
    while (child > 0 && ::waitpid(child, &status, 0) < 0) {
        if (errno != EINTR)
            return "waitpid failed";
    }
    if (child < 0)
        return "fork failed";
    if (WIFSIGNALED(status))
        return "the child ended by signal " + std::to_string(WTERMSIG(status));
    met = WEXITSTATUS(status) == FaultDisk::exitStatus;
    return met || WEXITSTATUS(status) == 0 ? "" : "the child ended with " + std::to_string(WEXITSTATUS(status));
}

} // namespace zor::support
