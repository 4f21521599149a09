// SPDX-License-Identifier: Apache-2.0
#include "zorvane-run/Mounts.h"
#include "support/EncryptedDisk.h"
#include "support/FileTree.h"

#include <algorithm>
#include <functional>
#include <gtest/gtest.h>

namespace zorvanerun {
namespace {

namespace files = std::filesystem;

/// Every kind of container, owned as the daemon owns them; without root all belong to whoever runs the test.
struct World {
    World() {
        told = {.home = below("private/var/mobile"),
                .data = below("private/var/mobile/Containers/Data/Application/A"),
                .temporary = below("private/var/mobile/Containers/Data/Application/A/tmp"),
                .applicationGroups = {{"group.a", below("private/var/mobile/Containers/Shared/AppGroup/B")}},
                .systemContainer = below("private/var/containers/Data/System/C"),
                .systemGroups = {{"systemgroup.a", below("private/var/containers/Shared/SystemGroup/D")}}};
        for (const std::string& path : {told.data, told.applicationGroups["group.a"]})
            make(path, user());
        for (const std::string& path : {*told.systemContainer, told.systemGroups["systemgroup.a"]})
            make(path, 0);
        make(below("elsewhere"), user());
        options.identifier = "org.example";
        options.user = user();
    }
    static void make(const std::string& path, uid_t owner) {
        files::create_directories(path);
        if (::geteuid() == 0) {
            EXPECT_EQ(::chown(path.c_str(), owner, owner), 0);
        }
    }
    static uid_t user() { return ::geteuid() == 0 ? 501 : ::geteuid(); }
    [[nodiscard]] std::string below(const std::string& path) const { return directory.path() + "/" + path; }
    /// The problem, or "".
    [[nodiscard]] std::string open() {
        const auto root = Root::open(directory.path());
        EXPECT_TRUE(root);
        auto opened = openMounts(*root, options, told);
        if (!opened)
            return opened.error().what;
        mounts = std::move(*opened);
        return "";
    }

    zor::support::TemporaryDirectory directory;
    ToldContainers told;
    Options options;
    std::vector<Mount> mounts;
};

// A container of any kind, or a directory on the way to it, that is swapped for something else is never opened.
TEST(Mounts, WhatIsNoContainerIsRefused) {
    if (::geteuid() != 0)
        GTEST_SKIP() << "needs root: the containers of several users";
    {
        World world;
        ASSERT_EQ(world.open(), "");
        EXPECT_EQ(std::ranges::count_if(world.mounts, &Mount::isContainer), 4);
    }
    using Swap = std::function<void(const World&, const std::string&)>;
    const std::pair<const char*, Swap> swaps[] = {
        {"symbolic link",
         [](const World& world, const std::string& path) {
             files::remove_all(path);
             files::create_directory_symlink(world.below("elsewhere"), path);
         }},
        {"symbolic link", // the class's directory
         [](const World&, const std::string& path) {
             const std::string parent = files::path(path).parent_path();
             files::rename(parent, parent + ".old");
             files::create_directory_symlink(parent + ".old", parent);
         }},
        {"belongs to user 502",
         [](const World&, const std::string& path) { EXPECT_EQ(::chown(path.c_str(), 502, 502), 0); }},
        {"cannot be opened", [](const World&, const std::string& path) { files::remove_all(path); }},
        {"cannot be opened",
         [](const World&, const std::string& path) {
             files::remove_all(path);
             EXPECT_EQ(::mkfifo(path.c_str(), 0644), 0);
         }},
        {"mount point",
         [](const World& world, const std::string& path) {
             EXPECT_EQ(::mount(world.below("elsewhere").c_str(), path.c_str(), nullptr, MS_BIND, nullptr), 0);
         }},
    };
    for (const auto& [problem, swap] : swaps) {
        const int kinds = std::string_view(problem) == "mount point" ? 2 : 4; // the others are where only root mounts
        for (int kind = 0; kind < kinds; ++kind) {
            World world;
            const std::string paths[] = {world.told.data, world.told.applicationGroups["group.a"],
                                         *world.told.systemContainer, world.told.systemGroups["systemgroup.a"]};
            swap(world, paths[kind]);
            const std::string said = world.open();
            EXPECT_NE(said.find(problem), std::string::npos) << paths[kind] << ": " << said;
            EXPECT_NE(said.find(paths[kind]), std::string::npos) << said;
            (void)::umount2(paths[kind].c_str(), MNT_DETACH);
        }
    }
}

// Nothing is started on a container that is locked: the program would find nothing of its own, and could make nothing.
TEST(Mounts, ALockedContainerIsRefused) {
    World world;
    world.told.home = world.below("private/var/other");
    world.told.applicationGroups.clear();
    zor::support::EncryptedDisk disk(world.told.home);
    if (!disk.missing().empty())
        GTEST_SKIP() << "skipped: " << disk.missing();
    World::make(disk.directory() + "/tmp", world.user());
    World::make(disk.directory(), world.user());
    world.told.data = disk.directory();
    world.told.temporary = disk.directory() + "/tmp";
    ASSERT_EQ(world.open(), "");
    world.mounts.clear();
    ASSERT_TRUE(disk.takeKeyAway());
    EXPECT_NE(world.open().find("is locked"), std::string::npos);
}

// A directory to read never opens a way to containers, nor hides what the sandbox has of its own.
TEST(Mounts, DirectoriesToReadAreJudged) {
    if (::geteuid() != 0)
        GTEST_SKIP() << "needs root: the containers of several users";
    World world;
    files::create_directory_symlink(world.below("elsewhere"), world.below("link"));
    const std::pair<std::string, bool> rows[] = {{world.below("elsewhere"), true},
                                                 {world.below("private"), false},
                                                 {world.told.data, false},
                                                 {world.told.home, false},
                                                 {world.told.data + "/Documents", false},
                                                 {world.below("link"), false},
                                                 {world.below("absent"), false},
                                                 {world.below("elsewhere/../x"), false},
                                                 {"relative", false},
                                                 {"/", false},
                                                 {"/dev", false},
                                                 {"/usr/share", false},
                                                 {"/proc", false},
                                                 {world.below("elsewhere/"), false}};
    for (const auto& [path, allowed] : rows) {
        world.options.readOnly = {path};
        EXPECT_EQ(world.open() == "", allowed) << path;
    }
}

} // namespace
} // namespace zorvanerun
