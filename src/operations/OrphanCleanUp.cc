// SPDX-License-Identifier: Apache-2.0
#include "operations/OrphanCleanUp.h"

#include "fs/Names.h"
#include "fs/SharedWork.h"
#include "store/ContainerLayout.h"
#include "store/Names.h"

#include <array>
#include <cerrno>
#include <string>
#include <utility>

namespace zor {

namespace {

constexpr const char* function = "_cleanupOrphanedDataForUser";
constexpr std::array orphanReportHead = {
    "***INTERNAL BUILD REQUEST: If you see this, file a Tracklet in \"Zorvane | all\" with the following data:",
    "\tSomeone is writing invalid data to a container, which has now been orphaned. Here are the invalid files:",
};
constexpr const char* orphanReportEnd = "***END INTERNAL BUILD REQUEST";
/// So many entries of a class directory are judged at once: enough for several threads, little enough for any memory.
constexpr std::size_t orphanBatchMax = 4096;

} // namespace

OrphanCleanUp::Orphan OrphanCleanUp::orphanKind(int classDirectory, const FileURL& entry,
                                                ContainerClass containerClass) {
    const std::string_view name = entry.lastPathComponent();
    switch (needs_.whitelist.judgeName(name, containerClass)) {
    case ZORWhitelist::NameOf::noContainer:
        return Orphan::byName;
    case ZORWhitelist::NameOf::unknown:
        needs_.log.write(logLevelError, function,
                         "Leaving %s: the table of well-known containers, which may name it, could not be read",
                         entry.c_str());
        return Orphan::no;
    case ZORWhitelist::NameOf::container:
        break;
    }
    const std::string metadata = std::string(name) + "/" + names::metadataFile;
    return needs_.fileManager.itemDoesNotExistBelow(classDirectory, metadata.c_str(), entry) ? Orphan::noMetadata
                                                                                             : Orphan::no;
}

void OrphanCleanUp::reportOrphan(const FileURL& entry) {
    for (const char* line : orphanReportHead)
        needs_.log.write(logLevelError, function, "%s", line);
    needs_.fileManager.printDirectoryStructureAtURL(entry);
    needs_.log.write(logLevelError, function, "%s", orphanReportEnd);
}

std::uint64_t OrphanCleanUp::_cleanupOrphanedDataForUser(std::uint32_t userId, ContainerClass containerClass) {
    const auto directory = needs_.configuration.openClassDirectory(userId, containerClass, false);
    // The content of another's directory there is no orphan; the getter has said so.
    if (!directory || !directory->opened)
        return 0;
    const auto owner = topLevelOwnerOf(containerClass, userId);
    std::uint64_t removed = 0;
    std::vector<FileURL> batch;
    std::vector<FileURL> leftovers;
    const auto listed = needs_.fileManager.forEachItemInDirectoryAtURL(
        directory->url, ZORFileManager::Leftovers::shown, [&](int, const FileURL& entry) {
            (fs::isCopyLeftover(entry.lastPathComponent()) ? leftovers : batch).push_back(entry);
            if (batch.size() == orphanBatchMax)
                removed += removeOrphans(directory->opened->get(), std::exchange(batch, {}), containerClass, owner);
            return needs_.report.goOn();
        });
    if (!listed && !listed.error().isPosix(ENOENT))
        needs_.log.write(logLevelError, __func__, "Failed to get items at %s : %s", directory->url.c_str(),
                         listed.error().text().c_str());
    if (!listed || needs_.report.stopped())
        return removed;
    removed += removeOrphans(directory->opened->get(), batch, containerClass, owner);
    discard(leftovers, owner);
    return removed;
}

std::uint64_t OrphanCleanUp::removeOrphans(int classDirectory, const std::vector<FileURL>& entries,
                                           ContainerClass containerClass, std::optional<std::uint32_t> owner) {
    std::vector<Orphan> kinds(entries.size());
    fs::forEachStretch(kinds.size(), [&](std::size_t begin, std::size_t end) {
        for (std::size_t i = begin; i < end; ++i)
            kinds[i] = orphanKind(classDirectory, entries[i], containerClass);
    });
    std::uint64_t removed = 0;
    for (std::size_t i = 0; i < kinds.size() && needs_.report.goOn(); ++i) {
        const FileURL& entry = entries[i];
        if (kinds[i] == Orphan::no)
            continue;
        if (kinds[i] == Orphan::noMetadata)
            needs_.log.write(logLevelError, function, "Deleting orphaned data missing a metadata file at: %s",
                             entry.c_str());
        if (needs_.internalBuild.isInternalBuild())
            reportOrphan(entry);
        // A failure has been logged where it happened; the next boot tries again.
        removed += needs_.deathRow._moveItemAtURLToDeathRow(entry, StartDeletionThread::no, owner) ? 1 : 0;
    }
    return removed;
}

void OrphanCleanUp::discardCopyLeftovers(const FileURL& directory) {
    discard(needs_.fileManager.copyLeftoversInDirectoryAtURL(directory), std::nullopt);
}

void OrphanCleanUp::discard(const std::vector<FileURL>& leftovers, std::optional<std::uint32_t> owner) {
    for (const FileURL& leftover : leftovers)
        (void)needs_.deathRow._moveItemAtURLToDeathRow(leftover, StartDeletionThread::no, owner);
}

} // namespace zor
