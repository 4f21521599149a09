// SPDX-License-Identifier: Apache-2.0
// The effect of a change of one identifier's entitlements on the map and on the containers that follow from it.
//
// A change is planned: the parts of the map that will differ, in the order in which they are stored, and what goes with
// the old entitlements. Then the system container and the groups are released, while the map still holds those, so that
// the last reference to a group still counts as one. Then the change is applied to the map in memory. All that is under
// the all-identifiers lock for writing, which nobody holds when the change is settled: the moves are synced, then the
// file is written, once for all changes that wait for it. A stop or a failed save in between leaves containers on death
// row that the old map still speaks of: asked for again, they are made anew.
//
// A change that another thread settles is settled with the moves that belong to it: a change leaves its moves here
// before it is applied, and who settles takes all that were left before it syncs.
//
// A container that is to be released while its replace waits for the disk is waited for, without the lock; then the
// change is planned anew. Any thread.
#pragma once

#include "base/Mutex.h"
#include "base/ZORError.h"
#include "fs/PathResolver.h"
#include "operations/Basics.h"
#include "operations/Deletion.h"
#include "operations/ZORGroupManager.h"
#include "plist/Value.h"
#include "store/Configuration.h"
#include "store/ZOREntitlementMapping.h"

#include <optional>
#include <string>
#include <vector>

namespace zor {

class EntitlementChange {
public:
    struct Needs : RecordNeeds {
        const ZORGlobalConfiguration& configuration;
        ZOREntitlementMapping& entitlements;
        ContainerRemoval& removal;
        ZORGroupManager& groups;
    };
    explicit EntitlementChange(const Needs& needs) : needs_(needs) {}

    /// Registers, changes or (`entitlements` nullptr) removes the entitlements of one identifier, planned under the
    /// all-identifiers lock held for writing; what changes nothing takes neither that lock nor the disk. System and
    /// group containers that nothing refers to afterwards are staged for deletion. `options` may be nullptr.
    /// Codes: success; 18 without an identifier; 11 for an identifier that is a key of the map's own, or a parent that
    /// is no string; 59 when the file cannot be written; 40.
    ErrorCode processEntitlements(const plist::Dictionary* entitlements, const std::string* identifier,
                                  const plist::Dictionary* options);
    using Change = ZOREntitlementMapping::Change;
    /// Reads what the removal will have to know of containers, before the lock is taken.
    void prepareRemoval(const std::string& identifier);
    /// Removes what is stored for an identifier and for the children recorded for it. `change` gets the last change
    /// that is to be settled when the lock is released (settleRemoval). Failures are logged; an error only where
    /// WaitingReplaces::metOneUnderWay: nothing has been done then.
    Result<void> removeEntitlementDictionariesForIdentifierAndItsChildren(const std::string& identifier,
                                                                          std::optional<Change>& change,
                                                                          const AllIdentifiersWriteLock& lock);
    /// Returns when that, and what it released, is on the disk. Without a lock. Failures are logged.
    void settleRemoval(const std::string& identifier, Change change);

private:
    /// The same of any change. Code 59.
    ErrorCode settle(Change change) ZOR_EXCLUDES(unsyncedMutex_);
    /// Does the same as prepareRemoval, for a change of one identifier.
    void prepare(const std::string& identifier);
    std::vector<std::string> withChildren(const std::string& identifier) const;
    /// Error WaitingReplaces::metOneUnderWay while something that goes with the entitlements of `identifier` is being
    /// replaced.
    [[nodiscard]] Result<void> refuseIfUnderWay(const std::string& identifier, const AllIdentifiersWriteLock& lock);
    void sayIfNotCleared(const std::string& identifier, ErrorCode code) const;
    /// `change` gets what is to be settled, if anything is. An error of WaitingReplaces::metOneUnderWay comes before
    /// the map is changed; containers may have gone that the map still speaks of.
    Result<void> process(const plist::Dictionary* entitlements, const std::string& identifier,
                         const plist::Dictionary* options, std::optional<Change>& change,
                         const AllIdentifiersWriteLock& lock);
    Result<std::optional<Change>> planReleaseApply(const plist::Dictionary* entitlements, const std::string& identifier,
                                                   const plist::Dictionary* options,
                                                   const AllIdentifiersWriteLock& lock);
    Result<void> releaseSystemContainer(const std::string& identifier, std::vector<FileURL>& changed,
                                        const AllIdentifiersWriteLock& lock);

    const Needs needs_;
    platform::Mutex unsyncedMutex_;
    /// Directories whose changes are to be on the disk before the map is that no longer speaks of what left them.
    std::vector<FileURL> unsynced_ ZOR_GUARDED_BY(unsyncedMutex_);
};

} // namespace zor
