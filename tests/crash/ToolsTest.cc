// SPDX-License-Identifier: Apache-2.0
// Goal: the tools that inject faults and cut the power tell what is sound from what is wrong. Method: small ways to
// change a disk, some known to be wrong.
#include "os/LinuxDisk.h"
#include "support/FaultLoop.h"
#include "support/Files.h"
#include "support/PowerCut.h"

#include <algorithm>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

namespace zor::support {
namespace {

using platform::FileDescriptor;
using platform::LinuxDisk;

constexpr mode_t newMode = 0644;
const std::string oldContent = "old content";
const std::string newContent = "the new content, which is longer";

/// Gives the file "f" of a directory the new content through the file ".t", which goes when it is left.
struct Replacing {
    platform::Disk& disk;
    int directory;
    FileDescriptor file = {};
    bool hasTemporary = false;

    ~Replacing() {
        if (hasTemporary)
            disk.unlinkFile(directory, ".t");
    }
};

/// One step of it; a negative errno when it fails.
using Step = int (*)(Replacing&);
int createWithMode(Replacing& work, mode_t mode) {
    work.file.reset(work.disk.createFile(work.directory, ".t", mode));
    work.hasTemporary = work.file.valid();
    return work.file.get();
}
constexpr Step createTemporary = [](Replacing& work) { return createWithMode(work, newMode); };
constexpr Step createClosed = [](Replacing& work) { return createWithMode(work, 0600); };
constexpr Step createInPlace = [](Replacing& work) {
    work.file.reset(::openat(work.directory, "f", O_RDWR | O_CLOEXEC));
    return work.file.get();
};
constexpr Step renameOver = [](Replacing& work) {
    const int result = work.disk.rename(work.directory, ".t", work.directory, "f", 0);
    work.hasTemporary = work.hasTemporary && result != 0;
    return result;
};
constexpr Step writeNew = [](Replacing& work) { return work.disk.write(work.file.get(), bytesOf(newContent)); };
constexpr Step setMode = [](Replacing& work) { return work.disk.changeMode(work.file.get(), newMode); };
constexpr Step syncFile = [](Replacing& work) { return work.disk.sync(work.file.get()); };
constexpr Step orderFile = [](Replacing& work) { return work.disk.orderData(work.file.get()); };
constexpr Step syncDirectory = [](Replacing& work) { return work.disk.sync(work.directory); };
constexpr Step syncAll = [](Replacing& work) { return work.disk.syncFileSystem(work.directory); };
/// The first error ends it.
int runSteps(platform::Disk& disk, int directory, const std::vector<Step>& steps) {
    Replacing work{disk, directory};
    int result = 0;
    for (auto step = steps.begin(); step != steps.end() && result >= 0; ++step)
        result = (*step)(work);
    return std::min(result, 0);
}

std::string text(const Bytes& bytes) {
    return {bytes.begin(), bytes.end()};
}

// Goal: protocols that are known to be wrong are caught and sound ones pass, each under the model that can tell.
// Method: a table of step lists, recorded on a real directory; after a cut "f" must hold the old or, when acknowledged,
// the new content, with its mode.
struct Protocol {
    const char* name;
    std::vector<Step> steps;
    bool soundOrdered;
    bool soundUnordered;
};
const Protocol protocols[] = {
    {"nothing synced", {createTemporary, writeNew, renameOver}, false, false},
    {"sound", {createTemporary, writeNew, syncFile, renameOver, syncDirectory}, true, true},
    {"file not synced", {createTemporary, writeNew, renameOver, syncDirectory}, false, false},
    {"directory not synced", {createTemporary, writeNew, syncFile, renameOver}, false, false},
    {"renamed file synced", {createTemporary, writeNew, syncFile, renameOver, syncFile}, true, false},
    {"data ordered out", {createTemporary, writeNew, orderFile, renameOver, syncDirectory}, true, false},
    {"ordered before write", {createTemporary, orderFile, writeNew, renameOver, syncDirectory}, false, false},
    {"written in place", {createInPlace, writeNew, syncFile}, false, false},
    {"mode after sync", {createClosed, writeNew, syncFile, setMode, renameOver, syncDirectory}, true, false},
    {"file system synced", {createClosed, writeNew, setMode, syncAll, renameOver, syncAll}, true, true},
};

std::string judgeReplacement(const PowerCutState& state, const std::string& directory) {
    const FileTree tree = readTree(directory);
    if (tree.describe() != state.tree.describe())
        return "the state was not built as it is";
    const InodeId id = tree.resolve("f");
    if (id == 0)
        return "f is gone";
    const Inode& file = tree.inodes.at(id);
    const std::string content = text(file.content);
    if (content != oldContent && content != newContent)
        return "f holds \"" + content + "\"";
    if (content == newContent && (file.mode & 07777) != newMode)
        return "f has another mode";
    return state.marksPassed > 0 && content != newContent ? "the new content was acknowledged and is lost" : "";
}

TEST(PowerCutModelTest, TellsSoundFromWrong) {
    for (const Protocol& protocol : protocols) {
        SCOPED_TRACE(protocol.name);
        const TemporaryDirectory root;
        const FileDescriptor directory = openDirectory(root.path());
        makeFile(directory.get(), "f", oldContent, newMode);
        LinuxDisk linuxDisk;
        RecordingDisk disk(linuxDisk, root.path());
        disk.start();
        ASSERT_EQ(runSteps(disk, directory.get(), protocol.steps), 0);
        disk.mark();
        ASSERT_EQ(disk.complaint(), "");
        for (const std::uint64_t seed : {1, 2, 3})
            for (const DiskModel model : {DiskModel::orderedJournal, DiskModel::unordered}) {
                const auto report = forEachPowerCut(disk.log(), {.model = model, .seed = seed}, judgeReplacement);
                EXPECT_EQ(report.complaint.empty(),
                          model == DiskModel::unordered ? protocol.soundUnordered : protocol.soundOrdered)
                    << report.complaint;
                EXPECT_GT(report.examined, 0U);
            }
    }
}

} // namespace
} // namespace zor::support
