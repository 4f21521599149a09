// SPDX-License-Identifier: Apache-2.0
// Replaces that stopped half-way: what a launch makes of them, and what requests do about those
// that still wait afterwards.
//
// A journal says where the directories of a replace were and were to go; which of them are there says how far it came.
// Each recovery is one move at the most. A journal that cannot be settled or read stays and waits. The moves that its
// state rests on are on the disk before the journal can be gone: a stop in between leaves another state of the same
// table.
//
// At a launch it runs on the thread that starts the daemon, before any client and before anything is cached; later
// under the all-identifiers lock, for one journal.
#pragma once

#include "base/ContainerClass.h"
#include "base/ZORError.h"
#include "base/ZORLocks.h"
#include "fs/PathResolver.h"
#include "fs/ZORFileManager.h"
#include "ipc/Identifiers.h"
#include "operations/DeathRow.h"
#include "operations/LastingMoves.h"
#include "store/Configuration.h"
#include "store/ReplaceJournal.h"
#include "store/SetupProgress.h"
#include "store/ZORContainerCache.h"

#include <cerrno>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>

namespace zor {

struct ReplaceJournal;

class ReplaceRecovery {
public:
    struct Needs {
        const Log& log;
        ZORFileManager& fileManager;
        ZORGlobalConfiguration& configuration;
        ZORContainerCache& cache;
        const LastingMoves& moves;
        DeathRow& deathRow;
        SetupReport& report;
        WaitingReplaces& waiting;
    };
    explicit ReplaceRecovery(const Needs& needs) : needs_(needs) {}
    ReplaceRecovery(const ReplaceRecovery&) = delete;
    ReplaceRecovery& operator=(const ReplaceRecovery&) = delete;

    /// Undoes or finishes what a stop interrupted. At the launch, without locks. Errors 35, 36.
    Result<void> _recoverFromReplaceOperationsWithError();
    /// Names in staging that journals on the disk still speak of; nullopt when it cannot be told which there are.
    [[nodiscard]] std::optional<std::set<std::string, std::less<>>> stagedByJournals();
    [[nodiscard]] std::size_t journalCount();
    /// Items that lie aside on other file systems than staging's and that no journal names go to death row. Returns how
    /// many went. At the launch.
    std::uint64_t sweepAside(const std::set<std::string, std::less<>>& kept);

    /// Whether no replace waits; costs one load.
    [[nodiscard]] bool noneWaits() const { return needs_.waiting.none(); }
    /// The journal of a replace stays on the disk, for a later try.
    void leave(WaitingReplaces::Waiting waiting) { needs_.waiting.add(std::move(waiting)); }

    /// A container that is about to be made, or taken from its place.
    struct ContainerAtStake {
        std::uint32_t userId = 0;
        ContainerClass containerClass = ContainerClass::undefined;
        const std::string& identifier;
        FileURL place; // empty when it has none
    };
    /// Tries the replaces that wait and that could bring back a container of this identifier, or one to this place.
    /// Whether there were any; error 35 while one is left; WaitingReplaces::metOneUnderWay.
    Result<bool> settleReplaces(const ContainerAtStake& atStake, const AllIdentifiersWriteLock& lock);
    /// The cache's record, or nullptr, when no replace that waits has to do with it. Error 35;
    /// WaitingReplaces::metOneUnderWay.
    Result<std::shared_ptr<ZORMetadata>> settledContainer(std::uint32_t userId, ContainerClass containerClass,
                                                          const std::string* identifier, const UUID& uuid,
                                                          const AllIdentifiersWriteLock& lock);

private:
    /// For journals that could not be listed. Error 35 while they cannot and staging may hold a container at stake.
    Result<void> listReplacesAgain(const ContainerAtStake& atStake);
    /// Reads a journal that could not be read before. Error 35 while it cannot be and names something aside that may be
    /// at stake.
    Result<void> learnPlaces(WaitingReplaces::Waiting& one, const ContainerAtStake& atStake);
    /// Whether a container at stake may lie aside on the file system of its class directory, where that is not
    /// staging's: under this name or, if that is empty, any.
    bool mayBeAside(std::string_view name, const ContainerAtStake& atStake);
    /// Whether what waits at `staged` may be one of this identifier, or come back to this place.
    bool mayComeBack(const FileURL& staged, const WaitingReplaces::Waiting& waiting, const ContainerAtStake& atStake);
    /// The places that it names are below the root as it is, wherever that was when the journal was written.
    Result<ReplaceJournal> readJournal(const FileURL& url);
    /// `journal` is nullptr for a file that is none.
    Result<void> recoverReplace(const FileURL& journalUrl, const ReplaceJournal* journal);
    Result<void> applyReplaceJournal(const ReplaceJournal& journal);

    const Needs needs_;
};

} // namespace zor
