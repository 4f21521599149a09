// SPDX-License-Identifier: Apache-2.0
#include "base/ZORError.h"

#include "base/Log.h"
#include "base/Mutex.h"

#include <bit>
#include <cerrno>
#include <cstdlib>
#include <execinfo.h>
#include <pthread.h>
#include <typeinfo>

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

ZORError Reporter::make(CodeOfLine code, const ZORError* cause, const char* format, std::va_list arguments) const {
    return {{function_, code.line},
            ErrorDomain::zor,
            static_cast<int>(code.code),
            formattedList(format, arguments),
            cause ? std::make_shared<const ZORError>(*cause) : nullptr};
}

ZORError Reporter::error(CodeOfLine code, const char* format, ...) const {
    std::va_list arguments;
    va_start(arguments, format);
    ZORError made = make(code, nullptr, format, arguments);
    va_end(arguments);
    logError(log_, made);
    return made;
}

ZORError Reporter::error(CodeOfLine code, const ZORError* cause, const char* format, ...) const {
    std::va_list arguments;
    va_start(arguments, format);
    ZORError made = make(code, cause, format, arguments);
    va_end(arguments);
    logError(log_, made);
    return made;
}

ZORError Reporter::unlogged(CodeOfLine code, const char* format, ...) const {
    std::va_list arguments;
    va_start(arguments, format);
    ZORError made = make(code, nullptr, format, arguments);
    va_end(arguments);
    return made;
}

void Reporter::write(int level, const char* format, ...) const noexcept {
    std::va_list arguments;
    va_start(arguments, format);
    log_.writeList(level, function_, format, arguments);
    va_end(arguments);
}

ZORError posixError(Here here, Errno error, const char* format, ...) {
    std::va_list arguments;
    va_start(arguments, format);
    ZORError made(here, ErrorDomain::posix, error.number(), formattedList(format, arguments));
    va_end(arguments);
    return made;
}

namespace {

constexpr int stackFramesMax = 64;

std::string joined(const std::vector<std::string>& lines, const char* separator) {
    std::string text;
    for (const std::string& line : lines) {
        if (!text.empty())
            text += separator;
        text += line;
    }
    return text;
}

std::vector<std::string> stackOf(const std::exception& exception) {
    if (const auto* own = dynamic_cast<const ZORException*>(&exception))
        return own->callStack();
    return callStackSymbols(); // of the boundary: where it was thrown is gone
}

} // namespace

std::vector<std::string> callStackSymbols() {
    void* frames[stackFramesMax];
    const int count = ::backtrace(frames, stackFramesMax);
    std::vector<std::string> symbols;
    if (char** texts = ::backtrace_symbols(frames, count)) {
        symbols.assign(texts, texts + count);
        std::free(texts);
    }
    return symbols;
}

ZORException::ZORException(std::string name, std::string reason)
    : name_(std::move(name)), reason_(std::move(reason)), description_(name_ + ": " + reason_),
      callStack_(callStackSymbols()) {}

ZORError ExceptionBoundary::caught(Here here, const std::exception& exception) {
    ZORError error = Reporter(log_, here.function)
                         .error({ErrorCode::exceptionCaught, here.line}, "Got exception: %s : %s", exception.what(),
                                joined(stackOf(exception), ", ").c_str());
    if (internalBuild_.isInternalBuild())
        reportFatal(exception);
    return error;
}

void ExceptionBoundary::reportFatal(const std::exception& exception) {
    std::string report = "** INTERNAL ERROR: Uncaught Exception **\nException: ";
    char threadName[16] = "";
    if (::pthread_getname_np(::pthread_self(), threadName, sizeof threadName) == 0 && threadName[0] != '\0')
        report += formatted("<%s> ", threadName);
    if (const auto* own = dynamic_cast<const ZORException*>(&exception))
        report += own->name() + ": " + own->reason();
    else
        report += formatted("%s: %s", typeid(exception).name(), exception.what());
    report += "\nStack:\n" + joined(stackOf(exception), "\n");

    // Never unlocked: the first report is the one that is kept, a second thread waits for the end.
    static platform::Mutex reporting;
    reporting.lock();
    crash_.record(report);
    std::abort();
}

} // namespace zor
