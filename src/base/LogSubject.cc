// SPDX-License-Identifier: Apache-2.0
#include "base/LogSubject.h"

namespace zor {

namespace {

thread_local LogSubject subject;

} // namespace

const LogSubject& LogSubject::current() {
    return subject;
}

LogCodeScope::LogCodeScope(ErrorCode code) {
    subject.code = code;
}

LogCodeScope::~LogCodeScope() {
    subject.code.reset();
}

LogRequestScope::LogRequestScope(const std::function<void(const LogSubject::Take&)>& describe) {
    subject.request = &describe;
}

LogRequestScope::~LogRequestScope() {
    subject.request = nullptr;
}

bool isClientsMistake(ErrorCode code) {
    switch (code) {
    case ErrorCode::invalidObject:
    case ErrorCode::identifierMissing:
    case ErrorCode::notFound:
    case ErrorCode::replacedByItself:
    case ErrorCode::classesDiffer:
    case ErrorCode::infoKeyNotFound:
    case ErrorCode::alreadyExists:
    case ErrorCode::valueNotAllowed:
    case ErrorCode::cacheInputInvalid:
    case ErrorCode::notEntitled:
    case ErrorCode::usersDiffer:
    case ErrorCode::entitlementCountsDiffer:
    case ErrorCode::lockedAndNotRetried:
        return true;
    default:
        return false;
    }
}

} // namespace zor
