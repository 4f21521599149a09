// SPDX-License-Identifier: Apache-2.0
// Two repairs of a container: its standard subdirectories made again, and a new name for its directory. Neither gives a
// directory to a user for its name alone: the container and each subdirectory are judged on the descriptor used.
//
// A subdirectory that is made anew has the protection class that is recorded for the container; while the device is
// locked, one that lock takes away cannot be given, and the repair fails.
//
// A stop leaves some subdirectories made, one perhaps not yet its owner's, until the repair is repeated; or the
// container under its old or its new name; a mapping that then points to nothing is removed at the next launch.
//
// Any thread; each takes the container's lock.
#pragma once

#include "base/ZORError.h"
#include "fs/PathResolver.h"
#include "fs/ZORFileManager.h"
#include "operations/Basics.h"
#include "operations/LastingMoves.h"
#include "operations/ReplaceRecovery.h"

#include <vector>

namespace zor {

struct ContainerLayout;

class Structure {
public:
    struct Needs : RecordNeeds {
        ZORFileManager& fileManager;
        const LastingMoves& moves;
        SandboxMappings& mappings;
        ReplaceRecovery& recovery;
    };
    explicit Structure(const Needs& needs) : needs_(needs) {}

    /// Makes missing standard subdirectories, and sets mode and owner of those that are there. Errors 6, 11, 21,
    /// 38, 40.
    Result<void> recreateDefaultStructureForUser(const ContainerAddress& address);
    /// Gives the container's directory a new random name. Errors 11, 21, 35, 38, 40, 45, 48.
    Result<void> regenerateDirectoryUUIDForUser(const ContainerAddress& address);

private:
    /// With WaitingReplaces::metOneUnderWay.
    Result<void> regenerate(const ContainerAddress& address);
    /// The standard subdirectories of the container that `changed` begins with; each is added to it. New ones get the
    /// protection class.
    Result<void> makeSubdirectories(const ContainerLayout& layout, int protectionClass, std::vector<FileURL>& changed);

    const Needs needs_;
};

} // namespace zor
