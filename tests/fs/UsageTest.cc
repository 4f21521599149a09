// SPDX-License-Identifier: Apache-2.0
// Goal: the usage is what the items of the tree occupy, hard links once, and the log says what was left out. Method:
// against a plain sum over real trees; the tree is changed from inside the log.
#include "fs/DiskUsage.h"

#include "fs/TreeWorld.h"

#include <algorithm>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

namespace zor::fs::test {
namespace {

std::uint64_t allocated(int parent, const std::string& path) {
    return static_cast<std::uint64_t>(statusOf(parent, path).st_blocks) * 512;
}

class UsageOnFileSystem : public testing::TestWithParam<const char*> {};
INSTANTIATE_TEST_SUITE_P(FileSystems, UsageOnFileSystem, testing::Values("/dev/shm", "/tmp"));

// Files, links and FIFOs count what they occupy, directories nothing; the level-7 lines name what was not counted or
// entered.
TEST_P(UsageOnFileSystem, CountsAllocatedBytesOnce) {
    const TemporaryDirectory directory(GetParam());
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
    std::vector<std::string> lines;
    const auto write = [&](int level, const std::string& message) {
        lines.push_back(std::to_string(level) + " " + message);
    };
    for (int repeat = 0; repeat < 2; ++repeat)
        EXPECT_EQ(diskUsage(root.get(), "/name", {.write = write, .levelMax = 3}).bytes, expected);
    EXPECT_TRUE(lines.empty());
    EXPECT_EQ(diskUsage(root.get(), "/name", {.write = write, .levelMax = 7}).bytes, expected);
    std::sort(lines.begin(), lines.end());
    EXPECT_EQ(lines, (std::vector<std::string>{"7 Skipping hardlinked file at /name/a/again",
                                               "7 skipping empty directory at /name/empty"}));
    EXPECT_EQ(diskUsage(root.get(), "/name", {}).bytes, expected);
}

// What goes or changes while it is measured adds nothing and is said, with the words and the place.
TEST(Usage, SaysWhatItCannotRead) {
    const TemporaryDirectory directory;
    const FileDescriptor root = openDirectory(directory.path());
    makeFile(root.get(), "file");
    ASSERT_EQ(::linkat(root.get(), "file", root.get(), "file2", 0), 0);
    makeDirectory(root.get(), "gone");
    makeFile(root.get(), "gone/f", std::string(100'000, 'x'));
    makeDirectory(root.get(), "swapped");
    makeFile(root.get(), "swapped/f", std::string(100'000, 'x'));
    std::vector<std::string> lines;
    const auto write = [&](int level, const std::string& message) {
        // The first line comes from the root's entries, before any directory below is opened.
        if (lines.empty()) {
            ::unlinkat(root.get(), "gone/f", 0);
            ::unlinkat(root.get(), "gone", AT_REMOVEDIR);
            ::renameat(root.get(), "swapped", root.get(), "elsewhere");
            makeLink(root.get(), "swapped", "elsewhere");
        }
        lines.push_back(std::to_string(level) + " " + message);
    };
    EXPECT_EQ(diskUsage(root.get(), "/r", {.write = write, .levelMax = 7}).bytes, allocated(root.get(), "file"));
    ASSERT_EQ(lines.size(), 3U);
    EXPECT_TRUE(lines[0].starts_with("7 Skipping hardlinked file at /r/file"));
    std::sort(lines.begin(), lines.end());
    EXPECT_EQ(lines[0], "3 Failed to open directory /r/gone : No such file or directory");
    EXPECT_TRUE(lines[1].starts_with("3 Failed to open directory /r/swapped : ")) << lines[1];
}

} // namespace
} // namespace zor::fs::test
