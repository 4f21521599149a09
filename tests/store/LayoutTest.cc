// SPDX-License-Identifier: Apache-2.0
// Homes that are not there, or are links. The class directories are judged where containers are made.
#include "world/World.h"

#include <gtest/gtest.h>
#include <unistd.h>

namespace zor::test {
namespace {

// Goal: the installer's home is never made; the place is given all the same. Method: the home is missing.
TEST(Layout, TheInstallersHomeIsNotMade) {
    World world;
    ASSERT_EQ(::rmdir(world.path("private/var/brevad").c_str()), 0);
    EXPECT_EQ(world.services().configuration().transientBundleDirectory(),
              world.url("private/var/brevad/Library/Caches/com.veltra.zorvaned"));
    EXPECT_FALSE(world.exists("private/var/brevad"));
}

// Goal: a home may be the administrator's link; below it a user's leads nowhere. Method: both kinds.
TEST(Layout, LinksToAndBelowAHome) {
    World world;
    world.write("etc/passwd", "mobile:x:501:501::/private/var/alias:/bin/sh\n");
    ASSERT_EQ(::symlink("mobile", world.path("private/var/alias").c_str()), 0);
    ZORGlobalConfiguration& configuration = world.services().configuration();
    EXPECT_EQ(configuration.getPerUserConfigurationForUserId(mobile)->userHomeDirectory(),
              world.url("private/var/mobile"));
    ASSERT_EQ(::symlink("../second", world.path(mobileContainers).c_str()), 0);
    EXPECT_EQ(configuration.containerDirectoryURLForUser(mobile, application, false), world.url(applications));
    EXPECT_TRUE(world.names("private/var/second").empty());
}

// Goal: who first asks for a home while another does is given that home. Method: threads, all at once, many times.
TEST(Layout, FirstLooksThatMeetSeeOneHome) {
    World world;
    Composition& services = world.services();
    for (int round = 0; round < 200; ++round) {
        UserHome home(mobile, services.log(), services.defaultManager().resolver(), services.platform().passwords);
        std::atomic<int> wrong{0};
        std::vector<std::thread> threads;
        for (int i = 0; i < 4; ++i)
            threads.emplace_back([&] {
                const auto seen = home.look();
                wrong += !seen.directory || *seen.directory != world.url("private/var/mobile");
            });
        for (std::thread& thread : threads)
            thread.join();
        ASSERT_EQ(wrong, 0) << "in round " << round;
    }
}

} // namespace
} // namespace zor::test
