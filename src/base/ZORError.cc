// SPDX-License-Identifier: Apache-2.0
#include "base/ZORError.h"

#include "base/Log.h"

#include <bit>
#include <cerrno>

namespace zor {

std::string ZORError::text() const {
    return formatted("%s %d \"%s\"", domainName(), code_, ZOR_SHOWN(description_));
}

bool ZORError::isOwnShortage() const {
    return (domain_ == ErrorDomain::posix && zor::isOwnShortage(Errno(code_))) ||
           (underlying_ && underlying_->isOwnShortage());
}

namespace {

/// Added to an errno that reads as a code of the system; clients know the offset (client/ErrorText.cc).
constexpr int errnoOffset = 1000;

bool isSystemCode(int number) {
    using enum ErrorCode;
    switch (std::bit_cast<ErrorCode>(static_cast<std::int64_t>(number))) {
    case success:
    case moveToTemporaryFailed:
    case transientRemovalFailed:
    case subdirectoryFailed:
    case stagingDirectoryFailed:
    case moveToLiveFailed:
    case stagingRemovalFailed:
    case pathNotAsExpected:
    case invalidObject:
    case metadataUnreadable:
    case oldNotMovedToStaging:
    case newNotMovedIntoPlace:
    case deathRowItemNotDestroyed:
    case identifierMissing:
    case notFound:
    case replacedByItself:
    case classesDiffer:
    case infoKeyNotFound:
    case alreadyExists:
    case listForDeletionFailed:
    case metadataInvalid:
    case journalValuesInvalid:
    case propertyListNotWritten:
    case journalUnusable:
    case replaceCleanUpFailed:
    case valueNotAllowed:
    case exceptionCaught:
    case moveToDeathRowFailed:
    case cacheNotRebuilt:
    case cachedContainerWithoutMetadata:
    case cacheAddFailed:
    case cacheRemoveFailed:
    case cacheInputInvalid:
    case directoryNotRenamed:
    case notEntitled:
    case usersDiffer:
    case entitlementFileNotWritten:
    case entitlementCountsDiffer:
    case lockedAndNotRetried:
    case ownerNotChanged:
        return true;
    }
    return false;
}

} // namespace

ErrorCode ZORError::replyCode() const {
    int number = isPosix(EPERM) ? EACCES : code_;
    if (domain_ == ErrorDomain::posix && isSystemCode(number))
        number += errnoOffset;
    // A POSIX number is none of the enumerators: it is carried, not converted.
    return std::bit_cast<ErrorCode>(static_cast<std::int64_t>(number));
}

void logError(const Log& log, const ZORError& error) {
    if (!error.description())
        return;
    const LogCodeScope about(error.replyCode());
    if (error.underlying())
        log.write(logLevelError, error.functionName(), "%d: %s (%s)", error.sourceFileLine(),
                  error.description()->c_str(), error.underlying()->text().c_str());
    else
        log.write(logLevelError, error.functionName(), "%d: %s", error.sourceFileLine(), error.description()->c_str());
}

ZORError makeError(const Log& log, Here here, ErrorCode code, const ZORError* underlying, LogFlag flag,
                   const char* format, ...) {
    std::va_list arguments;
    va_start(arguments, format);
    ZORError error(here, ErrorDomain::zor, static_cast<int>(code), formattedList(format, arguments),
                   underlying ? std::make_shared<const ZORError>(*underlying) : nullptr);
    va_end(arguments);
    if (flag == LogFlag::yes)
        logError(log, error);
    return error;
}

ZORError posixError(Here here, Errno error, const char* format, ...) {
    std::va_list arguments;
    va_start(arguments, format);
    ZORError made(here, ErrorDomain::posix, error.number(), formattedList(format, arguments));
    va_end(arguments);
    return made;
}

} // namespace zor
