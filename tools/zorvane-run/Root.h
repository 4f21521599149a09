// SPDX-License-Identifier: Apache-2.0
// The system root that the daemon works on: canonical and held open, so that it stays the same directory.
#pragma once

#include "Failure.h"
#include "os/FileDescriptor.h"

namespace zorvanerun {

struct Root {
    std::string path;                         // canonical, without a slash at its end unless it is "/"
    zor::platform::FileDescriptor descriptor; // O_PATH

    [[nodiscard]] static Result<Root> open(const std::string& directory);
    /// "/run/zorvane" and the like, where it really is.
    [[nodiscard]] std::string below(const std::string& systemPath) const {
        return path == "/" ? systemPath : path + systemPath;
    }
};

} // namespace zorvanerun
