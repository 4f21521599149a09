// SPDX-License-Identifier: Apache-2.0
// The parts of the file system that the sandbox shows, each as an open descriptor.
//
// A container is opened from the root without following a link, and has to be a directory of its owner. From then on
// the descriptor is what counts (Staging.h): whatever is put in its place afterwards is not mounted.
#pragma once

#include "Failure.h"
#include "Options.h"
#include "Root.h"
#include "ToldContainers.h"

#include <vector>

namespace zorvanerun {

struct Mount {
    enum class Kind { data, applicationGroup, systemContainer, systemGroup, readOnly, system };
    Kind kind = Kind::system;
    /// The container's; empty for what is none.
    std::string identifier;
    /// In the sandbox, and outside.
    std::string path;
    zor::platform::FileDescriptor descriptor; // O_PATH
    /// Not empty: a symbolic link of the system's own, made anew; there is no descriptor then.
    std::string linkTarget;
    /// A file, in a directory that the sandbox makes for it.
    bool isFile = false;

    [[nodiscard]] bool isContainer() const { return kind != Kind::readOnly && kind != Kind::system; }
};

/// "data", "application group" and so on.
[[nodiscard]] const char* kindName(Mount::Kind kind);

/// In the order in which they are to be mounted: the system, directories to read, containers.
[[nodiscard]] Result<std::vector<Mount>> openMounts(const Root& root, const Options& options,
                                                    const ToldContainers& told);

} // namespace zorvanerun
