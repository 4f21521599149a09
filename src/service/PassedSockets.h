// SPDX-License-Identifier: Apache-2.0
// The listening sockets that the service manager passed to this process (LISTEN_FDS), by their names. Taken once, by
// main, before any thread.
#pragma once

#include "os/FileDescriptor.h"

#include <string>
#include <string_view>
#include <vector>

namespace zor::platform {

class PassedSockets {
public:
    PassedSockets() = default;
    /// The sockets that the variables name; nothing when they are meant for another process or make no sense. The
    /// descriptors are this object's from then on, those that nobody takes are closed with it, and no child inherits
    /// them.
    struct Variables {
        std::string pid;
        std::string count;
        std::string names;
    };
    [[nodiscard]] static PassedSockets of(const Variables& variables, int firstDescriptor = 3);
    /// Those of this process's environment, which is cleared of them.
    [[nodiscard]] static PassedSockets ofEnvironment();

    /// The first one of the name that was not taken yet; invalid when there is none.
    [[nodiscard]] FileDescriptor take(std::string_view name);

private:
    struct Passed {
        std::string name;
        FileDescriptor socket;
    };
    std::vector<Passed> sockets_;
};

} // namespace zor::platform
