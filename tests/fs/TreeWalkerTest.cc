// SPDX-License-Identifier: Apache-2.0
// Goal: a walk sees every item once and nothing that is not in the tree, whatever the tree's owner does meanwhile.
// Method: real trees, moved about between two visits by the visitor itself. The same for the usage, which is a walk.
#include "fs/TreeWalker.h"

#include "fs/TreeWorld.h"
#include "fs/Trees.h"

#include <sys/mount.h>

namespace zor::fs::test {
namespace {

/// "kind path" of every visit.
std::set<std::string> visits(TreeWalker& walker, int parent, const char* name) {
    static const std::map<WalkEntryKind, const char*> texts = {{WalkEntryKind::directory, "directory "},
                                                               {WalkEntryKind::directoryEnd, "end "},
                                                               {WalkEntryKind::unreadableDirectory, "unreadable "},
                                                               {WalkEntryKind::file, "file "},
                                                               {WalkEntryKind::symbolicLink, "link "},
                                                               {WalkEntryKind::other, "other "},
                                                               {WalkEntryKind::noStatus, "no status "}};
    std::set<std::string> seen;
    (void)walker.walk(parent, name, [&](const WalkEntry& entry) {
        EXPECT_TRUE(
            seen.insert(texts.at(entry.kind) + entry.path() + (entry.onOtherFileSystem ? " (away)" : "")).second);
        return WalkStep::proceed;
    });
    return seen;
}

// Directories moved away while the walk is below them, deeper than it keeps descriptors: it goes on where it may,
// leaves what is lost, and never goes up into the place they were moved to.
TEST(TreeWalker, GoesUpOnlyIntoDirectoriesItCameFrom) {
    const struct {
        const char* name;
        /// Depths in the chain whose directories are moved out when the bottom is reached, in this order.
        std::vector<std::size_t> depths;
        /// Levels that cannot be returned to.
        std::size_t lost;
        /// The moved directory's name is taken by a link to its new place, or by other directories of the same names.
        bool decoys = false;
    } moves[] = {
        {.name = "none", .depths = {}, .lost = 0},
        {.name = "its \"..\" leads out, its parent is where it was", .depths = {20}, .lost = 0},
        // The first move makes ".." useless at depth 20, the second the names at depth 10: 10 to 20 are gone.
        {.name = "parent away too", .depths = {20, 10}, .lost = 11},
        {.name = "parent away, others of its names there", .depths = {20, 10}, .lost = 11, .decoys = true},
        {.name = "near the bottom, still open", .depths = {50}, .lost = 0},
        {.name = "several", .depths = {30, 20, 10, 2}, .lost = 29},
    };
    for (const auto& move : moves) {
        World world;
        world.makeTree();
        std::vector<ino_t> chain;
        for (std::size_t depth = 0; depth <= World::chainDepth; ++depth)
            chain.push_back(statusOf(world.fd(), "tree/" + chainPath(depth)).st_ino);
        std::set<std::size_t> ended;
        TreeWalker walker;
        const Errno result = walker.walk(world.fd(), "tree", [&](const WalkEntry& entry) {
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
        EXPECT_FALSE(result) << move.name;
        EXPECT_EQ(walker.vanishedDirectories(), move.lost) << move.name;
        EXPECT_EQ(ended.size(), World::chainDepth + 1 - move.lost) << move.name;
        EXPECT_TRUE(ended.contains(0)) << move.name;
    }
}

// A name that changes its kind between the reading of the directory and its turn is visited as what it is now.
TEST(TreeWalker, VisitsWhatANameIsNow) {
    World world;
    makeItems(world.fd(), {"tree/", "tree/a/", "tree/b/"});
    std::vector<WalkEntryKind> kinds;
    TreeWalker walker;
    (void)walker.walk(world.fd(), "tree", [&](const WalkEntry& entry) {
        if (entry.depth == 0)
            return WalkStep::proceed;
        const std::string other = entry.name == std::string("a") ? "tree/b" : "tree/a";
        if (kinds.empty() && ::unlinkat(world.fd(), other.c_str(), AT_REMOVEDIR) == 0)
            makeLink(world.fd(), other, "../outside");
        kinds.push_back(entry.kind);
        return WalkStep::proceed;
    });
    using enum WalkEntryKind;
    EXPECT_EQ(kinds, (std::vector{directory, directoryEnd, symbolicLink}));
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
        for (const char* path : {"..", "tree/..", "tree/../..", "/tree"})
            EXPECT_EQ(platform::openBeneathOnMount(root.get(), path, O_PATH).error().number(), EXDEV) << path;
        TreeWalker walker;
        EXPECT_EQ(visits(walker, root.get(), "tree"),
                  (std::set<std::string>{"directory ", "directory loop (away)", "directory other (away)", "end ",
                                         "end loop (away)", "end other (away)", "file file (away)"}));
    });
    if (!permitted)
        GTEST_SKIP() << "mounting is not permitted";
}

// Goal: the usage is what files, links and FIFOs occupy, hard links once, and the log says what was left out. Method:
// against a plain sum; then the tree is changed from inside the log.
TEST(Usage, CountsAllocatedBytesOnce) {
    const TemporaryDirectory directory("/tmp");
    const FileDescriptor root = openDirectory(directory.path());
    makeItems(root.get(), {"a/", "a/b/", "empty/"});
    makeFile(root.get(), "a/file", std::string(10'000, 'x'));
    makeFile(root.get(), "a/b/.hidden", std::string(100'000, 'x'));
    makeFile(root.get(), "twice", std::string(50'000, 'x'));
    ASSERT_EQ(::linkat(root.get(), "twice", root.get(), "a/again", 0), 0);
    makeLink(root.get(), "link", "/dev/shm");
    makeLink(root.get(), "long", std::string(4000, 'x'));
    makeFifo(root.get(), "fifo");
    const FileDescriptor sparse(::openat(root.get(), "sparse", O_WRONLY | O_CREAT | O_CLOEXEC, 0600));
    ASSERT_EQ(::ftruncate(sparse.get(), 1'000'000'000), 0);
    std::uint64_t expected = 0;
    for (const char* path : {"a/file", "a/b/.hidden", "twice", "link", "long", "fifo", "sparse"})
        expected += allocated(root.get(), path);
    EXPECT_EQ(diskUsage(root.get(), "/r", {}).bytes, expected);
    std::set<std::string> lines;
    const auto write = [&](int level, const std::string& message) {
        lines.insert(std::to_string(level) + " " + message.substr(0, message.find(" : ")));
        // The first line comes from the root's entries, before any directory below is opened.
        if (lines.size() == 1) {
            ::unlinkat(root.get(), "empty", AT_REMOVEDIR);
            ::renameat(root.get(), "a", root.get(), "elsewhere");
            makeLink(root.get(), "a", "elsewhere");
        }
    };
    makeDirectory(root.get(), "b");
    ASSERT_EQ(::linkat(root.get(), "twice", root.get(), "b/again", 0), 0);
    ASSERT_EQ(::linkat(root.get(), "twice", root.get(), "thrice", 0), 0);
    expected -= allocated(root.get(), "a/file") + allocated(root.get(), "a/b/.hidden");
    EXPECT_EQ(diskUsage(root.get(), "/r", {.write = write, .levelMax = 7}).bytes, expected);
    EXPECT_TRUE(lines.erase("7 Skipping hardlinked file at /r/thrice") +
                    lines.erase("7 Skipping hardlinked file at /r/twice") ==
                1);
    EXPECT_EQ(lines, (std::set<std::string>{"3 Failed to open directory /r/a", "3 Failed to open directory /r/empty",
                                            "7 Skipping hardlinked file at /r/b/again"}));
}

} // namespace
} // namespace zor::fs::test
