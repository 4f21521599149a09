// SPDX-License-Identifier: Apache-2.0
// Goal: the model of power cuts tells what is sound from what is wrong. Method: ways to give a file another content,
// some known to be wrong, recorded on a real directory; after a cut the file must hold the old or, when acknowledged,
// the new content, with its mode.
#include "os/LinuxDisk.h"
#include "support/Files.h"
#include "support/PowerCut.h"

#include <algorithm>
#include <fcntl.h>
#include <gtest/gtest.h>

namespace zor::support {
namespace {

constexpr mode_t newMode = 0644;
const std::string oldContent = "old content";
const std::string newContent = "the new content, which is longer";

struct Protocol {
    const char* name;
    /// c: create the new file, C: closed to others, i: open the old one; w: write, m: mode, s: sync it, o: order its
    /// data out; r: rename over; d: sync the directory, a: all of the file system.
    std::string steps;
    bool soundOrdered;
    bool soundUnordered;
};
const Protocol protocols[] = {
    {"nothing synced", "cwr", false, false},         {"sound", "cwsrd", true, true},
    {"file not synced", "cwrd", false, false},       {"directory not synced", "cwsr", false, false},
    {"renamed file synced", "cwsrs", true, false},   {"data ordered out", "cword", true, false},
    {"ordered before write", "cowrd", false, false}, {"written in place", "iws", false, false},
    {"mode after sync", "Cwsmrd", true, false},      {"file system synced", "Cwmara", true, true},
};

Errno replaceBy(const std::string& steps, platform::Disk& disk, int directory) {
    platform::FileDescriptor file;
    const auto opened = [&](ErrnoOr<platform::FileDescriptor> made) -> Errno {
        file = TRY(std::move(made));
        return Errno();
    };
    const std::map<char, std::function<Errno()>> does = {
        {'c', [&] { return opened(disk.createFile(directory, ".t", newMode)); }},
        {'C', [&] { return opened(disk.createFile(directory, ".t", 0600)); }},
        {'i', [&] { return opened(platform::FileDescriptor(::openat(directory, "f", O_RDWR | O_CLOEXEC))); }},
        {'w', [&] { return disk.write(file.get(), bytesOf(newContent)); }},
        {'m', [&] { return disk.changeMode(file.get(), newMode); }},
        {'s', [&] { return disk.sync(file.get()); }},
        {'o', [&] { return disk.orderData(file.get()); }},
        {'r', [&] { return disk.rename(directory, ".t", directory, "f", 0); }},
        {'d', [&] { return disk.sync(directory); }},
        {'a', [&] { return disk.syncFileSystem(directory); }},
    };
    for (const char step : steps)
        TRY(does.at(step)());
    return Errno();
}

std::string judge(const PowerCutState& state, const std::string& directory) {
    const FileTree tree = readTree(directory);
    if (tree.describe() != state.tree.describe())
        return "the state was not built as it is";
    const InodeId id = tree.resolve("f");
    if (id == 0)
        return "f is gone";
    const Inode& file = tree.inodes.at(id);
    const std::string content(file.content.begin(), file.content.end());
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
        const platform::FileDescriptor directory = openDirectory(root.path());
        makeFile(directory.get(), "f", oldContent, newMode);
        platform::LinuxDisk linuxDisk;
        RecordingDisk disk(linuxDisk, root.path());
        disk.start();
        ASSERT_FALSE(replaceBy(protocol.steps, disk, directory.get()));
        disk.mark();
        ASSERT_EQ(disk.complaint(), "");
        for (const std::uint64_t seed : {1, 2, 3})
            for (const DiskModel model : {DiskModel::orderedJournal, DiskModel::unordered}) {
                const auto report = forEachPowerCut(disk.log(), {.model = model, .seed = seed}, judge);
                EXPECT_EQ(report.complaint.empty(),
                          model == DiskModel::unordered ? protocol.soundUnordered : protocol.soundOrdered)
                    << report.complaint;
                EXPECT_GT(report.examined, 0U);
            }
    }
}

} // namespace
} // namespace zor::support
