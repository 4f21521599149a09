// SPDX-License-Identifier: Apache-2.0
#include "daemon/LinuxPlatform.h"
#include "platform/TestRoot.h"
#include "support/ProcessResources.h"

#include <atomic>

namespace zor::platform {
namespace {

// One daemon a root, several roots a process, and everything given back at the end, twice.
TEST(LinuxPlatform, OwnsOneRootAtATime) {
    const TestRoot first;
    const TestRoot second;
    // What the C library and the loop make once.
    ASSERT_TRUE(LinuxPlatform::open({.rootDirectory = first.path("")}));
    const support::ProcessResources before;
    for (int round = 0; round < 2; ++round) {
        auto opened = LinuxPlatform::open({.rootDirectory = first.path("")});
        ASSERT_TRUE(opened) << opened.error();
        const auto again = LinuxPlatform::open({.rootDirectory = first.path("run/..")});
        ASSERT_FALSE(again);
        EXPECT_EQ(again.error(), "another daemon serves the root " + first.root().canonicalPath());
        const auto other = LinuxPlatform::open({.rootDirectory = second.path("")});
        ASSERT_TRUE(other) << other.error();
        LinuxPlatform& platform = **opened;
        const Platform roles = platform.roles();
        EXPECT_EQ(roles.root.canonicalPath(), first.root().canonicalPath());
        EXPECT_TRUE(roles.listener.resume([](PeerConnection&, ServiceEvent&) {}));
        EXPECT_EQ(roles.upcallPort.checkIn(), 0);
        EXPECT_TRUE(
            roles.upcallPort.serve(roles.runLoop, [](const UpcallPacket&) { return std::vector<std::uint8_t>(); }));
        EXPECT_EQ(roles.lockState.registerForChanges(roles.runLoop, [] {}), 0);
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

} // namespace
} // namespace zor::platform
