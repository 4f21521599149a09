// SPDX-License-Identifier: Apache-2.0
// Every operation on trees, walk, copy, removal and usage, against hostile trees: a tree's owner moves its directories
// about meanwhile; a tree is deeper than descriptors and paths reach, and wider than memory is spent for.
#include "fs/TreeWalker.h"
#include "fs/TreeWorld.h"
#include "fs/Trees.h"

namespace zor::fs::test {
namespace {

void copyOften(World& world) {
    // A single file is copied so often that its change into a FIFO falls between the look and the opening.
    for (std::size_t turn = 0; turn < 50; ++turn) {
        std::string source = "tree/wide/f" + std::to_string(turn % World::wideCount);
        if (turn < 4)
            source = turn == 0 ? "tree" : "tree/wide";
        (void)copyTree(world.disk, world.fd(), source.c_str(), world.fd(), ".copy");
        if (!exists(world.fd(), ".copy"))
            continue;
        if (turn < 4) {
            for (const auto& [id, inode] : support::readTree(world.path() + "/.copy").inodes)
                EXPECT_NE(std::string(inode.content.begin(), inode.content.end()), World::secret);
        }
        EXPECT_FALSE(removeTree(world.disk, world.fd(), ".copy"));
    }
}

// Goal: nothing outside is visited, copied, counted, changed or removed, no descriptor is kept, and nothing blocks.
// Method: each operation against an owner who moves directories out, with links and FIFOs in their place.
TEST(HostileTree, NothingLeadsOutside) {
    std::set<ino_t> forbidden;
    std::size_t disturbed = 0;
    struct Operation {
        const char* name;
        int times; // for one owner
        std::function<void(World&)> run;
    };
    const Operation operations[] = {
        {"walk", 10,
         [&](World& world) {
             TreeWalker walker;
             std::size_t deepest = 0;
             (void)walker.walk(world.fd(), "tree", [&](const WalkEntry& entry) {
                 EXPECT_FALSE(forbidden.contains(entry.status.st_ino)) << entry.path();
                 if (entry.directory >= 0)
                     ::fchmod(entry.directory, 0711);
                 deepest = std::max(deepest, entry.depth);
                 return WalkStep::proceed;
             });
             disturbed += walker.vanishedDirectories() > 0 || deepest < World::chainDepth ? 1 : 0;
         }},
        {"copy", 1, copyOften},
        {"usage", 10,
         [](World& world) {
             EXPECT_LT(diskUsage(openDirectory(world.fd(), "tree").get(), "/r", {}).bytes, World::outsideBytes);
         }},
        {"removal", 1, [](World& world) { (void)removeTree(world.disk, world.fd(), "tree"); }},
    };
    for (const auto& [name, times, operation] : operations) {
        SCOPED_TRACE(name);
        World world;
        forbidden.clear();
        (void)TreeWalker(WalkStatus::full).walk(world.fd(), "outside", [&](const WalkEntry& entry) {
            forbidden.insert(entry.status.st_ino);
            return WalkStep::proceed;
        });
        const bool permitted = world.confined([&] {
            const std::size_t descriptorsBefore = openDescriptorCount();
            repeatForRace([&] {
                world.makeTree();
                {
                    const Vandal vandal(world);
                    for (int i = 0; i < times; ++i)
                        operation(world);
                }
                (void)removeTree(world.disk, world.fd(), "tree");
                (void)removeTree(world.disk, world.fd(), "outside/parking/moved");
                EXPECT_FALSE(exists(world.fd(), "tree"));
                EXPECT_EQ(world.damage(), "");
            });
            EXPECT_EQ(openDescriptorCount(), descriptorsBefore);
            // Else the owner did not get in between, and the test says nothing.
            EXPECT_TRUE(disturbed > 0 || name != operations[0].name);
        });
        if (!permitted)
            GTEST_SKIP() << "chroot is not permitted";
    }
}

/// Resident memory in bytes.
std::size_t residentBytes() {
    unsigned long pages = 0;
    std::sscanf(support::readFile("/proc/self/statm").c_str(), "%*u %lu", &pages);
    return pages * static_cast<std::size_t>(::sysconf(_SC_PAGESIZE));
}

// Goal: every item is met, with few descriptors and little memory. Method: a chain of directories with a file and a
// second name at its bottom, beside more directories than may wait.
TEST(HostileTree, AnyDepthAndWidth) {
    constexpr std::size_t width = 70'000;
    const std::size_t depth = isLongRun() ? 100'000 : 10'000;
    const TemporaryDirectory directory;
    const FileDescriptor root = openDirectory(directory.path());
    makeItems(root.get(), {"tree/", "tree/wide/", "tree/deep/"});
    const FileDescriptor wide = openDirectory(root.get(), "tree/wide");
    for (std::size_t i = 0; i < width; ++i) {
        const std::string name = std::to_string(i);
        ASSERT_EQ(::mkdirat(wide.get(), name.c_str(), 0700), 0);
        ASSERT_EQ(::symlinkat(std::string(200, 'x').c_str(), wide.get(), (name + "/l").c_str()), 0);
    }
    makeFile(root.get(), "tree/file", std::string(5000, 'x'));
    FileDescriptor bottom = openDirectory(root.get(), "tree/deep");
    for (std::size_t level = 0; level < depth; ++level) {
        makeItems(bottom.get(), {"d/", "d/f"});
        bottom = openDirectory(bottom.get(), "d");
    }
    makeFile(bottom.get(), "file", std::string(500'000, 'x'));
    ASSERT_EQ(::linkat(root.get(), "tree/file", bottom.get(), "again", 0), 0);
    const std::uint64_t bytes = allocated(root.get(), "tree/file") + allocated(bottom.get(), "file") +
                                width * allocated(wide.get(), "0/l") + depth * allocated(bottom.get(), "f");
    bottom.reset();

    std::size_t visited = 0;
    std::size_t descriptorsMost = 0;
    const std::size_t descriptorsBefore = openDescriptorCount();
    const std::size_t residentBefore = residentBytes();
    TreeWalker walker;
    const Errno walked = walker.walk(root.get(), "tree", [&](const WalkEntry&) {
        if (++visited % 1000 == 0)
            descriptorsMost = std::max(descriptorsMost, openDescriptorCount());
        return WalkStep::proceed;
    });
    EXPECT_FALSE(walked);
    EXPECT_EQ(visited, 3 * (depth + width) + 9);
    EXPECT_EQ(walker.vanishedDirectories(), 0U);
    EXPECT_LE(descriptorsMost - descriptorsBefore, 64U);
    EXPECT_LT(residentBytes(), residentBefore + 8 * 1024 * 1024);
    EXPECT_EQ(diskUsage(openDirectory(root.get(), "tree").get(), "/r", {}).bytes, bytes);
    platform::LinuxDisk disk;
    ASSERT_FALSE(copyTree(disk, root.get(), "tree/deep/d", root.get(), "copy"));
    std::size_t levels = 1;
    for (FileDescriptor level = openDirectory(root.get(), "copy"); exists(level.get(), "d"); ++levels)
        level = openDirectory(level.get(), "d");
    EXPECT_EQ(levels, depth);
    for (const char* name : {"copy", "tree"})
        EXPECT_FALSE(removeTree(disk, root.get(), name));
}

} // namespace
} // namespace zor::fs::test
