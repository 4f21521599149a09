// SPDX-License-Identifier: Apache-2.0
// Entries of a class directory that are no containers go to death row, at the first launch after a boot.
//
// The owner of a class directory can rename anything to a name in it. So only what belongs to the owner of its
// containers goes; another's directory stays, and is said.
//
// Directories are read in batches: no number of entries is too large for the memory. Every step may be repeated. On the
// thread that starts the daemon; entries are judged by several threads.
#pragma once

#include "base/ContainerClass.h"
#include "base/FileURL.h"
#include "base/Log.h"
#include "fs/ZORFileManager.h"
#include "operations/DeathRow.h"
#include "platform/Device.h"
#include "store/SetupReport.h"
#include "store/ZORGlobalConfiguration.h"
#include "store/ZORWhitelist.h"

#include <cstdint>
#include <optional>
#include <vector>

namespace zor {

class OrphanCleanUp {
public:
    struct Needs {
        const Log& log;
        const platform::InternalBuildQuery& internalBuild;
        ZORFileManager& fileManager;
        ZORGlobalConfiguration& configuration;
        const ZORWhitelist& whitelist;
        SetupReport& report;
        DeathRow& deathRow;
    };
    explicit OrphanCleanUp(const Needs& needs) : needs_(needs) {}

    /// How many entries went.
    std::uint64_t _cleanupOrphanedDataForUser(std::uint32_t userId, ContainerClass containerClass);
    /// Copies across file systems that a stop cut short: hidden, so no listing shows them. In a directory of the
    /// daemon's.
    void discardCopyLeftovers(const FileURL& directory);

private:
    enum class Orphan : std::uint8_t { no, byName, noMetadata };
    /// `classDirectory` is open and holds the entry. Several threads may ask at once.
    Orphan orphanKind(int classDirectory, const FileURL& entry, ContainerClass containerClass);
    void reportOrphan(const FileURL& entry);
    /// `classDirectory` is open and holds the entries.
    void discard(const std::vector<FileURL>& leftovers, std::optional<std::uint32_t> owner);
    std::uint64_t removeOrphans(int classDirectory, const std::vector<FileURL>& entries, ContainerClass containerClass,
                                std::optional<std::uint32_t> owner);

    const Needs needs_;
};

} // namespace zor
