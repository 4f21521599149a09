// SPDX-License-Identifier: Apache-2.0
// Goal: a removal takes the whole tree and nothing else, says what it could not take, and never calls a failure a
// success. Method: real trees with immutable items, and names that come meanwhile.
#include "fs/TreeWorld.h"

#include <linux/fs.h>
#include <sys/ioctl.h>

namespace zor::fs::test {
namespace {

constexpr int protectingFlags = FS_IMMUTABLE_FL | FS_APPEND_FL;

/// Which of the protecting flags it has; -1 where there are none to be had.
int flagsOf(int parent, const std::string& path) {
    const FileDescriptor fd(::openat(parent, path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
    int flags = 0;
    return ::ioctl(fd.get(), FS_IOC_GETFLAGS, &flags) == 0 ? flags & protectingFlags : -1;
}

/// Sets exactly these of the protecting flags; the file system has others of its own.
bool setFlags(int parent, const std::string& path, int wanted) {
    const FileDescriptor fd(::openat(parent, path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
    int flags = 0;
    const bool known = ::ioctl(fd.get(), FS_IOC_GETFLAGS, &flags) == 0;
    flags = (flags & ~protectingFlags) | wanted;
    return known && ::ioctl(fd.get(), FS_IOC_SETFLAGS, &flags) == 0;
}

/// The paths of failed items, and of directories made mutable with a "+".
struct Said {
    std::string text;
    RemoveCallbacks callbacks() {
        return {.failed =
                    [this](const RemoveFailure& failure) {
                        text += failure.path + ":" + std::to_string(failure.error.number()) + " ";
                    },
                .directoryMadeMutable = [this](const std::string& path) { text += "+" + path + " "; }};
    }
};

// Directories that may not change are made mutable; an immutable file is the callback's to repair; the directory that
// holds the root is never touched.
TEST(RemoveTree, ClearsFlagsOfDirectoriesInsideTheTree) {
    const struct {
        const char* path;
        int flags;
        /// The callbacks' words, and the result of the form without them.
        const char* said;
        int result;
    } cases[] = {
        {"top/tree/a/b/file", FS_IMMUTABLE_FL, "a/b/file:1 a/b:39 a:39 :39 ", EPERM},
        {"top/tree/a/b/file", FS_APPEND_FL, "a/b/file:1 a/b:39 a:39 :39 ", EPERM},
        {"top/tree/a/b", FS_IMMUTABLE_FL, "+a/b ", 0},
        {"top/tree/a/b", FS_APPEND_FL, "+a/b ", 0},
        {"top/tree/a/empty", FS_IMMUTABLE_FL, "+a/empty ", 0},
        {"top/tree", FS_IMMUTABLE_FL, "+ ", 0},
        {"top", FS_IMMUTABLE_FL, ":1 ", EPERM},
    };
    if (::geteuid() != 0)
        GTEST_SKIP() << "only root may set inode flags";
    platform::LinuxDisk disk;
    for (const auto& row : cases) {
        for (const bool withCallbacks : {false, true}) {
            const TemporaryDirectory directory("/tmp");
            const FileDescriptor root = openDirectory(directory.path());
            makeItems(root.get(),
                      {"top/", "top/tree/", "top/tree/a/", "top/tree/a/b/", "top/tree/a/empty/", "top/tree/a/b/file"});
            if (!setFlags(root.get(), row.path, row.flags))
                GTEST_SKIP() << "no inode flags in /tmp";
            const FileDescriptor top = openDirectory(root.get(), "top");
            Said said;
            const Errno result = withCallbacks ? removeTree(disk, top.get(), "tree", said.callbacks())
                                               : removeTree(disk, top.get(), "tree");
            EXPECT_EQ(result.number(), withCallbacks ? 0 : row.result) << row.path;
            EXPECT_EQ(said.text, withCallbacks ? row.said : "") << row.path;
            EXPECT_EQ(exists(top.get(), "tree"), row.result != 0) << row.path;
            EXPECT_FALSE(exists(top.get(), "tree/a/empty")) << row.path;
            // An item that was not to be touched still has its flag; then the test may clean up.
            if (row.result != 0) {
                EXPECT_EQ(flagsOf(root.get(), row.path), row.flags) << row.path;
                setFlags(root.get(), row.path, 0);
            }
        }
    }
}

// The repair that a callback makes: both flags are cleared, links and FIFOs are left alone, and the removal then
// succeeds.
TEST(RemoveTree, LetsACallbackRepairImmutableFiles) {
    if (::geteuid() != 0)
        GTEST_SKIP() << "only root may set inode flags";
    const TemporaryDirectory directory("/tmp");
    const FileDescriptor root = openDirectory(directory.path());
    makeItems(root.get(), {"tree/", "tree/file", "outside", "link -> outside", "fifo|"});
    if (!setFlags(root.get(), "tree/file", FS_IMMUTABLE_FL | FS_APPEND_FL) ||
        !setFlags(root.get(), "outside", FS_IMMUTABLE_FL))
        GTEST_SKIP() << "no inode flags in /tmp";
    platform::LinuxDisk disk;
    for (const char* const name : {"link", "fifo", "tree"})
        EXPECT_EQ(clearImmutable(disk, root.get(), name), false) << name;
    EXPECT_EQ(clearImmutable(disk, root.get(), "missing").error().number(), ENOENT);
    EXPECT_EQ(flagsOf(root.get(), "outside"), FS_IMMUTABLE_FL);
    setFlags(root.get(), "outside", 0);
    const RemoveCallbacks callbacks = {.failed = [&](const RemoveFailure& failure) {
        EXPECT_EQ(failure.path + std::to_string(failure.error.number()), "file1");
        EXPECT_EQ(clearImmutable(disk, failure.parent, failure.name), true);
        EXPECT_FALSE(disk.unlinkFile(failure.parent, failure.name));
    }};
    EXPECT_FALSE(removeTree(disk, root.get(), "tree", callbacks));
    EXPECT_FALSE(exists(root.get(), "tree"));
}

// Names that come into a directory while it is removed are removed as well; a root that turns into something else, too.
TEST(RemoveTree, RemovesWhatIsAddedMeanwhile) {
    World world;
    makeItems(world.fd(), {"tree/", "tree/file"});
    int additions = 0;
    support::FaultDisk disk(world.disk);
    disk.before = [&](const support::DiskCallInfo& info) {
        if (info.call == support::DiskCall::removeDirectory && info.subject == "tree" && additions < 10) {
            const std::string name = "tree/new" + std::to_string(additions++);
            makeItems(world.fd(), {name + "/", name + "/f"});
        }
    };
    Said said;
    EXPECT_FALSE(removeTree(disk, world.fd(), "tree", said.callbacks()));
    EXPECT_EQ(additions, 10);
    EXPECT_EQ(removeTree(disk, world.fd(), "tree", said.callbacks()).number(), ENOENT);
    EXPECT_EQ(said.text, "");

    makeDirectory(world.fd(), "tree");
    bool swapped = false;
    disk.before = [&](const support::DiskCallInfo&) {
        if (!std::exchange(swapped, true)) {
            ::unlinkat(world.fd(), "tree", AT_REMOVEDIR);
            makeLink(world.fd(), "tree", world.path() + "/outside");
        }
    };
    EXPECT_FALSE(removeTree(disk, world.fd(), "tree"));
    EXPECT_FALSE(exists(world.fd(), "tree"));
    EXPECT_EQ(world.damage(), "");
}

// Goal: of a large tree nothing stays but what cannot go, which is told once, on the caller's thread, whichever thread
// came to it first. Method: directories that two threads empty, one with an immutable file, some with more below.
TEST(RemoveTree, ASecondThreadEmptiesDirectories) {
    if (::geteuid() != 0)
        GTEST_SKIP() << "only root may set inode flags";
    const TemporaryDirectory directory("/tmp");
    const FileDescriptor root = openDirectory(directory.path());
    makeItems(root.get(), {"tree/"});
    for (const std::string half : {"tree/1/", "tree/2/"}) {
        makeItems(root.get(), {half});
        for (int i = 0; i < 1100; ++i)
            makeItems(root.get(), {half + std::to_string(i)});
        for (const std::string some : {"a/", "b/", "c/", "d/", "e/", "f/", "g/", "h/", "i/"})
            makeItems(root.get(), {half + some, half + some + "slow", half + some + "below/", half + some + "below/f"});
    }
    if (!setFlags(root.get(), "tree/1/d/slow", FS_IMMUTABLE_FL) ||
        !setFlags(root.get(), "tree/2/d/slow", FS_IMMUTABLE_FL))
        GTEST_SKIP() << "no inode flags in /tmp";
    platform::LinuxDisk linuxDisk;
    support::FaultDisk disk(linuxDisk);
    const auto caller = std::this_thread::get_id();
    std::atomic<int> byAnother = 0;
    disk.before = [&](const support::DiskCallInfo& info) {
        byAnother += std::this_thread::get_id() == caller ? 0 : 1;
        if (info.subject == "slow")
            ::usleep(2000);
    };
    std::set<std::string> said;
    const RemoveCallbacks callbacks = {.failed = [&](const RemoveFailure& failure) {
        EXPECT_EQ(std::this_thread::get_id(), caller);
        EXPECT_TRUE(said.insert(failure.path).second) << failure.path;
    }};
    EXPECT_FALSE(removeTree(disk, root.get(), "tree", callbacks));
    EXPECT_GT(byAnother, 0);
    EXPECT_EQ(said, (std::set<std::string>{"", "1", "1/d", "1/d/slow", "2", "2/d", "2/d/slow"}));
    for (const std::string half : {"tree/1/", "tree/2/"}) {
        EXPECT_FALSE(exists(root.get(), (half + "d/below").c_str()) || exists(root.get(), (half + "a").c_str()));
        setFlags(root.get(), (half + "d/slow").c_str(), 0);
    }
}

} // namespace
} // namespace zor::fs::test
