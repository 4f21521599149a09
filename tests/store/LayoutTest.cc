// SPDX-License-Identifier: Apache-2.0
// Where everything lies, with which mode and owner, and what the getters do when they cannot make it. The class
// directories are judged where containers are made.
#include "world/World.h"

#include <gtest/gtest.h>
#include <unistd.h>

namespace zor::test {
namespace {

using support::LogLine;

constexpr const char* installersCaches = "private/var/brevad/Library/Caches/com.veltra.zorvaned";

// Goal: each getter makes its place, again after it went. Method: a table; all is removed between two calls.
TEST(Layout, ProcessWideDirectories) {
    using Configuration = ZORGlobalConfiguration;
    struct Row {
        FileURL (Configuration::*getter)();
        std::string path;
        int protectionClass;
    };
    const Row rows[] = {
        {&Configuration::sharedContainersDirectory, sharedPath, 3},
        {&Configuration::logDirectory, "private/var/root/Library/Logs/Zorvane", 4},
        {&Configuration::cachesDirectory, cachesPath, 4},
        {&Configuration::libraryDirectory, libraryPath, 4},
        {&Configuration::transientDirectory, std::string(cachesPath) + "/Temp", 3},
        {&Configuration::stagingDirectory, staging, 3},
        {&Configuration::deathrowDirectory, dead, 3},
        {&Configuration::replaceDirectory, journals, 3},
        {&Configuration::bundleDirectory, std::string(sharedPath) + "/Bundle", 3},
        {&Configuration::transientBundleDirectory, installersCaches, 3},
    };
    World world;
    for (const Row& row : rows)
        for (int call = 0; call < 2; ++call) {
            SCOPED_TRACE(row.path);
            const FileURL url = (world.services().configuration().*row.getter)();
            EXPECT_EQ(url, world.url(row.path));
            EXPECT_EQ(world.item(row.path), directoryOf(row.path == installersCaches ? 33 : 0));
            EXPECT_EQ(world.services().defaultManager().dataProtectionClassOfItemAtURL(url).value(),
                      row.protectionClass);
            ASSERT_TRUE(world.services().defaultManager().removeItemAtURL(url));
            ASSERT_FALSE(world.exists(row.path));
        }
    EXPECT_TRUE(world.log.take().empty());
    for (const char* level : {"private/var/brevad/Library", "private/var/brevad/Library/Caches"})
        EXPECT_EQ(world.item(level), directoryOf(33));
}

// Goal: the installer's home is never made; the place is given all the same. Method: the home is missing.
TEST(Layout, TheInstallersHomeIsNotMade) {
    World world;
    ASSERT_EQ(::rmdir(world.path("private/var/brevad").c_str()), 0);
    EXPECT_EQ(world.services().configuration().transientBundleDirectory(), world.url(installersCaches));
    EXPECT_FALSE(world.exists("private/var/brevad"));
    const auto said = world.complaints("transientBundleDirectory");
    ASSERT_EQ(said.size(), 3U);
    EXPECT_TRUE(
        said[2].starts_with("Failed to create transient bundle dir at \"" + world.path(installersCaches) + "\": "))
        << said[2];
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
    world.log.take();
    EXPECT_EQ(configuration.containerDirectoryURLForUser(mobile, application, false), world.url(applications));
    EXPECT_TRUE(world.names("private/var/second").empty());
    const auto said = world.log.take();
    ASSERT_EQ(said.size(), 2U);
    EXPECT_TRUE(said[0].message.starts_with("Failed to create user base dir at \"" + world.path(mobileContainers)));
    EXPECT_TRUE(said[1].message.starts_with("Failed to create container dir at \"" + world.path(applications)));
}

} // namespace
} // namespace zor::test
