// SPDX-License-Identifier: Apache-2.0
// The directory of a container that is to be filled.
#pragma once

#include "Failure.h"
#include "os/FileDescriptor.h"

#include <string>

namespace zorvanectl::content {

/// Opens the container at the absolute path that the daemon told. Whoever owns a directory above it can put another one
/// in its place meanwhile, and what is written here is written by root: so it has to hold the daemon's record, which no
/// other user can make.
[[nodiscard]] Outcome<zor::platform::FileDescriptor> openContainer(const std::string& path);

} // namespace zorvanectl::content
