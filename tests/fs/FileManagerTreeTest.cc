// SPDX-License-Identifier: Apache-2.0
// The file manager's work on trees: listing, moving (across file systems too), removing, re-owning, reporting orphans.
#include "fs/FileManagerWorld.h"
#include "fs/Names.h"
#include "fs/TreeWorld.h"

#include <algorithm>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/mount.h>

namespace zor::fs::test {
namespace {

using support::DiskCall;
using support::LogLine;

TEST_F(FileManager, ListsWhatIsNotHidden) {
    makeItems({"d/", "d/sub/", "d/file", "d/link -> sub", "d/dangling -> nowhere", "d/fifo|", "d/.hidden"});
    write(std::string("d/") + zor::names::metadataFile, "x");
    write("d/..odd", "x");
    auto listed = manager().urlsForItemsInDirectoryAtURL(url("d"));
    ASSERT_TRUE(listed);
    std::vector<std::string> shown;
    for (const FileURL& item : *listed)
        shown.push_back(item.path().substr(path("d/").size()) + (item.isDirectory() ? "/" : ""));
    std::ranges::sort(shown);
    EXPECT_EQ(shown, (std::vector<std::string>{"dangling", "fifo", "file", "link", "sub/"}));

    for (const char* name : {"nowhere", "d/link"})
        EXPECT_FALSE(manager().urlsForItemsInDirectoryAtURL(url(name))) << name;
    EXPECT_EQ(lines.take().size(), 1U) << "absence is not said";
    write("d/.zorvaned-copy-abcdef", "x");
    const auto leftovers = manager().copyLeftoversInDirectoryAtURL(url("d"));
    ASSERT_EQ(leftovers.size(), 1U);
    EXPECT_EQ(leftovers[0].lastPathComponent(), ".zorvaned-copy-abcdef");
}

// Goal: what a missing source, an occupied destination and a missing parent do, in all four forms. Method: a table.
TEST_F(FileManager, MovesAndCopies) {
    makeItems({"full/", "full/f", "empty/"});
    write("file", "x");
    const auto refuses = [&](const char* from, const char* to, int number) {
        const auto moved = manager().moveItemAtURL(url(from), url(to));
        EXPECT_TRUE(!moved && moved.error().isPosix(number)) << from << " to " << to;
    };
    refuses("no", "to", ENOENT);
    refuses("empty", "full", ENOTEMPTY);
    refuses("empty", "no/to", ENOENT);
    EXPECT_FALSE(manager().copyItemAtURL(url("no"), url("to")));
    EXPECT_TRUE(manager().moveItemIfExistsAtURL(url("no"), url("to")));
    EXPECT_TRUE(manager().copyItemIfExistsAtURL(url("no"), url("to")));
    EXPECT_FALSE(manager().moveItemIfExistsAtURL(url("file/x"), url("to")));
    EXPECT_EQ(item("to"), "missing");
    EXPECT_TRUE(manager().moveItemAtURL(url("full"), url("empty"))); // an empty directory gives way
    EXPECT_EQ(names("empty"), (std::vector<std::string>{"f"}));
    EXPECT_TRUE(manager().copyItemIfExistsAtURL(url("empty"), url("copy")));
    EXPECT_EQ(read("copy/f"), "x");
    makeItems({"link"
               " -> "
               "copy"});
    EXPECT_TRUE(manager().moveItemAtURL(url("link"), url("moved"))); // the link itself
    EXPECT_TRUE(item("moved").starts_with("other 0777"));
    EXPECT_FALSE(manager().moveItemAtURL(url("moved/f"), url("stolen"))); // never through it
    EXPECT_TRUE(item("copy/f").starts_with("file 0644"));
}

// Goal: across file systems a move copies, then removes; a copy that fails leaves the source alone. Method: a child in
// a mount namespace of its own with a small tmpfs below the root.
TEST_F(FileManager, MovesAcrossFileSystems) {
    if (::geteuid() != 0)
        GTEST_SKIP() << "skipped: needs root to mount";
    makeDirectories("other");
    makeDirectories("from", {}, 0711);
    write("from/small", "content", 0640);
    write("from/large", std::string(256 * 1024, 'l'));
    ASSERT_EQ(::chown(path("from/small").c_str(), 501, 502), 0);
    const bool permitted = inMountNamespace([this] {
        ASSERT_EQ(::mount("tmpfs", path("other").c_str(), "tmpfs", 0, "size=128k"), 0);
        open();
        const auto tooLarge = manager().moveItemAtURL(url("from"), url("other/to"));
        ASSERT_FALSE(tooLarge);
        EXPECT_TRUE(tooLarge.error().isPosix(ENOSPC));
        EXPECT_TRUE(tooLarge.error().description()->starts_with("clonetree of " + path("from") + " to "));
        EXPECT_EQ(names("other"), std::vector<std::string>());
        EXPECT_EQ(names("from"), (std::vector<std::string>{"large", "small"}));
        ASSERT_EQ(::unlink(path("from/large").c_str()), 0);
        EXPECT_TRUE(manager().moveItemAtURL(url("from"), url("other/to")));
        EXPECT_EQ(item("from"), "missing");
        EXPECT_EQ(read("other/to/small"), "content");
        EXPECT_EQ(item("other/to/small"), "file 0640 501:502");
        EXPECT_TRUE(item("other/to").starts_with("directory 0711"));
        EXPECT_EQ(names("other"), std::vector<std::string>{"to"});
        // A source that cannot be removed is said and is no failure.
        failNext(DiskCall::unlinkFile, EIO);
        lines.take();
        EXPECT_TRUE(manager().moveItemAtURL(url("other/to/small"), url("back")));
        EXPECT_EQ(
            lines.take(3, "moveAcrossFileSystems"),
            std::vector<std::string>{"Failed to remove source " + path("other/to/small") + " : Input/output error"});
        EXPECT_EQ(read("back"), "content");
    });
    if (!permitted)
        GTEST_SKIP() << "skipped: no mount namespace to be had";
}

// Goal: everything of the former owner's but metadata files gets the owner and 0755 or 0644; what has a name outside or
// is another's keeps its own. Method: one item of each kind, before and after.
TEST_F(FileManager, StandardisesOwnership) {
    if (::geteuid() != 0)
        GTEST_SKIP() << "skipped: needs root to give files away";
    makeDirectories("tree", {}, 0700);
    makeDirectories("tree/sub", {}, 01777);
    write("tree/plain", "x", 0600);
    write("tree/program", "x", 0410);
    write("tree/setuid", "x", 04711);
    write(std::string("tree/sub/") + zor::names::metadataFile, "x", 0640);
    makeItems({"tree/link"
               " -> "
               "../outside"});
    write("outside", "x", 0600);
    write("shared", "x", 0600);
    ASSERT_EQ(::link(path("shared").c_str(), path("tree/shared").c_str()), 0);
    write("tree/twice", "x", 04711);
    ASSERT_EQ(::link(path("tree/twice").c_str(), path("tree/sub/twice").c_str()), 0);
    // In a directory that cannot be given away, names may be moved and counted twice.
    for (int other = 0; other < 102; ++other) {
        write("tree/other" + std::to_string(other), "x", 0600);
        ASSERT_EQ(::chown(path("tree/other" + std::to_string(other)).c_str(), 502, 502), 0);
    }
    failNext(DiskCall::changeOwner, EROFS);
    ASSERT_TRUE(manager().standardizeOwnershipAtURL(url("tree"), 501, 502, 0));
    EXPECT_TRUE(item("tree/twice").starts_with("file 4711"));
    lines.take();
    ASSERT_TRUE(manager().standardizeOwnershipAtURL(url("tree"), 501, 502, 0));
    EXPECT_EQ(item("tree/twice"), "file 0755 501:502");
    ASSERT_TRUE(manager().standardizeOwnershipAtURL(url("tree/shared"), 501, 502, 0));
    EXPECT_EQ(item("tree"), "directory 0755 501:502");
    EXPECT_EQ(item("tree/sub"), "directory 0755 501:502");
    EXPECT_EQ(item("tree/plain"), "file 0644 501:502");
    EXPECT_EQ(item("tree/program"), "file 0755 501:502");
    EXPECT_EQ(item("tree/setuid"), "file 0755 501:502");
    EXPECT_EQ(item(std::string("tree/sub/") + zor::names::metadataFile), "file 0640 0:0");
    EXPECT_EQ(item("tree/link"), "other 0777 501:502");
    EXPECT_EQ(item("outside"), "file 0600 0:0");
    EXPECT_EQ(item("shared"), "file 0600 0:0");
    EXPECT_EQ(item("tree/other0"), "file 0600 502:502");
    const auto said = lines.take(); // each of the others, up to a limit, and their number
    ASSERT_EQ(said.size(), 101U);
    EXPECT_EQ(said.back().message, "2 more items below " + path("tree") + " keep their owner and mode");
    fail(support::FaultSpan::fromThenOn, DiskCall::changeOwner, EROFS);
    EXPECT_TRUE(manager().standardizeOwnershipAtURL(url("tree/plain"), 33, 33, 501));
    disk.disarm();
    EXPECT_TRUE(hasLine(lines.take(), 3, "standardizeOwnershipAtURL",
                        "Could not chown " + path("tree/plain") + ": Read-only file system"));
    expectPosix(manager().standardizeOwnershipAtURL(url("no"), 501, 501, 0), ENOENT,
                "Could not stat " + path("no") + ": No such file or directory");
}

} // namespace
} // namespace zor::fs::test
