// SPDX-License-Identifier: Apache-2.0
// Info values and the record of one container, by its UUID.
//
// A change is one atomic replacement of the metadata file: a stop leaves the old file or the new one. Each operation
// holds the container's lock; the overloads that take a lock are for callers that hold it already. Any thread.
#pragma once

#include "base/ZORError.h"
#include "fs/ZORFileManager.h"
#include "operations/Basics.h"
#include "plist/Value.h"
#include "store/ZORContainerCache.h"
#include "store/ZORMetadata.h"

#include <atomic>
#include <string>

namespace zor {

struct ContainerMetadata {
    std::string path;
    bool transient = false;
    ZORMetadata::Info info; // nullptr: none
};

class InfoValues {
public:
    struct Needs : RecordNeeds {
        ZORFileManager& fileManager;
        const StoreLimits& limits;
    };
    explicit InfoValues(const Needs& needs) : needs_(needs) {}

    /// `value` nullptr removes the key. Errors 11, 21, 34, 38 (no key), 40, 45. Unless the info would be more than the
    /// file can hold, the record keeps the new info when the file cannot be written.
    Result<void> setInfoValue(const Caller& caller, const plist::Value* value, const std::string* key,
                              const ContainerAddress& address);
    Result<void> setInfoValue(const Caller& caller, const plist::Value* value, const std::string* key,
                              const ContainerAddress& address, const IdentifierWriteLock& held);
    /// Errors 11, 21, 24 (no such key; not logged), 38, 40.
    Result<plist::Value> infoValueForKey(const std::string* key, const ContainerAddress& address);
    Result<plist::Value> infoValueForKey(const std::string* key, const ContainerAddress& address,
                                         const IdentifierLock& held);
    /// Errors 11, 21, 38, 40.
    Result<ContainerMetadata> metadataForUser(const ContainerAddress& address);

    /// Some record's info may not be on the disk: worth a look through the cache.
    [[nodiscard]] bool someIsNotSaved() const { return someIsNotSaved_; }

private:
    Result<void> checkSet(const std::string* key, const ContainerAddress& address);
    Result<void> checkGet(const std::string* key, const ContainerAddress& address);
    Result<void> set(const Caller& caller, const plist::Value* value, const std::string& key,
                     const ContainerAddress& address, const IdentifierWriteLock& held);
    Result<plist::Value> get(const std::string& key, const ContainerAddress& address, const IdentifierLock& held);
    /// Error 34 when the info values of the user's containers would take more than one user's may.
    Result<void> checkInfoShare(const Caller& caller, const ZORMetadata& record, const plist::Dictionary& info);

    const Needs needs_;
    std::atomic<bool> someIsNotSaved_{false};
};

} // namespace zor
