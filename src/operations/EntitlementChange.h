// SPDX-License-Identifier: Apache-2.0
// The effect of a change of one identifier's entitlements on the map and of the containers that hang on it.
//
// A change is planned: the parts of the map that will differ, in the order in which they are stored, and what goes with
// the old entitlements. Then the system container and the groups are released, while the map still holds those, so that
// the last reference to a group still counts as one. Then the map is settled, and the file written once. A stop or a
// failed save in between leaves containers on death row that the old map still speaks of: asked for again, they are
// made anew.
//
// From the plan to the settling the all-identifiers lock is held for writing; nobody else changes the map then. The
// entitlement queue is entered for the plan and for the settling alone: no disk work on containers stops its readers.
// Any thread.
#pragma once

#include "base/ErrorCode.h"
#include "base/Result.h"
#include "base/ZORException.h"
#include "base/ZORLocks.h"
#include "operations/ContainerRemoval.h"
#include "operations/ZORGroupManager.h"
#include "plist/Value.h"
#include "store/ZORContainerCache.h"
#include "store/ZOREntitlementMapping.h"
#include "store/ZORGlobalConfiguration.h"

#include <string>

namespace zor {

class EntitlementChange {
public:
    struct Needs {
        const Log& log;
        ExceptionBoundary& boundary;
        ZORLocks& locks;
        const ZORGlobalConfiguration& configuration;
        ZORContainerCache& cache;
        ZOREntitlementMapping& entitlements;
        ContainerRemoval& removal;
        ZORGroupManager& groups;
    };
    explicit EntitlementChange(const Needs& needs) : needs_(needs) {}

    /// Registers, changes or (`entitlements` nullptr) removes the entitlements of one identifier, under the
    /// all-identifiers lock held for writing; what changes nothing takes neither that lock nor the disk. System and
    /// group containers that nothing refers to afterwards are staged for deletion. `options` may be nullptr.
    /// Codes: success; 18 without an identifier; 11 for an identifier that is a key of the map's own, or a parent that
    /// is no string; 59 when the file cannot be written; 40.
    ErrorCode processEntitlements(const plist::Dictionary* entitlements, const std::string* identifier,
                                  const plist::Dictionary* options);
    /// Removes what is stored for an identifier and for the children recorded for it. Failures are logged.
    void removeEntitlementDictionariesForIdentifierAndItsChildren(const std::string& identifier,
                                                                  const AllIdentifiersWriteLock& lock);

private:
    ErrorCode process(const plist::Dictionary* entitlements, const std::string& identifier,
                      const plist::Dictionary* options, const AllIdentifiersWriteLock& lock);
    Result<void> planReleaseSettle(const plist::Dictionary* entitlements, const std::string& identifier,
                                   const plist::Dictionary* options, const AllIdentifiersWriteLock& lock);
    void releaseSystemContainer(const std::string& identifier, const AllIdentifiersWriteLock& lock);

    const Needs needs_;
};

} // namespace zor
