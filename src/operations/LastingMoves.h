// SPDX-License-Identifier: Apache-2.0
// The last steps of an operation that moved containers, before it answers: the moves are to be on the disk, and the
// sandbox is to know where the containers are.
//
// Syncs run without locks wherever that can be. One that fails leaves what was moved in its new place, and the answer
// says that a power cut may undo it. A stop between the removal of a mapping and its new setting leaves none; the
// operation that sets it is repeated or rolled back by its own recovery. Any thread.
#pragma once

#include "base/ContainerClass.h"
#include "base/Log.h"
#include "base/ZORError.h"
#include "fs/Durability.h"
#include "fs/PathResolver.h"
#include "fs/ZORFileManager.h"
#include "platform/Device.h"
#include "platform/Errno.h"

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace zor {

class LastingMoves {
public:
    LastingMoves(const Log& log, const ZORFileManager& fileManager, const fs::Durability& durability)
        : log_(log), fileManager_(fileManager), durability_(durability) {}

    [[nodiscard]] const fs::Durability& durability() const { return durability_; }

    /// Makes what was moved into or out of these directories durable; the error is not logged.
    [[nodiscard]] std::optional<ZORError> syncDirectories(std::vector<FileURL> changed) const;
    /// The same of the open directory that holds `moved`; O_PATH will do.
    [[nodiscard]] std::optional<ZORError> syncDirectory(const platform::FileDescriptor& directory,
                                                        const FileURL& moved) const;
    /// A change in one directory is on the disk before the next one in the other can be.
    Errno orderBetween(const FileURL& changed, const FileURL& next) const;
    /// The error of a container whose move into its place could not be synced, logged. The record says so until one is.
    [[nodiscard]] ZORError notLasting(const char* function, ErrorCode code, const FileURL& container,
                                      const ZORError& cause) const;

private:
    const Log& log_;
    const ZORFileManager& fileManager_;
    const fs::Durability& durability_;
};

class SandboxMappings {
public:
    SandboxMappings(const Log& log, platform::SandboxUserState& sandbox) : log_(log), sandbox_(sandbox) {}

    /// Removes the mapping, then sets it when there is a URL. False, logged, on failure.
    bool _setSandboxContainerMappingForUser(std::uint32_t userId, const std::string& identifier,
                                            ContainerClass containerClass, const std::optional<FileURL>& url);

private:
    const Log& log_;
    platform::SandboxUserState& sandbox_;
};

} // namespace zor
