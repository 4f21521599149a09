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
    [[nodiscard]] bool noneWaits() const { return waiting_.none(); }
    /// The journal of a replace stays on the disk, for a later try.
    void leave(WaitingReplaces::Waiting waiting) { waiting_.add(std::move(waiting)); }
    /// For replaces that wait for the disk without the lock.
    [[nodiscard]] WaitingReplaces& underWay() { return waiting_; }
    /// Runs `step`, which takes the lock, until it meets no replace that is under way and has to do with its container:
    /// before it comes again, that one has ended. Without a lock.
    template <typename Step>
    auto undisturbed(Step&& step) -> decltype(step()) {
        for (;;) {
            const std::uint64_t ended = waiting_.ended();
            auto result = step();
            if (result || !metOneUnderWay(result.error()))
                return result;
            waiting_.awaitMoreThan(ended);
        }
    }
    /// Whether an error of the functions below says that a replace is under way: nothing has been done then.
    [[nodiscard]] static bool metOneUnderWay(const ZORError& error) { return error.isPosix(EINPROGRESS); }
    /// That error while a container of this identifier is being replaced. For callers that hold a container's own lock
    /// alone, too.
    [[nodiscard]] Result<void> refuseIfUnderWay(std::uint32_t userId, ContainerClass containerClass,
                                                std::string_view identifier) const;

    /// A container that is about to be made, or taken from its place.
    struct ContainerAtStake {
        std::uint32_t userId = 0;
        ContainerClass containerClass = ContainerClass::undefined;
        const std::string& identifier;
        FileURL place; // empty when it has none
    };
    /// Tries the replaces that wait and that could bring back a container of this identifier, or one to this place.
    /// Whether there were any; error 35 while one is left; metOneUnderWay.
    Result<bool> settleReplaces(const ContainerAtStake& atStake, const AllIdentifiersWriteLock& lock);
    /// The cache's record, or nullptr, when no replace that waits has to do with it. Error 35; metOneUnderWay.
    Result<std::shared_ptr<ZORMetadata>> settledContainer(std::uint32_t userId, ContainerClass containerClass,
                                                          const std::string* identifier, const UUID& uuid,
                                                          const AllIdentifiersWriteLock& lock);

private:
    /// For journals that could not be listed. Error 35 while they cannot and staging may hold a container at stake.
    Result<void> listReplacesAgain(const ContainerAtStake& atStake);
    /// Whether what waits at `staged` may be one of this identifier, or come back to this place.
    bool mayComeBack(const FileURL& staged, const WaitingReplaces::Waiting& waiting, const ContainerAtStake& atStake);
    /// The places that it names are below the root as it is, wherever that was when the journal was written.
    Result<ReplaceJournal> readJournal(const FileURL& url);
    /// `journal` is nullptr for a file that is none.
    Result<void> recoverReplace(const FileURL& journalUrl, const ReplaceJournal* journal);
    Result<void> applyReplaceJournal(const ReplaceJournal& journal);

    const Needs needs_;
    WaitingReplaces waiting_;
};

} // namespace zor
