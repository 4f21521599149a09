// SPDX-License-Identifier: Apache-2.0
// The identifier locks: who waits for whom, in which order several are taken, what misuse does; a load over all modes
// in which plain variables are guarded by nothing else, for ThreadSanitizer to judge.
#include "daemon/base/ZORLocks.h"
#include "support/RecordingLog.h"

#include <array>
#include <chrono>
#include <functional>
#include <future>
#include <gtest/gtest.h>
#include <random>
#include <thread>

namespace zor {
namespace {

using namespace std::chrono_literals;

class Locks : public testing::Test {
protected:
    support::RecordingLog sink{logLevelDebug};
    Log log{sink};
    ZORLocks locks{log};

    /// Waits for a line; what was logged before it is dropped.
    void awaitLine(const std::string& message) {
        const auto end = std::chrono::steady_clock::now() + 10s;
        while (std::chrono::steady_clock::now() < end) {
            for (const auto& line : sink.take())
                if (line.message == message)
                    return;
            std::this_thread::sleep_for(1ms);
        }
        FAIL() << "no line " << message;
    }
    /// Whether the call comes to its end within what no waiting call takes.
    static bool ends(std::future<void>& call, std::chrono::milliseconds limit) {
        return call.wait_for(limit) == std::future_status::ready;
    }
    std::future<void> begin(std::function<void()> call) { return std::async(std::launch::async, std::move(call)); }
    /// Everything is free exactly when this does not wait.
    bool allIsFree() {
        auto probe = begin([this] {
            locks._lock_all_identifiers(LockMode::writing);
            locks.unlock_all_identifiers();
        });
        if (ends(probe, 10s))
            return true;
        std::abort(); // its thread could never be joined
    }
};

TEST_F(Locks, SeveralAreTakenOnceEachAscendingAndReleasedDescending) {
    locks._lock_identifier(std::vector<std::string>{"B", "A", "B"}, LockMode::writing);
    EXPECT_EQ(locks.identifiersInUse(), 2U);
    EXPECT_EQ(sink.take(), (std::vector<support::LogLine>{
                               {7, "take_one_lock", "Waiting to lock A for writing"},
                               {7, "take_one_lock", "Got lock on identifier A"},
                               {7, "take_one_lock", "Waiting to lock B for writing"},
                               {7, "take_one_lock", "Got lock on identifier B"},
                           }));
    locks.unlock_identifier(std::vector<std::string>{"B", "A", "B"});
    EXPECT_EQ(sink.take(), (std::vector<support::LogLine>{
                               {7, "unlock_one_lock", "Unlocked identifier B"},
                               {7, "unlock_one_lock", "Destroying lock for identifier B"},
                               {7, "unlock_one_lock", "Unlocked identifier A"},
                               {7, "unlock_one_lock", "Destroying lock for identifier A"},
                           }));
    EXPECT_EQ(locks.identifiersInUse(), 0U);
    locks._lock_all_identifiers(LockMode::reading);
    locks.unlock_all_identifiers();
    EXPECT_EQ(sink.take(), (std::vector<support::LogLine>{
                               {7, "_lock_all_identifiers", "Waiting to lock all identifiers for reading"},
                               {7, "_lock_all_identifiers", "Locked all identifiers for reading"},
                               {7, "unlock_all_identifiers", "Unlocked all identifiers"},
                           }));
}

// Goal: every pair of lock requests excludes or admits as it should. Method: hold the first, ask for the second in
// another thread; one that has to wait must end after the release, and not before.
TEST_F(Locks, WhoWaitsForWhom) {
    struct Request {
        const char* name;
        std::function<void(ZORLocks&)> take;
        std::function<void(ZORLocks&)> release;
    };
    const auto one = [](const char* identifier, LockMode mode) {
        return [=](ZORLocks& all) { all._lock_identifier(std::string_view(identifier), mode); };
    };
    const auto oneOut = [](const char* identifier) {
        return [=](ZORLocks& all) { all.unlock_identifier(std::string_view(identifier)); };
    };
    const auto all = [](LockMode mode) { return [=](ZORLocks& every) { every._lock_all_identifiers(mode); }; };
    const auto allOut = [](ZORLocks& every) { every.unlock_all_identifiers(); };
    const std::array<Request, 6> requests = {{
        {"A reading", one("A", LockMode::reading), oneOut("A")},
        {"A writing", one("A", LockMode::writing), oneOut("A")},
        {"B reading", one("B", LockMode::reading), oneOut("B")},
        {"B writing", one("B", LockMode::writing), oneOut("B")},
        {"all reading", all(LockMode::reading), allOut},
        {"all writing", all(LockMode::writing), allOut},
    }};
    constexpr bool waits = true;
    constexpr bool goes = false;
    const bool expected[6][6] = {
        {goes, waits, goes, goes, goes, waits},   // A is read
        {waits, waits, goes, goes, waits, waits}, // A is written
        {goes, goes, goes, waits, goes, waits},     {goes, goes, waits, waits, waits, waits},
        {goes, waits, goes, waits, goes, waits}, // all is read
        {waits, waits, waits, waits, waits, waits},
    };
    for (std::size_t held = 0; held < requests.size(); ++held)
        for (std::size_t asked = 0; asked < requests.size(); ++asked) {
            SCOPED_TRACE(std::string(requests[held].name) + " is held, " + requests[asked].name + " is asked for");
            requests[held].take(locks);
            auto second = begin([&] {
                requests[asked].take(locks);
                requests[asked].release(locks);
            });
            if (expected[held][asked]) {
                EXPECT_FALSE(ends(second, 20ms));
                requests[held].release(locks);
            } else {
                EXPECT_TRUE(ends(second, 10s));
                requests[held].release(locks);
            }
            second.wait();
            EXPECT_EQ(locks.identifiersInUse(), 0U);
            EXPECT_TRUE(allIsFree());
        }
}

// Goal: who waits for an identifier's own lock counts already, so a writer of all comes after it. Method: two waiters
// behind a reader, the writer of all last; the order in which they get through.
TEST_F(Locks, AnAdmittedIdentifierComesBeforeAWriterOfAll) {
    locks._lock_identifier("A", LockMode::reading);
    std::vector<std::string> order;
    auto pending = begin([&] {
        locks._lock_identifier("A", LockMode::writing);
        order.emplace_back("A");
        std::this_thread::sleep_for(20ms);
        locks.unlock_identifier("A");
    });
    awaitLine("Waiting to lock A for writing");
    auto all = begin([&] {
        locks._lock_all_identifiers(LockMode::writing);
        order.emplace_back("all");
        locks.unlock_all_identifiers();
    });
    awaitLine("Waiting to lock all identifiers for writing");
    EXPECT_EQ(locks.identifiersInUse(), 1U);
    locks.unlock_identifier("A");
    pending.wait();
    all.wait();
    EXPECT_EQ(order, (std::vector<std::string>{"A", "all"}));
    EXPECT_EQ(locks.identifiersInUse(), 0U);
}

// Goal: misuse is said and leaves every counter as it was. Method: after it the locks still exclude and still become
// free.
TEST_F(Locks, MisuseChangesNothing) {
    locks.unlock_identifier("A");
    locks.unlock_all_identifiers();
    EXPECT_EQ(sink.take(), (std::vector<support::LogLine>{
                               {3, "unlock_one_lock", "Identifier A is not locked"},
                               {3, "unlock_all_identifiers", "The lock of all identifiers is not held"},
                           }));
    locks._lock_identifier("A", LockMode::writing);
    locks.unlock_identifier("B");
    auto second = begin([&] {
        locks._lock_all_identifiers(LockMode::reading);
        locks.unlock_all_identifiers();
    });
    EXPECT_FALSE(ends(second, 20ms));
    locks.unlock_identifier("A");
    second.wait();
    locks.unlock_identifier("A");
    EXPECT_TRUE(allIsFree());
    EXPECT_EQ(locks.identifiersInUse(), 0U);
}

TEST_F(Locks, AScopeReleasesOnce) {
    {
        AllIdentifiersLock scope(locks, LockMode::writing);
        scope.unlock();
        EXPECT_TRUE(allIsFree());
    }
    EXPECT_TRUE(allIsFree());
    EXPECT_TRUE(sink.take(3, "unlock_all_identifiers").empty());
}

// Goal: exclusion holds under load, nothing deadlocks, no signal is lost. Method: pairs of plain numbers that every
// holder changes or compares.
TEST_F(Locks, LoadOverEveryMode) {
    constexpr int threadCount = 6;
    constexpr int rounds = 1500;
    const std::array<std::string, 4> names = {"A", "B", "C", "D"};
    struct Pair {
        long first = 0;
        long second = 0;
    };
    std::array<Pair, 4> guarded;
    std::atomic<long> broken{0};
    sink.setLevel(logLevelNotice);
    std::vector<std::thread> threads;
    for (int t = 0; t < threadCount; ++t)
        threads.emplace_back([&, t] {
            std::mt19937 random(static_cast<unsigned>(t));
            const auto change = [&](std::size_t i) {
                ++guarded[i].first;
                ++guarded[i].second;
            };
            const auto compare = [&](std::size_t i) { broken += guarded[i].first != guarded[i].second ? 1 : 0; };
            for (int round = 0; round < rounds; ++round) {
                const std::size_t i = random() % 4;
                const std::size_t j = random() % 4;
                switch (random() % 6) {
                case 0:
                    locks._lock_identifier(names[i], LockMode::writing);
                    change(i);
                    locks.unlock_identifier(names[i]);
                    break;
                case 1:
                case 2:
                    locks._lock_identifier(names[i], LockMode::reading);
                    compare(i);
                    locks.unlock_identifier(names[i]);
                    break;
                case 3:
                    locks._lock_identifier(std::vector<std::string>{names[i], names[j]}, LockMode::writing);
                    change(i);
                    change(j);
                    locks.unlock_identifier(std::vector<std::string>{names[i], names[j]});
                    break;
                case 4: {
                    const AllIdentifiersLock all(locks, LockMode::reading);
                    for (std::size_t k = 0; k < 4; ++k)
                        compare(k);
                    break;
                }
                default: {
                    const AllIdentifiersLock all(locks, LockMode::writing);
                    for (std::size_t k = 0; k < 4; ++k)
                        change(k);
                }
                }
            }
        });
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_EQ(broken, 0);
    EXPECT_EQ(locks.identifiersInUse(), 0U);
    EXPECT_TRUE(allIsFree());
    EXPECT_TRUE(sink.take().empty());
}

} // namespace
} // namespace zor
