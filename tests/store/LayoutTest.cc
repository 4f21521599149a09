// SPDX-License-Identifier: Apache-2.0
// Where everything lies, with which mode and owner, and what the getters do when they cannot make it.
#include "world/World.h"

#include <functional>
#include <gtest/gtest.h>
#include <unistd.h>

namespace zor::test {
namespace {

using support::LogLine;

// Goal: each getter gives its place and makes it, again after it went. Method: a table; everything is removed between
// two calls of each.
TEST(Layout, ProcessWideDirectories) {
    const std::string caches = cachesPath;
    const std::string library = libraryPath;
    struct Row {
        FileURL (ZORGlobalConfiguration::*getter)();
        std::string path;
        std::uint32_t owner;
        int protectionClass;
    };
    using Configuration = ZORGlobalConfiguration;
    const Row rows[] = {
        {&Configuration::sharedContainersDirectory, sharedPath, 0, 3},
        {&Configuration::logDirectory, "private/var/root/Library/Logs/Zorvane", 0, 4},
        {&Configuration::cachesDirectory, caches, 0, 4},
        {&Configuration::libraryDirectory, library, 0, 4},
        {&Configuration::transientDirectory, caches + "/Temp", 0, 3},
        {&Configuration::stagingDirectory, caches + "/Staging", 0, 3},
        {&Configuration::deathrowDirectory, caches + "/Dead", 0, 3},
        {&Configuration::replaceDirectory, library + "/Replace", 0, 3},
        {&Configuration::bundleDirectory, std::string(sharedPath) + "/Bundle", 0, 3},
        {&Configuration::transientBundleDirectory, "private/var/brevad/Library/Caches/com.veltra.zorvaned", 33, 3},
    };
    World world;
    ZORGlobalConfiguration& configuration = world.services().configuration();
    for (const Row& row : rows) {
        for (int call = 0; call < 2; ++call) {
            const FileURL url = (configuration.*row.getter)();
            EXPECT_EQ(url, world.url(row.path));
            EXPECT_EQ(world.item(row.path), directoryOf(row.owner)) << row.path;
            EXPECT_EQ(world.services().defaultManager().dataProtectionClassOfItemAtURL(url).value(),
                      row.protectionClass)
                << row.path;
            ASSERT_TRUE(world.services().defaultManager().removeItemAtURL(url));
            ASSERT_FALSE(world.exists(row.path));
        }
    }
    EXPECT_TRUE(world.log.take().empty());
    for (const char* level : {"private/var/brevad/Library", "private/var/brevad/Library/Caches"})
        EXPECT_EQ(world.item(level), directoryOf(33));
    EXPECT_EQ(ZORGlobalConfiguration::appUserDataItemNames(),
              (std::array<std::string_view, 4>{"Documents", "Library", "tmp", "Tillwerk"}));
}

// Goal: the installer's home is never made; the place is given all the same. Method: the home is missing.
TEST(Layout, TheInstallersHomeIsNotMade) {
    World world;
    ASSERT_EQ(::rmdir(world.path("private/var/brevad").c_str()), 0);
    const FileURL url = world.services().configuration().transientBundleDirectory();
    EXPECT_EQ(url, world.url("private/var/brevad/Library/Caches/com.veltra.zorvaned"));
    EXPECT_FALSE(world.exists("private/var/brevad"));
    const auto said = world.log.take(3, "transientBundleDirectory");
    ASSERT_EQ(said.size(), 3U);
    const char* steps[] = {"Library", "Library/Caches", "Library/Caches/com.veltra.zorvaned"};
    for (std::size_t i = 0; i < 3; ++i)
        EXPECT_TRUE(said[i].starts_with("Failed to create transient bundle dir at \"" +
                                        world.path(std::string("private/var/brevad/") + steps[i]) + "\": "))
            << said[i];
}

// Goal: the class directory of every class, user and transient flag. Method: the whole table.
TEST(Layout, ClassDirectories) {
    const std::string transientSystem = std::string(cachesPath) + "/Temp/";
    const std::string transientBundle = "private/var/brevad/Library/Caches/com.veltra.zorvaned/";
    const std::string transientUser = std::string(mobileCaches) + "/Temp/";
    World world;
    for (std::uint64_t number = 1; ipc::isContainerClass(number); ++number)
        for (const bool transient : {false, true}) {
            const auto containerClass = static_cast<ContainerClass>(number);
            const bool bundle = isBundleClass(containerClass);
            const bool system = isSystemClass(containerClass);
            std::string expected = transient ? (bundle   ? transientBundle
                                                : system ? transientSystem
                                                         : transientUser)
                                             : std::string(bundle || system ? sharedPath : mobileContainers) + "/";
            expected += className(containerClass);
            const auto url =
                world.services().configuration().containerDirectoryURLForUser(mobile, containerClass, transient);
            ASSERT_TRUE(url);
            EXPECT_EQ(*url, world.url(expected));
            EXPECT_EQ(world.item(expected), directoryOf(bundle ? 33 : system ? 0 : mobile)) << expected;
        }
    EXPECT_EQ(world.item(mobileContainers), directoryOf(mobile));
    EXPECT_EQ(world.item(std::string(mobileCaches) + "/Temp"), directoryOf(mobile));
    EXPECT_EQ(world.log.take(),
              (std::vector<LogLine>{{3, "initWithUserId", "user home Dir: " + world.path("private/var/mobile")}}));
}

// Goal: which users and classes have no place, and what is said each time. Method: a table; nothing may be made for
// them.
TEST(Layout, PlacesThatDoNotExist) {
    struct Row {
        std::uint32_t userId;
        std::uint64_t containerClass;
        std::vector<LogLine> lines;
    };
    const LogLine noClass0{3, "containerDirectoryURLForContentClass",
                           "Invalid class for a per user container directory: 0"};
    const LogLine noClass14{3, "containerDirectoryURLForContentClass",
                            "Invalid class for a per user container directory: 14"};
    World world;
    ZORGlobalConfiguration& configuration = world.services().configuration();
    ASSERT_NE(configuration.getPerUserConfigurationForUserId(mobile), nullptr);
    world.log.take();
    for (const Row& row : {Row{mobile, 0, {noClass0}}, Row{mobile, 14, {noClass14}},
                           Row{33, 2, {{3, "initWithUserId", "userId: 33 must be in range"}}},
                           Row{33, 2, {{3, "initWithUserId", "userId: 33 must be in range"}}},
                           Row{500, 0, {{3, "initWithUserId", "userId: 500 must be in range"}}},
                           Row{511, 2, {{3, "initWithUserId", "userId: 511 must be in range"}}},
                           Row{504,
                               2,
                               {{3, "initWithUserId", "Failed to getpwuid for uid: 504"},
                                {3, "initWithUserId", "user home Dir: (null)"}}},
                           Row{504, 2, {}}}) {
        EXPECT_FALSE(configuration.containerDirectoryURLForUser(
            row.userId, static_cast<ContainerClass>(row.containerClass), false));
        EXPECT_EQ(world.log.take(), row.lines) << row.userId;
    }
    struct Home {
        std::uint32_t userId;
        bool exists;
    };
    for (const Home& home : {Home{mobile, true}, Home{second, true}, Home{503, false}, Home{504, false}})
        EXPECT_EQ(configuration.getPerUserConfigurationForUserId(home.userId)->existsUserBaseDirectory(), home.exists);
    EXPECT_EQ(configuration.getPerUserConfigurationForUserId(mobile),
              configuration.getPerUserConfigurationForUserId(mobile));
    EXPECT_FALSE(world.exists(mobileContainers));
    EXPECT_FALSE(world.exists("private/var/nowhere"));
}

// Goal: a home may be reached through the administrator's link; below it a user's link leads nowhere. Method: both
// kinds.
TEST(Layout, LinksToAndBelowAHome) {
    World world;
    world.write("etc/passwd", "mobile:x:501:501::/private/var/alias:/bin/sh\n");
    ASSERT_EQ(::symlink("mobile", world.path("private/var/alias").c_str()), 0);
    ZORGlobalConfiguration& configuration = world.services().configuration();
    EXPECT_EQ(configuration.getPerUserConfigurationForUserId(mobile)->userHomeDirectory(),
              world.url("private/var/mobile"));
    ASSERT_EQ(::symlink("../second", world.path(mobileContainers).c_str()), 0);
    world.log.take();
    const auto url = configuration.containerDirectoryURLForUser(mobile, ContainerClass::dataApplication, false);
    ASSERT_TRUE(url);
    EXPECT_EQ(*url, world.url(std::string(mobileContainers) + "/Data/Application"));
    EXPECT_TRUE(world.names("private/var/second").empty());
    const auto said = world.log.take();
    ASSERT_EQ(said.size(), 2U);
    EXPECT_TRUE(said[0].message.starts_with("Failed to create user base dir at \"" + world.path(mobileContainers)));
    EXPECT_TRUE(said[1].message.starts_with("Failed to create container dir at \"" + url->path() + "\": "));
}

} // namespace
} // namespace zor::test
