// SPDX-License-Identifier: Apache-2.0
// Locks by container identifier, and the one lock over all of them.
//
// Each identifier in use has a reader/writer lock, made by its first user and destroyed by its last. The
// all-identifiers lock excludes, in write mode, every identifier lock; in read mode, every identifier writer.
// Operations on one known container lock its UUID string; operations that may touch any identifier take the
// all-identifiers lock.
//
// One mutex guards the bookkeeping and is never held while a caller waits for an identifier's own lock. A caller counts
// before it waits there, so a pending identifier lock already keeps an all-identifiers writer out. Several identifiers
// are locked in ascending order of their strings; that is the lock order of the daemon, so overlapping sets cannot
// deadlock. Nothing here times out.
//
// Taking an identifier's lock may throw for want of memory, and changes nothing then: from the count of a caller on
// nothing throws, and nothing does that gives a lock back. So a lock that is counted has an owner who gives it back.
//
// A mere reader of one identifier's container may do without a lock and find out afterwards whether anybody touched it
// meanwhile: each writer is counted, before its first step, among those who touch an identifier, and once more when it
// has let go. A holder that says nothing touches all; it says less only where it knows whose containers it changes.
//
// Misuse (unlocking what is not locked) is said at level 3 and changes nothing.
#pragma once

#include "base/Log.h"
#include "base/Mutex.h"

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <initializer_list>
#include <map>
#include <memory>
#include <optional>
#include <shared_mutex>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace zor {

enum class LockMode { reading, writing };

/// Identifiers are counted in groups by their hash: a writer disturbs in vain the readers of one in so many others.
inline constexpr std::size_t identifierGroupCount = 64;
inline std::size_t identifierGroupOf(std::string_view identifier) {
    return std::hash<std::string_view>()(identifier) % identifierGroupCount;
}

/// The identifiers of whose containers a writer may change what a lookup reads: whether one is there, where, and which
/// it is. Info values are nothing of that.
class Touches {
public:
    static Touches anything() { return Touches(true, 0); }
    static Touches nothing() { return Touches(false, 0); }
    static Touches only(std::initializer_list<std::string_view> identifiers);

private:
    friend class ZORLocks;
    Touches(bool all, std::uint64_t groups) : all_(all), groups_(groups) {}

    bool all_;
    std::uint64_t groups_; // one bit for each
};

class ZORLocks {
public:
    explicit ZORLocks(const Log& log) : log_(log) {}
    ZORLocks(const ZORLocks&) = delete;
    ZORLocks& operator=(const ZORLocks&) = delete;

    void _lock_identifier(std::string_view identifier, LockMode mode, Touches touches = Touches::anything()) {
        take_one_lock(identifier, mode, touches);
    }
    void unlock_identifier(std::string_view identifier) noexcept { unlock_one_lock(identifier); }
    /// Each distinct identifier once, in ascending order.
    void _lock_identifier(std::vector<std::string> identifiers, LockMode mode);
    /// The same set as was locked, in descending order.
    void unlock_identifier(std::vector<std::string> identifiers);

    void _lock_all_identifiers(LockMode mode, Touches touches = Touches::anything()) noexcept ZOR_EXCLUDES(mutex_);
    void unlock_all_identifiers() noexcept ZOR_EXCLUDES(mutex_);
    /// Counts the holder of the all-identifiers lock for writing among those who touch these, too, until it lets go.
    void touch(Touches touches) noexcept ZOR_EXCLUDES(mutex_);

    void take_one_lock(std::string_view identifier, LockMode mode, Touches touches = Touches::anything())
        ZOR_EXCLUDES(mutex_);
    void unlock_one_lock(std::string_view identifier) noexcept ZOR_EXCLUDES(mutex_);

    /// A number that changes with every writer that touches `identifier`; nullopt while one does. The same number
    /// before and after a read means that nobody touched the identifier in between. Four atomic reads.
    [[nodiscard]] std::optional<std::uint64_t> quietGeneration(std::string_view identifier) const noexcept;

    /// How many identifiers are locked or awaited, for tests and the status.
    [[nodiscard]] std::size_t identifiersInUse() const ZOR_EXCLUDES(mutex_);
    /// Whether somebody holds the all-identifiers lock for writing, for tests.
    [[nodiscard]] bool allAreHeldForWriting() const ZOR_EXCLUDES(mutex_);

private:
    struct Record {
        std::shared_mutex lock;
        std::uint64_t userCount = 1;            // guarded by mutex_
        std::atomic<std::int32_t> lockState{0}; // 0 free, -1 write-held, n > 0 held by n readers
        Touches touches = Touches::nothing();   // the writer's, which alone uses it
    };
    /// Writers that touch something: how many have begun, and how many of them have let go. Both only grow.
    struct Count {
        std::atomic<std::uint64_t> begun{0};
        std::atomic<std::uint64_t> ended{0};
    };

    [[nodiscard]] bool noIdentifierIsLocked() const ZOR_REQUIRES(mutex_) {
        return identifierReaderCount_ == 0 && identifierWriterCount_ == 0;
    }
    [[nodiscard]] bool everythingIsFree() const ZOR_REQUIRES(mutex_) {
        return allReaderWriterState_ == 0 && noIdentifierIsLocked();
    }
    /// Counts a caller in, which from then on keeps the record and whoever wants all identifiers out. Throws
    /// std::bad_alloc, and has counted nobody then.
    Record& admit(std::string_view identifier, LockMode mode) ZOR_EXCLUDES(mutex_);
    /// Waits for the own lock of an identifier whose caller is counted.
    void acquire(Record& record, std::string_view identifier, LockMode mode, Touches touches) noexcept;
    void begin(Touches touches) noexcept;
    void end(Touches touches) noexcept;
    /// Lets others run, without the mutex.
    void yield() ZOR_REQUIRES(mutex_);
    void waitForAll(platform::ConditionVariable& condition) ZOR_REQUIRES(mutex_);

    const Log& log_;
    Count anythingTouched_;
    std::array<Count, identifierGroupCount> groupTouched_;
    mutable platform::Mutex mutex_;
    platform::ConditionVariable allWriter_;
    platform::ConditionVariable allReader_;
    platform::ConditionVariable identifierWriter_;
    platform::ConditionVariable identifierReader_;
    std::map<std::string, std::unique_ptr<Record>, std::less<>> identifierToLockMap_ ZOR_GUARDED_BY(mutex_);
    std::uint32_t identifierReaderCount_ ZOR_GUARDED_BY(mutex_) = 0; // held or being acquired
    std::uint32_t identifierWriterCount_ ZOR_GUARDED_BY(mutex_) = 0; // held or being acquired
    std::int32_t allReaderWriterState_ ZOR_GUARDED_BY(mutex_) = 0;   // 0 free, -1 write-held, n > 0 n readers
    /// The holder's for writing.
    Touches touchedByHolder_ ZOR_GUARDED_BY(mutex_) = Touches::nothing();
};

/// Holds the lock of one identifier for as long as it lives.
class IdentifierLock {
public:
    IdentifierLock(ZORLocks& locks, std::string identifier, LockMode mode, Touches touches = Touches::anything())
        : locks_(locks), identifier_(std::move(identifier)) {
        locks_._lock_identifier(identifier_, mode, touches);
    }
    IdentifierLock(const IdentifierLock&) = delete;
    IdentifierLock& operator=(const IdentifierLock&) = delete;
    ~IdentifierLock() { locks_.unlock_identifier(identifier_); }

    [[nodiscard]] const std::string& identifier() const { return identifier_; }

private:
    ZORLocks& locks_;
    const std::string identifier_;
};

/// The same for writing. A function that needs that lock held takes a reference to one: the proof that somebody holds
/// it.
class IdentifierWriteLock final : public IdentifierLock {
public:
    IdentifierWriteLock(ZORLocks& locks, std::string identifier, Touches touches = Touches::anything())
        : IdentifierLock(locks, std::move(identifier), LockMode::writing, touches) {}
};

/// Holds the all-identifiers lock for as long as it lives.
class AllIdentifiersLock {
public:
    AllIdentifiersLock(ZORLocks& locks, LockMode mode, Touches touches = Touches::anything()) : locks_(locks) {
        locks._lock_all_identifiers(mode, touches);
    }
    AllIdentifiersLock(const AllIdentifiersLock&) = delete;
    AllIdentifiersLock& operator=(const AllIdentifiersLock&) = delete;
    ~AllIdentifiersLock() { locks_.unlock_all_identifiers(); }

protected:
    ZORLocks& locks_;
};

/// The same for writing, and the proof of it. Its holder may wait for a file system, so the pool of threads lets
/// another one run meanwhile.
class AllIdentifiersWriteLock final : public AllIdentifiersLock {
public:
    explicit AllIdentifiersWriteLock(ZORLocks& locks, Touches touches = Touches::anything())
        : AllIdentifiersLock(locks, LockMode::writing, touches) {}

    /// Adds these identifiers to those touched, before the first step that changes them: lookups of them wait from then
    /// on.
    void touch(Touches touches) const noexcept { locks_.touch(touches); }

private:
    const platform::BlockingScope blocking_;
};

} // namespace zor
