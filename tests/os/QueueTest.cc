// SPDX-License-Identifier: Apache-2.0
#include "os/RunLoop.h"
#include "os/SerialWorkQueue.h"
#include "support/Waiting.h"

#include <algorithm>
#include <atomic>
#include <gtest/gtest.h>
#include <sys/eventfd.h>

namespace zor::platform {
namespace {

using support::eventually;
using support::inThreads;

// Jobs run one at a time, in order, whichever thread queues them.
TEST(SerialWorkQueue, RunsOneAtATimeInOrder) {
    std::atomic<int> inside{0};
    std::vector<std::vector<int>> seen(4);
    {
        SerialWorkQueue queue("com.veltra.test");
        ASSERT_TRUE(queue.start());
        inThreads(4, [&](unsigned thread) {
            for (int i = 0; i < 500; ++i)
                queue.async([&, thread, i] {
                    EXPECT_EQ(inside.fetch_add(1), 0);
                    seen[thread].push_back(i);
                    inside.fetch_sub(1);
                });
        });
    }
    for (const auto& ofThread : seen) {
        ASSERT_EQ(ofThread.size(), 500U);
        EXPECT_TRUE(std::ranges::is_sorted(ofThread));
    }
}

// No job begins after suspend has returned (the one that was running may still end), and all that wait run after
// resume.
TEST(SerialWorkQueue, BeginsNothingWhileSuspended) {
    std::atomic<int> ran{0};
    SerialWorkQueue queue("com.veltra.test");
    ASSERT_TRUE(queue.start());
    for (int round = 1; round <= 100; ++round) {
        for (int i = 0; i < 5; ++i)
            queue.async([&] { ++ran; });
        queue.suspend();
        const int before = ran.load();
        std::this_thread::sleep_for(std::chrono::microseconds(200));
        const int after = ran.load();
        EXPECT_LE(after, before + 1);
        queue.async([&] { ++ran; });
        std::this_thread::sleep_for(std::chrono::microseconds(200));
        EXPECT_EQ(ran.load(), after);
        queue.resume();
        ASSERT_TRUE(eventually([&] { return ran.load() == round * 6; }));
    }
}

// A callback that unwatches another one whose event is already fetched prevents it; a descriptor number that is used
// again is not mistaken for the old one.
TEST(RunLoop, CallsOnlyWhatIsStillWatched) {
    RunLoop loop;
    FileDescriptor first(::eventfd(1, EFD_CLOEXEC | EFD_NONBLOCK));
    FileDescriptor second(::eventfd(1, EFD_CLOEXEC | EFD_NONBLOCK));
    std::vector<std::string> calls;
    const auto onlyOnce = [&](const char* name, FileDescriptor& other) {
        return [&, name] {
            calls.emplace_back(name);
            loop.unwatch(other.get());
            other.reset();
            other.reset(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
            EXPECT_TRUE(loop.watch(other.get(), [&] { calls.emplace_back("wrong"); }));
            loop.post([&] { loop.stop(); });
        };
    };
    ASSERT_TRUE(loop.watch(first.get(), onlyOnce("first", second)));
    ASSERT_TRUE(loop.watch(second.get(), onlyOnce("second", first)));
    loop.run();
    ASSERT_EQ(calls.size(), 1U);
    EXPECT_TRUE(calls.front() == "first" || calls.front() == "second");
    EXPECT_FALSE(loop.watch(-1, [] {}));
}

} // namespace
} // namespace zor::platform
