// SPDX-License-Identifier: Apache-2.0
// The codes of ZORErrorDomain, as "ReplyError" carries them to clients. A code, once given out, keeps its meaning.
#pragma once

#include <cstdint>

namespace zor {

enum class ErrorCode : std::uint64_t {
    success = 1,
    moveToTemporaryFailed = 4,
    transientRemovalFailed = 5,
    subdirectoryFailed = 6,
    stagingDirectoryFailed = 7,
    moveToLiveFailed = 8,
    stagingRemovalFailed = 9,
    pathNotAsExpected = 10,
    invalidObject = 11,
    metadataUnreadable = 12,
    oldNotMovedToStaging = 14,
    newNotMovedIntoPlace = 15,
    deathRowItemNotDestroyed = 17,
    identifierMissing = 18,
    notFound = 21,
    replacedByItself = 22,
    classesDiffer = 23,
    infoKeyNotFound = 24,
    alreadyExists = 27,
    listForDeletionFailed = 28,
    metadataInvalid = 29,
    journalValuesInvalid = 33,
    propertyListNotWritten = 34,
    journalUnusable = 35,
    replaceCleanUpFailed = 36,
    valueNotAllowed = 38,
    exceptionCaught = 40,
    moveToDeathRowFailed = 41,
    cacheNotRebuilt = 43,
    cachedContainerWithoutMetadata = 44,
    cacheAddFailed = 45,
    cacheRemoveFailed = 46,
    cacheInputInvalid = 47,
    directoryNotRenamed = 48,
    notEntitled = 55,
    usersDiffer = 56,
    entitlementFileNotWritten = 59,
    entitlementCountsDiffer = 60,
    lockedAndNotRetried = 61,
    ownerNotChanged = 62,
};

} // namespace zor
