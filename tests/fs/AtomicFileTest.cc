// SPDX-License-Identifier: Apache-2.0
// The replacing of files in a directory whose owner puts things where the daemon's temporary file goes.
#include "fs/AtomicFile.h"
#include "fs/FileManagerWorld.h"

namespace zor::fs::test {
namespace {

// Goal: what a stop left of a write goes with the next one, whatever the owner puts there stops none, and no other name
// is touched. Method: a write over each, judged by the names that are left.
TEST_F(FileManager, AFileIsReplacedWhateverLiesInTheWay) {
    const std::string temporary = ".f.new-000000";
    struct Row {
        const char* name;
        std::function<void()> prepare;
        std::vector<std::string> left;
    };
    const Row rows[] = {
        {"nothing", [] {}, {"f"}},
        {"a stopped write", [&] { makeFile("d/" + temporary, "half"); }, {"f"}},
        {"a link", [&] { ASSERT_EQ(::symlink("/etc/passwd", path("d/" + temporary).c_str()), 0); }, {"f"}},
        {"a directory", [&] { makeDirectory("d/" + temporary); }, {temporary, "f"}},
        {"other names", [&] { makeFile("d/.f.new-abcdef"); }, {".f.new-abcdef", "f"}},
    };
    const std::vector<std::uint8_t> bytes = {'n', 'e', 'w'};
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        makeDirectory("d");
        makeFile("d/f", "old");
        row.prepare();
        const platform::FileDescriptor directory(::open(path("d").c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
        EXPECT_EQ(replaceFileDurably(disk, directory.get(), "f", 0644, bytes), 0);
        std::string content;
        std::ifstream(path("d/f")) >> content;
        EXPECT_EQ(content, "new");
        EXPECT_EQ(names("d"), row.left);
        ASSERT_TRUE(manager().removeItemAtURL(url("d")));
    }
}

} // namespace
} // namespace zor::fs::test
