// SPDX-License-Identifier: Apache-2.0
#include "crash/Protocols.h"
#include "platform/linux/LinuxDisk.h"
#include "support/PowerCut.h"

#include <csignal>
#include <cstdlib>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

namespace zor::support {
namespace {

using platform::FileDescriptor;
using platform::LinuxDisk;

void makeFile(int directory, const char* name, const std::string& content, mode_t mode) {
    const FileDescriptor file(::openat(directory, name, O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
    ASSERT_EQ(::write(file.get(), content.data(), content.size()), static_cast<ssize_t>(content.size()));
    ASSERT_EQ(::fchmod(file.get(), mode), 0);
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
    mode_t modeAtCreation;
    bool soundOrdered;
    bool soundUnordered;
};

const std::vector<Protocol> protocols = {
    {"nothing synced", {Step::createTemporary, Step::writeNew, Step::renameOver}, newMode, false, false},
    {"sound",
     {Step::createTemporary, Step::writeNew, Step::syncFile, Step::renameOver, Step::syncDirectory},
     newMode,
     true,
     true},
    {"file not synced",
     {Step::createTemporary, Step::writeNew, Step::renameOver, Step::syncDirectory},
     newMode,
     false,
     false},
    {"directory not synced",
     {Step::createTemporary, Step::writeNew, Step::syncFile, Step::renameOver},
     newMode,
     false,
     false},
    {"directory synced before the rename",
     {Step::createTemporary, Step::writeNew, Step::syncFile, Step::syncDirectory, Step::renameOver},
     newMode,
     false,
     false},
    {"a file that did not change synced in place of the directory",
     {Step::createTemporary, Step::writeNew, Step::syncFile, Step::renameOver, Step::syncBystander},
     newMode,
     false,
     false},
    {"the renamed file synced in place of the directory",
     {Step::createTemporary, Step::writeNew, Step::syncFile, Step::renameOver, Step::syncFile},
     newMode,
     true,
     false},
    {"data ordered out",
     {Step::createTemporary, Step::writeNew, Step::orderFile, Step::renameOver, Step::syncDirectory},
     newMode,
     true,
     false},
    {"data ordered out after the rename",
     {Step::createTemporary, Step::writeNew, Step::renameOver, Step::orderFile, Step::syncDirectory},
     newMode,
     false,
     false},
    {"data ordered out before it is written",
     {Step::createTemporary, Step::orderFile, Step::writeNew, Step::renameOver, Step::syncDirectory},
     newMode,
     false,
     false},
    {"written in place", {Step::createInPlace, Step::writeNew, Step::syncFile}, newMode, false, false},
    {"old one unlinked first",
     {Step::createTemporary, Step::writeNew, Step::syncFile, Step::unlinkOld, Step::renameOver, Step::syncDirectory},
     newMode,
     false,
     false},
    {"mode set after the sync",
     {Step::createTemporary, Step::writeNew, Step::syncFile, Step::setMode, Step::renameOver, Step::syncDirectory},
     0600,
     true,
     false},
    {"mode set after the rename",
     {Step::createTemporary, Step::writeNew, Step::syncFile, Step::renameOver, Step::setMode, Step::syncDirectory},
     0600,
     false,
     false},
    {"file system synced",
     {Step::createTemporary, Step::writeNew, Step::setMode, Step::syncAll, Step::renameOver, Step::syncAll},
     0600,
     true,
     true},
};

/// Creates files with another mode than asked for.
mode_t umaskFor(mode_t modeAtCreation) {
    return ~modeAtCreation & 0777;
}

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
        const FileDescriptor directory = openBelow(root.path());
        makeFile(directory.get(), "f", oldContent, newMode);
        makeFile(directory.get(), "bystander", "b", newMode);
        LinuxDisk linuxDisk;
        RecordingDisk disk(linuxDisk, root.path());
        disk.start();
        const mode_t before = ::umask(umaskFor(protocol.modeAtCreation));
        const int result = runSteps(disk, directory.get(), protocol.steps);
        ::umask(before);
        ASSERT_EQ(result, 0);
        disk.mark();
        ASSERT_EQ(disk.complaint(), "");

        const DiskLog log = disk.log();
        for (const std::uint64_t seed : {1, 2, 3}) {
            const LoopReport ordered =
                forEachPowerCut(log, {.model = DiskModel::orderedJournal, .seed = seed}, judgeReplacement);
            EXPECT_EQ(ordered.complaint.empty(), protocol.soundOrdered) << ordered.complaint;
            const LoopReport unordered =
                forEachPowerCut(log, {.model = DiskModel::unordered, .seed = seed}, judgeReplacement);
            EXPECT_EQ(unordered.complaint.empty(), protocol.soundUnordered) << unordered.complaint;
            EXPECT_GT(ordered.examined, 0U);
            EXPECT_GT(unordered.examined, 0U);
        }
    }
}

// Goal: the same for a directory that is built aside and moved in whole.
// Method: each sync left out in turn; the moved directory, where it is, must hold everything.
struct DirectoryProtocol {
    const char* name;
    bool syncContent;
    bool syncDirectory;
    bool syncDestination;
    bool soundOrdered;
    bool soundUnordered;
};

const std::vector<DirectoryProtocol> directoryProtocols = {
    {"sound", true, true, true, true, true},
    {"content not synced", false, true, true, false, false},
    // The content's sync commits what was made before it, where a journal keeps the order.
    {"directory not synced", true, false, true, true, false},
    {"destination not synced", true, true, false, false, false},
};

std::string judgeDirectory(const PowerCutState& state, const std::string& directory) {
    const FileTree tree = readTree(directory);
    if (tree.resolve("class/u") == 0)
        return state.marksPassed > 0 ? "what was acknowledged is lost" : "";
    if (tree.resolve("staging/u") != 0)
        return "in both places";
    const InodeId meta = tree.resolve("class/u/meta");
    if (tree.resolve("class/u/sub") == 0 || meta == 0)
        return "half made";
    return text(tree.inodes.at(meta).content) == newContent ? "" : "content lost";
}

TEST(PowerCutDirectoryTest, TellsSoundFromWrong) {
    for (const DirectoryProtocol& protocol : directoryProtocols) {
        SCOPED_TRACE(protocol.name);
        const TemporaryDirectory root;
        const FileDescriptor top = openBelow(root.path());
        ASSERT_EQ(::mkdirat(top.get(), "staging", 0755) | ::mkdirat(top.get(), "class", 0755), 0);
        const FileDescriptor staging = openBelow(root.path() + "/staging");
        const FileDescriptor destination = openBelow(root.path() + "/class");
        LinuxDisk linuxDisk;
        RecordingDisk disk(linuxDisk, root.path());
        disk.start();
        ASSERT_EQ(disk.makeDirectory(staging.get(), "u", 0755), 0);
        const FileDescriptor made = openBelow(root.path() + "/staging/u");
        ASSERT_EQ(disk.makeDirectory(made.get(), "sub", 0755), 0);
        const FileDescriptor meta(disk.createFile(made.get(), "meta", 0644));
        const std::span content(reinterpret_cast<const std::uint8_t*>(newContent.data()), newContent.size());
        ASSERT_EQ(disk.write(meta.get(), content), 0);
        if (protocol.syncContent) {
            ASSERT_EQ(disk.sync(meta.get()), 0);
        }
        if (protocol.syncDirectory) {
            ASSERT_EQ(disk.sync(made.get()), 0);
        }
        ASSERT_EQ(disk.rename(staging.get(), "u", destination.get(), "u", 0), 0);
        if (protocol.syncDestination) {
            ASSERT_EQ(disk.sync(destination.get()), 0);
        }
        disk.mark();
        ASSERT_EQ(disk.complaint(), "");
        const DiskLog log = disk.log();
        const LoopReport ordered = forEachPowerCut(log, {.model = DiskModel::orderedJournal}, judgeDirectory);
        EXPECT_EQ(ordered.complaint.empty(), protocol.soundOrdered) << ordered.complaint;
        const LoopReport unordered = forEachPowerCut(log, {.model = DiskModel::unordered}, judgeDirectory);
        EXPECT_EQ(unordered.complaint.empty(), protocol.soundUnordered) << unordered.complaint;
    }
}

// Goal: what moves on from directory to directory is in one of them, whichever moves a cut loses. Method: a file and a
// directory moved twice, with one sync of the last destination.
TEST(PowerCutDirectoryTest, MovesOneStepAfterTheOther) {
    const TemporaryDirectory root;
    const FileDescriptor top = openBelow(root.path());
    LinuxDisk linuxDisk;
    RecordingDisk disk(linuxDisk, root.path());
    for (const char* name : {"a", "b", "c", "a/d"})
        ASSERT_EQ(::mkdirat(top.get(), name, 0755), 0);
    makeFile(top.get(), "a/f", oldContent, newMode);
    disk.start();
    const FileDescriptor a = openBelow(root.path() + "/a");
    const FileDescriptor b = openBelow(root.path() + "/b");
    const FileDescriptor c = openBelow(root.path() + "/c");
    for (const char* name : {"f", "d"}) {
        ASSERT_EQ(disk.rename(a.get(), name, b.get(), name, 0), 0);
        ASSERT_EQ(disk.rename(b.get(), name, c.get(), name, 0), 0);
    }
    ASSERT_EQ(disk.sync(c.get()), 0);
    ASSERT_EQ(disk.complaint(), "");
    const DiskLog log = disk.log();
    for (const DiskModel model : {DiskModel::orderedJournal, DiskModel::unordered}) {
        std::set<std::string> places;
        const LoopReport report = forEachPowerCut(
            log, {.model = model}, [&](const PowerCutState& state, const std::string& directory) -> std::string {
                const FileTree tree = readTree(directory);
                for (const char* name : {"f", "d"}) {
                    std::string place;
                    for (const char* parent : {"a/", "b/", "c/"})
                        place += tree.resolve(std::string(parent) + name) != 0 ? parent : "";
                    if (place.size() != 2)
                        return std::string(name) + " is in \"" + place + "\"";
                    if (state.operationsDone == log.operations.size() && place != "c/")
                        return std::string(name) + " was synced in c and is in " + place;
                    places.insert(place + name);
                }
                return "";
            });
        EXPECT_EQ(report.complaint, "");
        EXPECT_EQ(places.size(), 6U) << "each was seen in each place";
    }
}

// Goal: the recorder's tree is the disk's after every kind of call, also where inode numbers come again, and a cut with
// nothing lost builds that tree. Method: all calls once on each file system at hand, compared with the directory
// itself.
TEST(RecordingDiskTest, FollowsEveryCall) {
    for (const std::string parent : {"/dev/shm", "/var/tmp"}) {
        SCOPED_TRACE(parent);
        const TemporaryDirectory root(parent);
        const FileDescriptor top = openBelow(root.path());
        makeFile(top.get(), "before", oldContent, 0640);
        ASSERT_EQ(::mkdirat(top.get(), "run", 0755), 0);
        const FileDescriptor outside = openBelow(root.path() + "/run");
        LinuxDisk linuxDisk;
        RecordingDisk disk(linuxDisk, root.path(), {"run"});
        disk.start();
        const Bytes bytes = {1, 2, 3, 4, 5};
        ASSERT_EQ(disk.makeDirectory(top.get(), "d", 0750), 0);
        const FileDescriptor directory = openBelow(root.path() + "/d");
        for (int round = 0; round < 3; ++round) {
            FileDescriptor file(disk.createFile(directory.get(), "again", 0600));
            ASSERT_EQ(disk.write(file.get(), bytes), 0);
            file.reset();
            ASSERT_EQ(disk.unlinkFile(directory.get(), "again"), 0);
        }
        const FileDescriptor file(disk.createFile(directory.get(), "f", 0600));
        ASSERT_EQ(disk.write(file.get(), bytes), 0);
        ASSERT_EQ(disk.setAttribute(file.get(), "trusted.zorvane.test", bytes), ::geteuid() == 0 ? 0 : -EPERM);
        ASSERT_EQ(disk.changeMode(file.get(), 0604), 0);
        ASSERT_EQ(disk.changeOwner(directory.get(), 501, 501), 0);
        ASSERT_EQ(disk.makeHardLink(directory.get(), "f", top.get(), "second"), 0);
        ASSERT_EQ(disk.makeSymbolicLink("nowhere", top.get(), "link"), 0);
        ASSERT_EQ(disk.makeFifo(top.get(), "fifo", 0600), 0);
        const FileDescriptor source(::openat(top.get(), "before", O_RDONLY | O_CLOEXEC));
        const FileDescriptor copy(disk.createFile(top.get(), "copy", 0600));
        ASSERT_EQ(disk.copyData(source.get(), copy.get(), 4), 4);
        ASSERT_EQ(disk.copyData(source.get(), copy.get(), 100), static_cast<ssize_t>(oldContent.size()) - 4);
        const FileDescriptor appending(::openat(top.get(), "before", O_WRONLY | O_APPEND | O_CLOEXEC));
        ASSERT_EQ(disk.write(appending.get(), bytes), 0);
        ASSERT_EQ(disk.makeDirectory(top.get(), "e", 0700), 0);
        ASSERT_EQ(disk.rename(top.get(), "e", top.get(), "d", RENAME_EXCHANGE), 0);
        ASSERT_EQ(disk.rename(directory.get(), "f", top.get(), "copy", 0), 0);
        ASSERT_EQ(disk.rename(top.get(), "copy", top.get(), "second", 0), 0) << "two names of one inode";
        ASSERT_EQ(disk.removeDirectory(top.get(), "d"), 0);
        EXPECT_EQ(disk.removeDirectory(top.get(), "nothing"), -ENOENT);
        ASSERT_EQ(disk.makeDirectory(outside.get(), "unseen", 0700), 0);
        ASSERT_EQ(disk.syncFileSystem(top.get()), 0);
        ASSERT_EQ(disk.complaint(), "");

        const DiskLog log = disk.log();
        for (const DiskModel model : {DiskModel::orderedJournal, DiskModel::unordered}) {
            const std::vector<PowerCutState> states =
                PowerCut(log, {.model = model}).statesAfter(log.operations.size());
            ASSERT_EQ(states.size(), 1U) << "everything is synced";
            const TemporaryDirectory built(parent);
            materialise(states[0].tree, built.path());
            EXPECT_EQ(readTree(built.path()).describe(), readTree(root.path(), {"run"}).describe());
        }
    }
}

// Goal: the recorder cannot be passed by. Method: changes around it, and a write that the kernel ends in the middle.
TEST(RecordingDiskTest, FindsWhatItWasNotTold) {
    const TemporaryDirectory root;
    const FileDescriptor top = openBelow(root.path());
    LinuxDisk linuxDisk;
    RecordingDisk disk(linuxDisk, root.path());
    disk.start();
    const FileDescriptor file(disk.createFile(top.get(), "f", 0600));

    struct rlimit before = {};
    ASSERT_EQ(::getrlimit(RLIMIT_FSIZE, &before), 0);
    const struct rlimit small = {.rlim_cur = 3, .rlim_max = before.rlim_max};
    const auto handler = std::signal(SIGXFSZ, SIG_IGN);
    ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &small), 0);
    EXPECT_EQ(disk.write(file.get(), Bytes{1, 2, 3, 4, 5}), -EFBIG);
    ASSERT_EQ(::setrlimit(RLIMIT_FSIZE, &before), 0);
    std::signal(SIGXFSZ, handler);
    EXPECT_EQ(disk.complaint(), "") << "the first three bytes are recorded";

    ASSERT_EQ(::mkdirat(top.get(), "unseen", 0700), 0);
    EXPECT_NE(disk.complaint(), "");
    ASSERT_EQ(::unlinkat(top.get(), "unseen", AT_REMOVEDIR), 0);
    EXPECT_EQ(disk.complaint(), "");
    ASSERT_EQ(::fchmod(file.get(), 0666), 0);
    EXPECT_NE(disk.complaint(), "");
}

} // namespace
} // namespace zor::support
