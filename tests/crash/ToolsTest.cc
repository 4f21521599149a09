// SPDX-License-Identifier: Apache-2.0
#include "fs/Durability.h"
#include "os/LinuxDisk.h"
#include "support/Files.h"
#include "support/PowerCut.h"

#include <gtest/gtest.h>

namespace zor::support {
namespace {

const std::string oldContent = "old content";
const std::string newContent = "the new content, which is longer";

/// Says that it has synced, and does not, at the syncs with these numbers, from 1.
class ForgetfulDisk final : public InterceptedDisk {
public:
    ForgetfulDisk(platform::Disk& disk, std::set<int> forgets) : InterceptedDisk(disk), forgets_(std::move(forgets)) {}

private:
    Errno intercept(const DiskCallInfo& info, const Make& make) override {
        return info.call == DiskCall::sync && forgets_.contains(++syncs_) ? Errno() : make();
    }
    const std::set<int> forgets_;
    int syncs_ = 0;
};

std::string judgeAfterCut(const PowerCutState& state, const std::string& directory) {
    if (readTree(directory).describe() != state.tree.describe())
        return "the state was not built as it is";
    const std::string content = readFile(directory + "/f");
    if (content != oldContent && content != newContent)
        return "f holds \"" + content + "\"";
    return state.marksPassed > 0 && content != newContent ? "the new content was acknowledged and is lost" : "";
}

// Goal: the model of power cuts tells what is sound from what is wrong. Method: a file is replaced durably, on a disk
// that forgets none of the two syncs, one, or both.
TEST(PowerCutModelTest, TellsSoundFromWrong) {
    for (const std::set<int>& forgotten : {std::set<int>{}, {1}, {2}, {1, 2}}) {
        const TemporaryDirectory root;
        const platform::FileDescriptor directory = openDirectory(root.path());
        makeFile(directory.get(), "f", oldContent);
        platform::LinuxDisk linuxDisk;
        RecordingDisk recording(linuxDisk, root.path());
        ForgetfulDisk disk(recording, forgotten);
        recording.start();
        ASSERT_FALSE(fs::replaceFileDurably(disk, directory.get(), "f", 0644, bytesOf(newContent)));
        recording.mark();
        ASSERT_EQ(recording.complaint(), "");
        for (const DiskModel model : {DiskModel::orderedJournal, DiskModel::unordered}) {
            const auto report = forEachPowerCut(recording.log(), {.model = model}, judgeAfterCut);
            EXPECT_EQ(report.complaint.empty(), forgotten.empty()) << report.complaint;
            EXPECT_GT(report.examined, 3U);
        }
    }
}

} // namespace
} // namespace zor::support
