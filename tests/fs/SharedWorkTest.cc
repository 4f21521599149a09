// SPDX-License-Identifier: Apache-2.0
#include "fs/SharedWork.h"
#include "fs/TreeWorld.h"
#include "support/Sanitized.h"

#include <algorithm>
#include <atomic>
#include <mutex>
#include <sys/resource.h>
#include <sys/wait.h>
#include <thread>

namespace zor::fs::test {
namespace {

// Goal: everything is done once, what waits is given more threads and what does not at most one more, an exception
// comes out, and without memory for a thread one does it all. Method: work that notes its thread, in processes of their
// own.
TEST(SharedWork, HasThreadsWhereTheyPay) {
    enum class Work { quick, waits, throws, hasNoMemory };
    constexpr std::size_t count = 2000;
    const auto isAsExpected = [](Work work) {
        if (work == Work::hasNoMemory) {
            // The stacks of earlier tests' threads are kept for the next ones: these have them.
            for (int i = 0; i < 16; ++i)
                std::thread(::pause).detach();
            unsigned long pages = 0;
            std::sscanf(support::readFile("/proc/self/statm").c_str(), "%lu", &pages);
            const rlim_t bytes = pages * static_cast<rlim_t>(::sysconf(_SC_PAGESIZE)) + 1024 * 1024;
            const rlimit limit{.rlim_cur = bytes, .rlim_max = bytes};
            ::setrlimit(RLIMIT_AS, &limit);
        }
        std::mutex mutex;
        std::set<std::thread::id> threads;
        std::vector<int> done(count);
        bool thrown = false;
        try {
            forEachStretch(count, [&](std::size_t begin, std::size_t end) {
                for (std::size_t i = begin; i < end; ++i) {
                    ++done[i];
                    if (work == Work::waits)
                        ::usleep(100);
                }
                const std::lock_guard lock(mutex);
                threads.insert(std::this_thread::get_id());
                if (work == Work::throws)
                    throw std::runtime_error("expected");
            });
        } catch (const std::runtime_error&) {
            thrown = true;
        }
        const std::size_t most = work == Work::waits ? 16 : work == Work::hasNoMemory ? 1 : 2;
        const bool all = std::ranges::count(done, 1) == static_cast<std::ptrdiff_t>(count);
        return thrown == (work == Work::throws) && threads.size() <= most &&
               (work != Work::waits || threads.size() > 4) && (all || work == Work::throws);
    };
    for (const Work work : {Work::quick, Work::waits, Work::throws, Work::hasNoMemory}) {
        if (work == Work::hasNoMemory && support::isSanitized)
            continue; // a sanitizer ends the process where it has none
        const pid_t child = ::fork();
        if (child == 0)
            ::_exit(isAsExpected(work) ? 0 : 1);
        int status = -1;
        ::waitpid(child, &status, 0);
        EXPECT_EQ(status, 0) << static_cast<int>(work);
    }
}

// Goal: of things that are handed on each is done once and on two threads, all of them at a settlement, and what either
// thread throws comes out. Method: a table of who throws.
TEST(SharedWork, HandsOnWhatIsFound) {
    enum class Throws { nobody, finder, helper };
    constexpr int count = 2000;
    for (const Throws throws : {Throws::nobody, Throws::finder, Throws::helper}) {
        SCOPED_TRACE(static_cast<int>(throws));
        std::atomic<int> done = 0;
        std::atomic<bool> helped = false;
        const auto work = [&, finder = std::this_thread::get_id()](const int&) {
            const bool isFinder = std::this_thread::get_id() == finder;
            helped = helped || !isFinder;
            if (throws == (isFinder ? Throws::finder : Throws::helper))
                throw std::runtime_error("expected");
            ++done;
            ::usleep(50);
        };
        bool thrown = false;
        try {
            HandedOn<int> things(work);
            for (int i = 0; i < count; ++i) {
                things.add(i);
                if (i % 100 != 99)
                    continue;
                things.settle();
                EXPECT_EQ(done, i + 1);
            }
            things.finish();
        } catch (const std::runtime_error&) {
            thrown = true;
        }
        EXPECT_EQ(thrown, throws != Throws::nobody);
        EXPECT_TRUE(helped || throws == Throws::finder);
        EXPECT_TRUE(done == count || thrown);
    }
}

} // namespace
} // namespace zor::fs::test
