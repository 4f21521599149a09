// SPDX-License-Identifier: Apache-2.0
// Finding a container, and making it where it is missing.
//
// Creation.cc says who may have which container and which record answers; ContainerMaker puts a new one on the disk and
// says what a stop leaves.
//
// Nobody waits for another's disk: a container is looked for under the all-identifiers lock, built in staging without
// it, looked for again and moved into its place under it, and the sync after the move runs when it is released. One
// that somebody else has made meanwhile is the answer, and the double goes to death row. Until that last sync is done
// the record says so, and whoever finds it meanwhile waits for a sync of its own before it answers. Any thread.
#pragma once

#include "base/ContainerClass.h"
#include "base/ZORError.h"
#include "base/ZORLocks.h"
#include "ipc/Identifiers.h"
#include "operations/Basics.h"
#include "operations/ContainerMaker.h"
#include "operations/DeathRow.h"
#include "operations/LastingMoves.h"
#include "operations/ReplaceRecovery.h"
#include "store/Configuration.h"
#include "store/ZORContainerCache.h"
#include "store/ZOREntitlementMapping.h"

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

namespace zor {

// Finding a live container without making or changing anything: while nobody writes without a lock, else once more
// under the all-identifiers lock held for reading. Most lookups end here.
// docs/decisions/0008-lookups-without-the-lock.md says why such a lookup never answers from the middle of a writer.

/// The container as it is, on the disk and in the cache at one moment; nullopt when it is not there, or when anything
/// about it is out of the ordinary: then only the lookup under the lock can tell. The caller holds no identifier lock.
/// Waits for writers that are under way, for no reader. Any thread.
[[nodiscard]] std::optional<ZORContainerCache::LiveContainer>
lookUpUndisturbed(ZORLocks& locks, ZORContainerCache& cache, std::uint32_t userId, ContainerClass containerClass,
                  const std::string& identifier);

/// A container as an operation found or made it. The parts of the record that a reply needs were read while the
/// operation still held its lock, so one client never sees what another's request made of the shared record meanwhile.
struct FoundContainer {
    std::shared_ptr<ZORMetadata> record;
    UUID uuid;
    std::string path;
    bool existed = false;
    /// The directory that a container which was just made was moved into.
    std::shared_ptr<const platform::FileDescriptor> movedInto = nullptr;
};

struct CreateOrLookupOptions {
    bool createIfNecessary = false;
    bool transient = false;
    /// It is made to take the place of another of the user's, so the user's share does not count.
    bool replacesAnother = false;
};

class Creation {
public:
    struct Needs : RecordNeeds {
        ZORGlobalConfiguration& configuration;
        ZOREntitlementMapping& entitlements;
        const StoreLimits& limits;
        const LastingMoves& moves;
        DeathRow& deathRow;
        ReplaceRecovery& recovery;
        ContainerMaker& maker;
    };
    explicit Creation(const Needs& needs) : needs_(needs) {}

    /// The container of (user, identifier, class), created if asked, and on the disk; error 38 where its user has as
    /// many as one may have and the caller does not own the root. Runs under the all-identifiers lock held for writing,
    /// where a live container is not simply found (lookUpUndisturbed). `identifier` nullptr: error 11.
    Result<FoundContainer> createOrLookupContainerForUser(const Caller& caller, std::uint32_t userId,
                                                          const std::string* identifier, ContainerClass containerClass,
                                                          const CreateOrLookupOptions& options);
    /// The same for a caller that holds that lock, and calls makeDurable on the result after its release, before
    /// anybody is told. nullopt: there is no container, and `ahead` has to be built without the lock first. Also the
    /// error of WaitingReplaces::metOneUnderWay.
    Result<std::optional<FoundContainer>>
    createOrLookupContainerForUser(const Caller& caller, std::uint32_t userId, const std::string* identifier,
                                   ContainerClass containerClass, const CreateOrLookupOptions& options,
                                   BuiltAhead& ahead, const AllIdentifiersWriteLock& lock);
    /// Returns at once for a container whose place is on the disk already. Error 8.
    Result<void> makeDurable(const FoundContainer& container);

private:
    struct Wanted {
        const Caller& caller;
        std::uint32_t userId;
        const std::string& identifier;
        ContainerClass containerClass;
        const CreateOrLookupOptions& options;
    };
    Result<void> checkRequest(const Caller& caller, std::uint32_t userId, const std::string* identifier,
                              ContainerClass containerClass);
    /// createOrLookup under the lock. The facts of this disk that the lookup needs are read before the lock is taken.
    Result<std::optional<FoundContainer>> lookedFor(const Wanted& wanted, std::optional<ContainerMaker::Built>& built);
    /// `built` is what the caller has built; where it has nothing yet, the answer is nothing when it has to build
    /// first. The parts that are used are taken out of `built`.
    Result<std::optional<FoundContainer>> createOrLookup(const Wanted& wanted,
                                                         std::optional<ContainerMaker::Built>& built,
                                                         const AllIdentifiersWriteLock& lock);
    /// Error 38 when the user of the container has as many as one may have.
    Result<void> checkShare(const Wanted& wanted);
    Result<void> discardTransient(const ZORMetadata& record, const std::string& identifier);
    /// `homeGeneration`: of the home in which the container was looked for and not found.
    Result<FoundContainer> create(const Wanted& wanted, std::optional<ContainerMaker::Built>& built,
                                  std::uint64_t homeGeneration);

    const Needs needs_;
};

} // namespace zor
