// SPDX-License-Identifier: Apache-2.0
// The identifier locks: who waits for whom, in which order several are taken, what misuse does; a load over all modes
// in which plain variables are guarded by nothing else, for ThreadSanitizer to judge.
#include "base/ZORLocks.h"
#include "support/Allocations.h"
#include "support/RecordingLog.h"
#include "support/Waiting.h"

#include <future>
#include <gtest/gtest.h>
#include <random>

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
        EXPECT_TRUE(support::eventually([&] {
            return std::ranges::any_of(sink.take(), [&](const auto& line) { return line.message == message; });
        })) << message;
    }
    /// Whether the call comes to its end within what no waiting call takes.
    static bool ends(std::future<void>& call, std::chrono::milliseconds limit) {
        return call.wait_for(limit) == std::future_status::ready;
    }
    static std::future<void> begin(std::function<void()> call) {
        return std::async(std::launch::async, std::move(call));
    }
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

// Every pair of lock requests excludes or admits as it should: the first is held, the second asked for in another
// thread; one that has to wait ends after the release, and not before.
TEST_F(Locks, WhoWaitsForWhom) {
    struct Request {
        const char* name;
        const char* identifier; // nullptr: all
        LockMode mode;
    };
    const Request requests[] = {
        {"A reading", "A", LockMode::reading},       {"A writing", "A", LockMode::writing},
        {"B reading", "B", LockMode::reading},       {"B writing", "B", LockMode::writing},
        {"all reading", nullptr, LockMode::reading}, {"all writing", nullptr, LockMode::writing},
    };
    const auto take = [&](const Request& request) {
        request.identifier ? locks._lock_identifier(std::string_view(request.identifier), request.mode)
                           : locks._lock_all_identifiers(request.mode);
    };
    const auto release = [&](const Request& request) {
        request.identifier ? locks.unlock_identifier(std::string_view(request.identifier))
                           : locks.unlock_all_identifiers();
    };
    // In the order of the requests: the second one waits or goes.
    const char* const expected[] = {"gwgggw", "wwggww", "gggwgw", "ggwwww", "gwgwgw", "wwwwww"};
    for (std::size_t held = 0; held < 6; ++held)
        for (std::size_t asked = 0; asked < 6; ++asked) {
            SCOPED_TRACE(std::string(requests[held].name) + " is held, " + requests[asked].name + " is asked for");
            take(requests[held]);
            auto second = begin([&] {
                take(requests[asked]);
                release(requests[asked]);
            });
            const bool waited = expected[held][asked] == 'w';
            EXPECT_EQ(ends(second, waited ? 20ms : 10s), !waited);
            release(requests[held]);
            second.wait();
            EXPECT_EQ(locks.identifiersInUse(), 0U);
            EXPECT_TRUE(allIsFree());
        }
}

// A thread that waits for an identifier's own lock counts already, so a writer of all comes after it.
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

// A lock that could not be taken for want of memory is free, and one that was taken becomes free, whatever allocation
// of the way fails, those of the traces included: each one in turn.
TEST_F(Locks, AFailedAllocationLeavesNothingLocked) {
    if (!support::allocationsCanFail())
        GTEST_SKIP() << "the sanitizer's allocations do not fail";
    const std::string names[] = {std::string(40, 'A'), std::string(40, 'B')};
    const std::function<void()> uses[] = {
        [&] { const IdentifierLock one(locks, names[0], LockMode::writing); },
        [&] { const IdentifierLock one(locks, names[0], LockMode::reading); },
        [&] { const AllIdentifiersLock all(locks, LockMode::writing); },
        [&] {
            std::vector<std::string> taken(names, names + 2);
            auto released = taken;
            locks._lock_identifier(std::move(taken), LockMode::writing);
            locks.unlock_identifier(std::move(released));
        },
    };
    for (const auto& use : uses)
        for (std::size_t failing = 0;; ++failing) {
            bool failed = false;
            {
                const support::FailingAllocations allocations(failing);
                try {
                    use();
                } catch (const std::bad_alloc&) {
                }
                failed = support::FailingAllocations::anyFailed();
            }
            EXPECT_EQ(locks.identifiersInUse(), 0U) << failing;
            EXPECT_TRUE(allIsFree());
            if (!failed)
                break;
        }
    EXPECT_GT(log.linesLost(), 0U);
}

// Exclusion holds under load, nothing deadlocks, no signal is lost, and who reads without a lock finds out about every
// writer: pairs of numbers that every holder changes or compares.
TEST_F(Locks, LoadOverEveryMode) {
    const std::string names[] = {"A", "B", "C", "D"};
    struct Pair {
        std::atomic<long> first{0};
        std::atomic<long> second{0};
    };
    Pair guarded[4];
    std::atomic<long> broken{0};
    std::atomic<long> undisturbed{0};
    sink.setLevel(logLevelNotice);
    support::inThreads(6, [&](unsigned seed) {
        std::mt19937 random(seed);
        const auto use = [&](std::size_t i, LockMode mode) {
            if (mode == LockMode::reading) {
                broken += guarded[i].first != guarded[i].second ? 1 : 0;
            } else {
                ++guarded[i].first;
                ++guarded[i].second;
            }
        };
        for (int round = 0; round < 1500; ++round) {
            const LockMode mode = random() % 2 == 0 ? LockMode::reading : LockMode::writing;
            const std::size_t i = random() % 4;
            const std::size_t j = random() % 4;
            const unsigned kind = random() % 4;
            if (kind == 0) {
                const IdentifierLock one(locks, names[i], mode, Touches::only({names[i]}));
                use(i, mode);
            } else if (kind == 1) {
                locks._lock_identifier(std::vector{names[i], names[j]}, mode);
                use(i, mode);
                use(j, mode);
                locks.unlock_identifier(std::vector{names[i], names[j]});
            } else if (kind == 2) {
                const auto before = locks.quietGeneration(names[i]);
                const bool same = guarded[i].first == guarded[i].second;
                const bool quiet = before && locks.quietGeneration(names[i]) == before;
                broken += quiet && !same ? 1 : 0;
                undisturbed += quiet ? 1 : 0;
            } else if (mode == LockMode::writing && j > 1) {
                const AllIdentifiersWriteLock all(locks, Touches::nothing());
                for (const std::size_t k : {i, j}) {
                    all.touch(Touches::only({names[k]}));
                    use(k, mode);
                }
            } else {
                const AllIdentifiersLock all(locks, mode);
                for (std::size_t k = 0; k < 4; ++k)
                    use(k, mode);
            }
        }
    });
    EXPECT_EQ(broken, 0);
    EXPECT_GT(undisturbed, 0);
    for (const std::string& name : names)
        EXPECT_TRUE(locks.quietGeneration(name));
    EXPECT_EQ(locks.identifiersInUse(), 0U);
    EXPECT_TRUE(allIsFree());
    EXPECT_TRUE(sink.take().empty());
}

} // namespace
} // namespace zor
