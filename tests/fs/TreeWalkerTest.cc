// SPDX-License-Identifier: Apache-2.0
// Goal: a walk sees every item once and nothing that is not in the tree, whatever the tree's owner does meanwhile.
// Method: real trees, moved about between two visits by the visitor itself.
#include "fs/TreeWalker.h"

#include "fs/TreeWorld.h"

#include <algorithm>
#include <fcntl.h>
#include <functional>
#include <gtest/gtest.h>
#include <map>
#include <sched.h>
#include <set>
#include <sys/mount.h>
#include <sys/wait.h>
#include <unistd.h>

namespace zor::fs::test {
namespace {

const char* text(WalkEntryKind kind) {
    static const std::map<WalkEntryKind, const char*> texts = {{WalkEntryKind::directory, "directory"},
                                                               {WalkEntryKind::directoryEnd, "end"},
                                                               {WalkEntryKind::unreadableDirectory, "unreadable"},
                                                               {WalkEntryKind::file, "file"},
                                                               {WalkEntryKind::symbolicLink, "link"},
                                                               {WalkEntryKind::other, "other"},
                                                               {WalkEntryKind::noStatus, "no status"}};
    return texts.at(kind);
}

/// "kind path" of every visit, sorted, since a directory has no order of its own.
std::vector<std::string> visits(TreeWalker& walker, int parent, const char* name) {
    std::vector<std::string> seen;
    walker.walk(parent, name, [&](const WalkEntry& entry) {
        seen.push_back(std::string(text(entry.kind)) + " " + entry.path() + (entry.onOtherFileSystem ? " (away)" : ""));
        return WalkStep::proceed;
    });
    std::sort(seen.begin(), seen.end());
    return seen;
}

// Every kind of item, each directory before and after what it holds; links are not followed, dangling or not.
TEST(TreeWalker, VisitsEveryItemOfATree) {
    const TemporaryDirectory directory;
    const FileDescriptor root = openDirectory(directory.path());
    makeItems(root.get(), {"tree/", "tree/empty/", "tree/full/", "tree/full/.hidden", "tree/full/dangling -> nowhere",
                           "tree/full/up -> ..", "tree/fifo|"});
    ASSERT_EQ(::mknodat(root.get(), "tree/socket", S_IFSOCK | 0600, 0), 0);
    const std::vector<std::string> expected = {
        "directory ",        "directory empty",    "directory full", "end ",       "end empty",   "end full",
        "file full/.hidden", "link full/dangling", "link full/up",   "other fifo", "other socket"};
    for (const WalkStatus status : {WalkStatus::full, WalkStatus::typeOnly}) {
        TreeWalker walker(status);
        auto sorted = expected;
        std::sort(sorted.begin(), sorted.end());
        EXPECT_EQ(visits(walker, root.get(), "tree"), sorted);
        const FileDescriptor tree = openDirectory(root.get(), "tree");
        EXPECT_EQ(visits(walker, tree.get(), "."), sorted);
        EXPECT_EQ(visits(walker, root.get(), "tree/full/.hidden"), std::vector<std::string>{"file "});
        EXPECT_EQ(visits(walker, root.get(), "tree/full/up"), std::vector<std::string>{"link "});
    }
    TreeWalker walker;
    const auto proceed = [](const WalkEntry&) { return WalkStep::proceed; };
    EXPECT_EQ(walker.walk(root.get(), "missing", proceed), -ENOENT);
    EXPECT_EQ(walker.walk(root.get(), "tree",
                          [](const WalkEntry& e) { return e.depth > 0 ? WalkStep::stop : WalkStep::proceed; }),
              -ECANCELED);
}

struct Move {
    const char* name;
    /// Depths in the chain whose directories are moved out when the bottom is reached, in this order.
    std::vector<std::size_t> depths;
    /// Levels that cannot be returned to.
    std::size_t lost;
    /// What takes the moved directory's name: a link to where it is now, or other directories of the same names.
    bool decoys = false;
};

// Directories moved away while the walk is below them, deeper than it keeps descriptors: it goes on where it may,
// leaves what is lost, and never goes up into the place they were moved to.
TEST(TreeWalker, GoesUpOnlyIntoDirectoriesItCameFrom) {
    const Move moves[] = {
        {.name = "none", .depths = {}, .lost = 0},
        {.name = "its \"..\" leads out, its parent is where it was", .depths = {20}, .lost = 0},
        // The first move makes ".." useless at depth 20, the second the names at depth 10: 10 to 20 are gone.
        {.name = "parent away too", .depths = {20, 10}, .lost = 11},
        {.name = "parent away, others of its names there", .depths = {20, 10}, .lost = 11, .decoys = true},
        {.name = "near the bottom, still open", .depths = {50}, .lost = 0},
        {.name = "several", .depths = {30, 20, 10, 2}, .lost = 29},
    };
    for (const Move& move : moves) {
        World world;
        world.makeTree();
        std::vector<ino_t> chain;
        for (std::size_t depth = 0; depth <= World::chainDepth; ++depth)
            chain.push_back(statusOf(world.fd(), "tree/" + chainPath(depth)).st_ino);
        std::set<std::size_t> ended;
        TreeWalker walker;
        const int result = walker.walk(world.fd(), "tree", [&](const WalkEntry& entry) {
            // Only the place to which directories are moved has this name in it.
            EXPECT_FALSE(exists(entry.parent, "keep")) << move.name;
            if (entry.kind != WalkEntryKind::directoryEnd || entry.depth > World::chainDepth ||
                entry.status.st_ino != chain[entry.depth])
                return WalkStep::proceed;
            ended.insert(entry.depth);
            if (entry.depth < World::chainDepth)
                return WalkStep::proceed;
            for (const std::size_t depth : move.depths) {
                const std::string path = "tree/" + chainPath(depth);
                const std::string to = "outside/parking/m" + std::to_string(depth);
                EXPECT_EQ(::renameat(world.fd(), path.c_str(), world.fd(), to.c_str()), 0) << path;
                if (!move.decoys)
                    makeLink(world.fd(), path, world.path() + "/" + to);
                for (std::size_t below = depth; move.decoys && below <= World::chainDepth; ++below)
                    makeDirectory(world.fd(), "tree/" + chainPath(below));
            }
            return WalkStep::proceed;
        });
        EXPECT_EQ(result, 0) << move.name;
        EXPECT_EQ(walker.vanishedDirectories(), move.lost) << move.name;
        EXPECT_EQ(ended.size(), World::chainDepth + 1 - move.lost) << move.name;
        EXPECT_TRUE(ended.contains(0)) << move.name;
    }
}

// A name that changes its kind between the reading of the directory and its turn is visited as what it is now.
TEST(TreeWalker, VisitsWhatANameIsNow) {
    World world;
    makeDirectory(world.fd(), "tree");
    constexpr int count = 9;
    for (int i = 0; i < count; ++i)
        makeDirectory(world.fd(), "tree/" + std::to_string(i));
    std::map<std::string, std::string> kinds;
    std::map<std::string, std::string> expected;
    TreeWalker walker;
    walker.walk(world.fd(), "tree", [&](const WalkEntry& entry) {
        if (entry.depth == 0)
            return WalkStep::proceed;
        for (int i = 0; expected.empty() && i < count; ++i) {
            const std::string name = std::to_string(i);
            const std::string path = "tree/" + name;
            if (name == entry.name)
                continue;
            EXPECT_EQ(::unlinkat(world.fd(), path.c_str(), AT_REMOVEDIR), 0);
            if (i % 3 == 0)
                makeLink(world.fd(), path, world.path() + "/outside");
            if (i % 3 == 1)
                makeFifo(world.fd(), path);
        }
        if (expected.empty()) {
            expected = {{"0", "link"}, {"3", "link"}, {"6", "link"}, {"1", "other"}, {"4", "other"}, {"7", "other"}};
            expected[entry.name] = "end";
        }
        kinds[entry.name] = text(entry.kind);
        return WalkStep::proceed;
    });
    EXPECT_EQ(kinds, expected);
}

// Mount points, of another file system and of this one (a loop), and a mount on a file: shown, not entered.
TEST(TreeWalker, DoesNotCrossMounts) {
    World world;
    makeItems(world.fd(), {"tree/", "tree/other/", "tree/loop/", "tree/file"});
    const bool permitted = inMountNamespace([&] {
        const std::string tree = world.path() + "/tree";
        ASSERT_EQ(::mount("none", (tree + "/other").c_str(), "tmpfs", 0, nullptr), 0);
        ASSERT_EQ(::mount(tree.c_str(), (tree + "/loop").c_str(), nullptr, MS_BIND, nullptr), 0);
        ASSERT_EQ(::mount("/proc/version", (tree + "/file").c_str(), nullptr, MS_BIND, nullptr), 0);
        makeFile(AT_FDCWD, tree + "/other/inside");
        // A descriptor from before belongs to the parent's mounts.
        const FileDescriptor root = openDirectory(world.path());
        TreeWalker walker;
        EXPECT_EQ(visits(walker, root.get(), "tree"),
                  (std::vector<std::string>{"directory ", "directory loop (away)", "directory other (away)", "end ",
                                            "end loop (away)", "end other (away)", "file file (away)"}));
    });
    if (!permitted)
        GTEST_SKIP() << "mounting is not permitted";
}

} // namespace
} // namespace zor::fs::test
