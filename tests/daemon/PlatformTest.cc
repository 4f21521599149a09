// SPDX-License-Identifier: Apache-2.0
#include "daemon/LinuxPlatform.h"
#include "daemon/RefusalLimiter.h"
#include "support/ProcessResources.h"
#include "support/TestRoot.h"
#include "support/Waiting.h"

#include <atomic>
#include <gtest/gtest.h>

namespace zor::platform {
namespace {

using support::TestRoot;

// One daemon a root, several roots a process, and everything given back at the end, twice.
TEST(LinuxPlatform, OwnsOneRootAtATime) {
    const TestRoot first;
    const TestRoot second;
    // The C library and the loop make some things once.
    ASSERT_TRUE(LinuxPlatform::open({.rootDirectory = first.path()}));
    const std::string canonical = first.root().canonicalPath();
    const support::ProcessResources before;
    for (int round = 0; round < 2; ++round) {
        auto opened = LinuxPlatform::open({.rootDirectory = first.path()});
        ASSERT_TRUE(opened) << opened.error();
        const auto again = LinuxPlatform::open({.rootDirectory = first.path("run/..")});
        ASSERT_FALSE(again);
        EXPECT_EQ(again.error(), "another daemon serves the root " + canonical);
        const auto other = LinuxPlatform::open({.rootDirectory = second.path()});
        ASSERT_TRUE(other) << other.error();
        LinuxPlatform& platform = **opened;
        const Platform roles = platform.roles();
        EXPECT_EQ(roles.root.canonicalPath(), canonical);
        EXPECT_TRUE(roles.listener.resume([](PeerConnection&, ServiceEvent&) {}));
        EXPECT_FALSE(roles.upcallPort.checkIn());
        EXPECT_TRUE(
            roles.upcallPort.serve(roles.runLoop, [](const UpcallPacket&) { return std::vector<std::uint8_t>(); }));
        EXPECT_FALSE(roles.lockState.registerForChanges(roles.runLoop, [] {}));
        std::atomic<int> ran{0};
        EXPECT_TRUE(roles.deathRowQueue.start() && roles.lockStateQueue.start());
        roles.deathRowQueue.async([&] { ++ran; });
        roles.lockStateQueue.suspend();
        roles.lockStateQueue.async([&, mark = roles.transactions.hold()] { ++ran; });
        platform.finish();
        EXPECT_EQ(ran, 1) << "what waits for an unlock is dropped";
        EXPECT_EQ(roles.transactions.count(), 0U) << "and so is its busy mark";
    }
    EXPECT_EQ(before.leakedSince(), "");
    EXPECT_FALSE(LinuxPlatform::open({.rootDirectory = first.path("absent")}));
}

constexpr std::size_t shortLine = 100;

// Each user has so many lines a second and bytes a minute, strangers together; what is left out is told exactly once,
// when that time is over though nobody is refused any more; and the table of users is bounded.
TEST(RefusalLimiter, CountsWhatItLeavesOut) {
    using std::chrono::milliseconds;
    RefusalLimiter::Clock::time_point now{};
    std::map<uid_t, std::uint64_t> reported;
    milliseconds later{0};
    RefusalLimiter limiter(
        {}, [&](uid_t uid, std::uint64_t count) { reported[uid] += count; }, [&](milliseconds delay) { later = delay; },
        [&] { return now; });
    const auto admitted = [&](uid_t uid, int attempts, std::size_t bytes = shortLine) {
        int count = 0;
        for (int i = 0; i < attempts; ++i)
            count += limiter.admit(uid, bytes) ? 1 : 0;
        return count;
    };
    const auto wait = [&](milliseconds time) {
        now += time;
        limiter.reportEnded();
    };
    EXPECT_EQ(admitted(501, 1000), 200);
    EXPECT_EQ(admitted(502, 150), 150);
    EXPECT_TRUE(reported.empty());
    wait(later);
    EXPECT_EQ(reported, (std::map<uid_t, std::uint64_t>{{501, 800}}));
    // The minute's bytes: 204 lines of a hundred, five of four thousand.
    EXPECT_EQ(admitted(501, 300) + admitted(503, 24, 4096), 4 + 5);
    limiter.reportAll(); // somebody looks before the minute is over
    limiter.reportAll();
    EXPECT_EQ(reported, (std::map<uid_t, std::uint64_t>{{501, 1096}, {503, 19}}));
    EXPECT_EQ(admitted(501, 1) + admitted(503, 1, 4096), 0) << "looking gives no new lines";
    wait(milliseconds(59'000));
    EXPECT_EQ(reported[501], 1097U);
    wait(milliseconds(1000));
    EXPECT_EQ(reported[503], 20U);
    // A range of uids is one.
    EXPECT_EQ(admitted(100'000, 150) + admitted(165'535, 150), 200);
    // More users than places, within one second: the count of whoever has to go is told.
    wait(milliseconds(2000));
    EXPECT_EQ(admitted(1, 201), 200);
    reported.clear();
    now += milliseconds(1);
    for (uid_t uid = 100; uid < 100 + RefusalLimiter::usersMax; ++uid)
        EXPECT_TRUE(limiter.admit(uid, shortLine));
    EXPECT_EQ(reported, (std::map<uid_t, std::uint64_t>{{1, 1}}));
}

} // namespace
} // namespace zor::platform
