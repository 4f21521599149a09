// SPDX-License-Identifier: Apache-2.0
#include "daemon/base/ZORLocks.h"

#include "platform/BlockingScope.h"

#include <algorithm>
#include <sched.h>

namespace zor {

using platform::BlockingScope;
using platform::MutexLock;

namespace {

/// A lookup is done with the lock in a few microseconds, less than it takes to put a thread to sleep and to wake it.
/// Who does not get the lock after that many turns waits for something slower.
constexpr int yieldsMax = 16;

const char* name(LockMode mode) {
    return mode == LockMode::writing ? "writing" : "reading";
}

void sortOnce(std::vector<std::string>& identifiers) {
    std::ranges::sort(identifiers);
    identifiers.erase(std::ranges::unique(identifiers).begin(), identifiers.end());
}

} // namespace

void ZORLocks::_lock_identifier(std::vector<std::string> identifiers, LockMode mode) {
    sortOnce(identifiers);
    for (const std::string& identifier : identifiers)
        take_one_lock(identifier, mode);
}

void ZORLocks::unlock_identifier(std::vector<std::string> identifiers) {
    sortOnce(identifiers);
    for (auto identifier = identifiers.rbegin(); identifier != identifiers.rend(); ++identifier)
        unlock_one_lock(*identifier);
}

void ZORLocks::yield() {
    mutex_.unlock();
    ::sched_yield();
    mutex_.lock();
}

void ZORLocks::waitForAll(platform::ConditionVariable& condition) {
    const BlockingScope blocking;
    condition.wait(mutex_);
}

void ZORLocks::take_one_lock(std::string_view identifier, LockMode mode) {
    const std::string shown(identifier);
    Record* record = nullptr;
    {
        const MutexLock held(mutex_);
        if (mode == LockMode::writing)
            while (allReaderWriterState_ != 0)
                waitForAll(identifierWriter_);
        else
            while (allReaderWriterState_ == -1)
                waitForAll(identifierReader_);
        // The record first: it may throw for want of memory, and the counters must not know of this caller then.
        const auto found = identifierToLockMap_.find(identifier);
        if (found != identifierToLockMap_.end()) {
            record = found->second.get();
            ++record->userCount;
        } else {
            record = identifierToLockMap_.emplace(shown, std::make_unique<Record>()).first->second.get();
        }
        ++(mode == LockMode::writing ? identifierWriterCount_ : identifierReaderCount_);
    }
    // The record stays: this caller is in its user count.
    ZOR_LOG(log_, logLevelDebug, "Waiting to lock %s for %s", ZOR_SHOWN(shown), name(mode));
    if (mode == LockMode::writing) {
        if (!record->lock.try_lock()) {
            const BlockingScope blocking;
            record->lock.lock();
        }
        std::int32_t expected = 0;
        record->lockState.compare_exchange_strong(expected, -1);
    } else {
        if (!record->lock.try_lock_shared()) {
            const BlockingScope blocking;
            record->lock.lock_shared();
        }
        record->lockState.fetch_add(1);
    }
    ZOR_LOG(log_, logLevelDebug, "Got lock on identifier %s", ZOR_SHOWN(shown));
}

void ZORLocks::unlock_one_lock(std::string_view identifier) {
    // Needs no memory but for its lines: this is how a caller that found none goes.
    const MutexLock held(mutex_);
    const auto found = identifierToLockMap_.find(identifier);
    if (found == identifierToLockMap_.end() || found->second->lockState == 0) {
        log_.write(logLevelError, __func__, "Identifier %s is not locked", ZOR_SHOWN(std::string(identifier)));
        return;
    }
    Record& record = *found->second;
    if (record.lockState == -1) {
        record.lockState = 0;
        --identifierWriterCount_;
        if (identifierReaderCount_ == 0 && identifierWriterCount_ == 0)
            allWriter_.signal();
        if (identifierWriterCount_ == 0 && allReaderWriterState_ != -1)
            allReader_.broadcast();
        --record.userCount;
        record.lock.unlock();
    } else {
        record.lockState.fetch_sub(1);
        --identifierReaderCount_;
        if (everythingIsFree())
            allWriter_.signal();
        --record.userCount;
        record.lock.unlock_shared();
    }
    ZOR_LOG(log_, logLevelDebug, "Unlocked identifier %s", ZOR_SHOWN(std::string(identifier)));
    if (record.userCount == 0) {
        ZOR_LOG(log_, logLevelDebug, "Destroying lock for identifier %s", ZOR_SHOWN(std::string(identifier)));
        identifierToLockMap_.erase(found);
    }
}

void ZORLocks::_lock_all_identifiers(LockMode mode) {
    ZOR_LOG(log_, logLevelDebug, "Waiting to lock all identifiers for %s", name(mode));
    const MutexLock held(mutex_);
    if (mode == LockMode::writing) {
        for (int yielded = 0; !everythingIsFree(); ++yielded)
            if (yielded < yieldsMax)
                yield();
            else
                waitForAll(allWriter_);
        allReaderWriterState_ = -1;
    } else {
        while (identifierWriterCount_ != 0 || allReaderWriterState_ == -1)
            waitForAll(allReader_);
        ++allReaderWriterState_;
    }
    ZOR_LOG(log_, logLevelDebug, "Locked all identifiers for %s", name(mode));
}

void ZORLocks::unlock_all_identifiers() {
    {
        const MutexLock held(mutex_);
        if (allReaderWriterState_ == 0) {
            log_.write(logLevelError, __func__, "The lock of all identifiers is not held");
            return;
        }
        if (allReaderWriterState_ == -1) {
            allReaderWriterState_ = 0;
            allWriter_.signal();
            allReader_.broadcast();
            identifierWriter_.broadcast();
            identifierReader_.broadcast();
        } else {
            if (--allReaderWriterState_ == 0)
                identifierWriter_.broadcast();
            if (everythingIsFree())
                allWriter_.signal();
        }
    }
    ZOR_LOG(log_, logLevelDebug, "Unlocked all identifiers");
}

std::size_t ZORLocks::identifiersInUse() const {
    const MutexLock held(mutex_);
    return identifierToLockMap_.size();
}

} // namespace zor
