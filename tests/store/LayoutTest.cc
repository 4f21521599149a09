// SPDX-License-Identifier: Apache-2.0
// Homes that are not there, or are links. The class directories are judged where containers are made.
#include "world/World.h"

#include <gtest/gtest.h>

namespace zor::test {
namespace {

// Goal: a home may be the administrator's link; below it a user's leads nowhere. Method: both kinds.
TEST(Layout, LinksToAndBelowAHome) {
    World world;
    world.write("etc/passwd", "mobile:x:501:501::/private/var/alias:/bin/sh\n");
    world.link("mobile", "private/var/alias");
    ZORGlobalConfiguration& configuration = world.services().configuration();
    EXPECT_EQ(configuration.getPerUserConfigurationForUserId(mobile)->userHomeDirectory(),
              world.url("private/var/mobile"));
    world.link("../second", mobileContainers);
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
        inParallel(4, [&](int) {
            const auto seen = home.look();
            wrong += !seen.directory || *seen.directory != world.url("private/var/mobile");
        });
        ASSERT_EQ(wrong, 0) << "in round " << round;
    }
}

} // namespace
} // namespace zor::test
