// SPDX-License-Identifier: Apache-2.0
// Builds one container in the staging directory, complete, for one move into its class directory.
//
// Everything is made as the daemon's own, closed to others, and given its mode and owner in a last pass, from the
// deepest directory up: at no moment can the future owner, or anybody whom a mode lets in, reach a directory that the
// daemon still works in. What is made is worked on through descriptors.
//
// Unlike a directory getter, a container is not there by halves: a mode or an owner that cannot be set fails the build.
//
// A stop at any point leaves a directory in staging, which the next launch sweeps away.
#pragma once

#include "fs/Durability.h"
#include "fs/ZORFileManager.h"
#include "os/FileDescriptor.h"
#include "store/ContainerLayout.h"
#include "store/ZORMetadata.h"

#include <string>
#include <string_view>
#include <vector>

namespace zor {

class ContainerBuilder {
public:
    /// Builds `staging` (whose parent exists) by the layout. `staging` has not been made yet.
    ContainerBuilder(const Log& log, ZORFileManager& fileManager, FileURL staging, const ContainerLayout& layout)
        : log_(log), fileManager_(fileManager), disk_(fileManager.disk()), staging_(std::move(staging)),
          layout_(layout) {}

    /// The container's own directory. Error 7.
    Result<void> _createTopLevelContainerDirectory();
    /// Its standard subdirectories, in the layout's order, stopping at the first failure. Error 6.
    Result<void> _createSubDirectories();
    /// The metadata file of the record: a new file, 0644 and the daemon's own. Error 34.
    Result<void> writeMetadata(const ZORMetadata& record);
    /// Modes and owners. Errors 6 and 7.
    Result<void> giveAway();
    /// Sees to it that a move cannot become durable before what it moves. Error 34.
    Result<void> orderBeforeMove(const fs::Durability& durability);

private:
    /// The descriptor of a subdirectory that a deeper one lies in: the layout names it first.
    [[nodiscard]] int madeBefore(std::string_view subdirectory) const;
    ZORError topLevelError(Here here, int number, const char* verb);
    ZORError subdirectoryError(Here here, const char* subdirectory, int number, const char* verb);
    Result<void> attributesOf(int directory, mode_t mode, std::uint32_t owner, const char* subdirectory);

    const Log& log_;
    ZORFileManager& fileManager_;
    platform::Disk& disk_;
    const FileURL staging_;
    const ContainerLayout layout_;
    platform::FileDescriptor directory_;
    std::vector<platform::FileDescriptor> subdirectories_; // in the layout's order
    platform::FileDescriptor metadata_;
};

} // namespace zor
