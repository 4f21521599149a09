// SPDX-License-Identifier: Apache-2.0
// The directories of containers that the daemon has told, opened without waiting for what users mounted on the way.
#pragma once

#include "Failure.h"
#include "fs/MountFences.h"
#include "os/FileDescriptor.h"
#include "platform/Disk.h"

#include <string>

namespace zorvanectl::content {

using zor::fs::MountFence;

/// Opens the directory of a container for reading, at the absolute path that the daemon told. From the place of its
/// owner's containers on no mount is crossed and no link followed; where that place is a user's (Kind::home) and does
/// not answer, this ends after homePatience.
[[nodiscard]] Outcome<zor::platform::FileDescriptor> openToldContainer(const std::string& path, MountFence::Kind kind);

/// The same of a container that is to be filled. The owner of a directory above it can put another one in its place
/// meanwhile, and what is written here is written by root: so it has to hold the daemon's record, which no other user
/// can make.
[[nodiscard]] Outcome<zor::platform::FileDescriptor> openNewContainer(zor::platform::Disk& disk,
                                                                      const std::string& path, MountFence::Kind kind);

} // namespace zorvanectl::content
