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
    invalidObject = 11,
    metadataUnreadable = 12,
    deathRowItemNotDestroyed = 17,
    identifierMissing = 18,
    notFound = 21,
    listForDeletionFailed = 28,
    metadataInvalid = 29,
    propertyListNotWritten = 34,
    valueNotAllowed = 38,
    exceptionCaught = 40,
    moveToDeathRowFailed = 41,
    cacheNotRebuilt = 43,
    cachedContainerWithoutMetadata = 44,
    cacheAddFailed = 45,
    cacheRemoveFailed = 46,
    cacheInputInvalid = 47,
    notEntitled = 55,
    entitlementFileNotWritten = 59,
    entitlementCountsDiffer = 60,
};

} // namespace zor
