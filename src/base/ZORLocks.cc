// SPDX-License-Identifier: Apache-2.0
#include "base/ZORLocks.h"

#include "base/Mutex.h"
#include "platform/Errno.h"

#include <algorithm>
#include <bit>
#include <sched.h>

namespace zor {

using platform::BlockingScope;
using platform::MutexLock;

namespace {

/// A lookup is done with the lock in a few microseconds, less than it takes to put a thread to sleep and to wake it.
/// A thread that does not get the lock after that many turns waits for something slower.
constexpr int yieldsMax = 16;

const char* name(LockMode mode) {
    return mode == LockMode::writing ? "writing" : "reading";
}

constexpr const char* takeFunction = "take_one_lock";

/// How much of an identifier a line shows. Lines are written where nothing may throw, so none is copied for them.
int shownBytes(std::string_view identifier) {
    return static_cast<int>(std::min(identifier.size(), shownBytesMax));
}

void sortOnce(std::vector<std::string>& identifiers) {
    std::ranges::sort(identifiers);
    identifiers.erase(std::ranges::unique(identifiers).begin(), identifiers.end());
}

} // namespace

Touches Touches::only(std::initializer_list<std::string_view> identifiers) {
    std::uint64_t groups = 0;
    for (const std::string_view identifier : identifiers)
        groups |= std::uint64_t{1} << identifierGroupOf(identifier);
    return {false, groups};
}

void ZORLocks::_lock_identifier(std::vector<std::string> identifiers, LockMode mode) {
    sortOnce(identifiers);
    std::size_t taken = 0;
    try {
        for (; taken < identifiers.size(); ++taken)
            take_one_lock(identifiers[taken], mode);
    } catch (...) {
        while (taken > 0)
            unlock_one_lock(identifiers[--taken]);
        throw;
    }
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

void ZORLocks::begin(Touches touches) noexcept {
    if (touches.all_)
        ++anythingTouched_.begun;
    for (std::uint64_t groups = touches.groups_; groups != 0; groups &= groups - 1)
        ++groupTouched_[static_cast<std::size_t>(std::countr_zero(groups))].begun;
}

void ZORLocks::end(Touches touches) noexcept {
    for (std::uint64_t groups = touches.groups_; groups != 0; groups &= groups - 1)
        ++groupTouched_[static_cast<std::size_t>(std::countr_zero(groups))].ended;
    if (touches.all_)
        ++anythingTouched_.ended;
}

void ZORLocks::take_one_lock(std::string_view identifier, LockMode mode, Touches touches) {
    acquire(admit(identifier, mode), identifier, mode, touches);
}

ZORLocks::Record& ZORLocks::admit(std::string_view identifier, LockMode mode) {
    const MutexLock held(mutex_);
    if (mode == LockMode::writing)
        while (allReaderWriterState_ != 0)
            waitForAll(identifierWriter_);
    else
        while (allReaderWriterState_ == -1)
            waitForAll(identifierReader_);
    // The record first: it may throw, and the counters must not know of this caller then.
    auto found = identifierToLockMap_.find(identifier);
    if (found != identifierToLockMap_.end())
        ++found->second->userCount;
    else
        found = identifierToLockMap_.emplace(identifier, std::make_unique<Record>()).first;
    ++(mode == LockMode::writing ? identifierWriterCount_ : identifierReaderCount_);
    return *found->second;
}

void ZORLocks::acquire(Record& record, std::string_view identifier, LockMode mode, Touches touches) noexcept {
    if (log_.writes(logLevelDebug))
        log_.write(logLevelDebug, takeFunction, "Waiting to lock %.*s for %s", shownBytes(identifier),
                   identifier.data(), name(mode));
    if (mode == LockMode::writing) {
        if (!record.lock.try_lock()) {
            const BlockingScope blocking;
            record.lock.lock();
        }
        std::int32_t expected = 0;
        const bool wasFree = record.lockState.compare_exchange_strong(expected, -1);
        ZOR_ASSERT(wasFree);
        record.touches = touches;
        begin(touches);
    } else {
        if (!record.lock.try_lock_shared()) {
            const BlockingScope blocking;
            record.lock.lock_shared();
        }
        const std::int32_t readers = record.lockState.fetch_add(1);
        ZOR_ASSERT(readers >= 0);
    }
    if (log_.writes(logLevelDebug))
        log_.write(logLevelDebug, takeFunction, "Got lock on identifier %.*s", shownBytes(identifier),
                   identifier.data());
}

void ZORLocks::unlock_one_lock(std::string_view identifier) noexcept {
    const MutexLock held(mutex_);
    const auto found = identifierToLockMap_.find(identifier);
    if (found == identifierToLockMap_.end() || found->second->lockState == 0) {
        log_.write(logLevelError, __func__, "Identifier %.*s is not locked", shownBytes(identifier), identifier.data());
        return;
    }
    Record& record = *found->second;
    ZOR_ASSERT(record.userCount > 0);
    if (record.lockState == -1) {
        ZOR_ASSERT(identifierWriterCount_ > 0);
        record.lockState = 0;
        --identifierWriterCount_;
        end(record.touches);
        if (identifierReaderCount_ == 0 && identifierWriterCount_ == 0)
            allWriter_.signal();
        if (identifierWriterCount_ == 0 && allReaderWriterState_ != -1)
            allReader_.broadcast();
        --record.userCount;
        record.lock.unlock();
    } else {
        ZOR_ASSERT(identifierReaderCount_ > 0);
        record.lockState.fetch_sub(1);
        --identifierReaderCount_;
        if (everythingIsFree())
            allWriter_.signal();
        --record.userCount;
        record.lock.unlock_shared();
    }
    ZOR_LOG(log_, logLevelDebug, "Unlocked identifier %.*s", shownBytes(identifier), identifier.data());
    if (record.userCount == 0) {
        ZOR_LOG(log_, logLevelDebug, "Destroying lock for identifier %.*s", shownBytes(identifier), identifier.data());
        identifierToLockMap_.erase(found);
    }
}

void ZORLocks::_lock_all_identifiers(LockMode mode, Touches touches) noexcept {
    ZOR_LOG(log_, logLevelDebug, "Waiting to lock all identifiers for %s", name(mode));
    const MutexLock held(mutex_);
    if (mode == LockMode::writing) {
        for (int yielded = 0; !everythingIsFree(); ++yielded)
            if (yielded < yieldsMax)
                yield();
            else
                waitForAll(allWriter_);
        allReaderWriterState_ = -1;
        touchedByHolder_ = touches;
        begin(touches);
    } else {
        while (identifierWriterCount_ != 0 || allReaderWriterState_ == -1)
            waitForAll(allReader_);
        ++allReaderWriterState_;
    }
    ZOR_LOG(log_, logLevelDebug, "Locked all identifiers for %s", name(mode));
}

void ZORLocks::unlock_all_identifiers() noexcept {
    {
        const MutexLock held(mutex_);
        if (allReaderWriterState_ == 0) {
            log_.write(logLevelError, __func__, "The lock of all identifiers is not held");
            return;
        }
        if (allReaderWriterState_ == -1) {
            allReaderWriterState_ = 0;
            end(touchedByHolder_);
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

void ZORLocks::touch(Touches touches) noexcept {
    const MutexLock held(mutex_);
    ZOR_ASSERT(allReaderWriterState_ == -1);
    const Touches more(touches.all_ && !touchedByHolder_.all_, touches.groups_ & ~touchedByHolder_.groups_);
    begin(more);
    touchedByHolder_ = {touchedByHolder_.all_ || more.all_, touchedByHolder_.groups_ | more.groups_};
}

std::optional<std::uint64_t> ZORLocks::quietGeneration(std::string_view identifier) const noexcept {
    const Count& group = groupTouched_[identifierGroupOf(identifier)];
    // In this order: all only grow and no more end than begin, so when the second look finds no more than had ended
    // before it, there was nobody at that moment, of either kind.
    const std::uint64_t ended = anythingTouched_.ended + group.ended;
    const std::uint64_t begun = anythingTouched_.begun + group.begun;
    return begun == ended ? std::optional(begun) : std::nullopt;
}

std::size_t ZORLocks::identifiersInUse() const {
    const MutexLock held(mutex_);
    return identifierToLockMap_.size();
}

bool ZORLocks::allAreHeldForWriting() const {
    const MutexLock held(mutex_);
    return allReaderWriterState_ == -1;
}

} // namespace zor
