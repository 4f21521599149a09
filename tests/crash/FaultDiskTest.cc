// SPDX-License-Identifier: Apache-2.0
#include "crash/Protocols.h"
#include "platform/linux/LinuxDisk.h"
#include "support/FaultLoop.h"
#include "support/FileTree.h"
#include "support/ProcessResources.h"

#include <gtest/gtest.h>
#include <memory>
#include <sys/eventfd.h>
#include <thread>

namespace zor::support {
namespace {

using platform::FileDescriptor;
using platform::LinuxDisk;

struct World {
    explicit World(FaultDisk& faultDisk) : disk(faultDisk), directory(openBelow(root.path())) {
        const FileDescriptor file(::openat(directory.get(), "f", O_RDWR | O_CREAT | O_CLOEXEC, newMode));
        EXPECT_EQ(::write(file.get(), oldContent.data(), oldContent.size()), static_cast<ssize_t>(oldContent.size()));
    }

    TemporaryDirectory root;
    FaultDisk& disk;
    FileDescriptor directory;
    int result = 0;
};

const std::vector<Step> sound = {Step::createTemporary, Step::writeNew, Step::syncFile, Step::renameOver,
                                 Step::syncDirectory};
const std::vector<Step> inPlace = {Step::createInPlace, Step::writeNew, Step::syncFile};

LoopReport replaceWithFaults(const Fault& fault, const std::vector<Step>& steps) {
    LinuxDisk linuxDisk;
    return forEachFaultPoint(
        linuxDisk, fault, [](FaultDisk& disk) { return std::make_unique<World>(disk); },
        [&](const std::unique_ptr<World>& world) {
            world->result = runSteps(world->disk, world->directory.get(), steps);
        },
        [](const std::unique_ptr<World>& world, const FaultOutcome& outcome) -> std::string {
            const FileTree tree = readTree(world->root.path());
            const Bytes& bytes = tree.inodes.at(tree.resolve("f")).content;
            const std::string content(bytes.begin(), bytes.end());
            if (content != oldContent && content != newContent)
                return "f holds \"" + content + "\"";
            if (!outcome.met && content != newContent)
                return "nothing failed, yet the old content is there";
            if (outcome.stopped || !outcome.met)
                return "";
            if (world->result != -outcome.fault.error)
                return "the error was not returned";
            const bool cleaned = tree.resolve(".t") == 0 || outcome.fault.span == FaultSpan::fromThenOn;
            return cleaned ? "" : ".t was left";
        });
}

// Goal: the loop meets each point once and a sound protocol stands all kinds, a wrong one none.
// Method: create, two halves of a write, two syncs and a rename are six points, and one run more meets none.
TEST(FaultDiskTest, LoopsOverEveryPoint) {
    const std::vector<Fault> faults = {
        {.kind = FaultKind::error, .error = EIO},
        {.kind = FaultKind::error, .error = ENOSPC, .span = FaultSpan::fromThenOn},
        {.kind = FaultKind::stop},
        {.kind = FaultKind::exit},
    };
    for (const Fault& fault : faults) {
        SCOPED_TRACE(fault.describe());
        const ProcessResources before;
        const LoopReport good = replaceWithFaults(fault, sound);
        EXPECT_EQ(good.complaint, "");
        EXPECT_EQ(good.examined, 7U);
        const LoopReport bad = replaceWithFaults(fault, inPlace);
        EXPECT_NE(bad.complaint.find("fault point 2 "), std::string::npos) << bad.complaint;
        EXPECT_EQ(before.leakedSince(), "");
    }
}

// Goal: a filter counts what it names alone. Method: only syncs fail.
TEST(FaultDiskTest, CountsWhatTheFilterTakes) {
    const Fault fault{.filter = [](const DiskCallInfo& info) { return info.call == DiskCall::sync; }};
    const LoopReport report = replaceWithFaults(fault, sound);
    EXPECT_EQ(report.complaint, "");
    EXPECT_EQ(report.examined, 3U);
}

// Goal: a stopped process changes nothing any more, whether its clean-up runs in a handler, a destructor or another
// thread. Method: each kind tries to remove a file after the stop.
TEST(FaultDiskTest, StaysStopped) {
    LinuxDisk linuxDisk;
    FaultDisk disk(linuxDisk);
    World world(disk);
    const int directory = world.directory.get();
    disk.arm({.point = 1, .kind = FaultKind::stop});
    bool sawStandardException = false;
    int insideDestructor = 0;
    try {
        struct CleanUp {
            FaultDisk& disk;
            int directory;
            int& result;
            ~CleanUp() { result = disk.unlinkFile(directory, "f"); }
        } const cleanUp{disk, directory, insideDestructor};
        try {
            disk.sync(directory);
        } catch (const std::exception&) {
            sawStandardException = true;
        } catch (...) {
            EXPECT_THROW(disk.unlinkFile(directory, "f"), ProcessStopped);
            throw;
        }
    } catch (const ProcessStopped&) {
    }
    EXPECT_FALSE(sawStandardException);
    EXPECT_EQ(insideDestructor, -EIO);
    std::thread([&] { EXPECT_THROW(disk.unlinkFile(directory, "f"), ProcessStopped); }).join();
    disk.disarm();
    EXPECT_THROW(disk.unlinkFile(directory, "f"), ProcessStopped) << "disarming raises no dead";
    EXPECT_NE(readTree(world.root.path()).resolve("f"), 0U);
}

// Goal: a leak is seen. Method: hold a descriptor and a thread.
TEST(ProcessResourcesTest, SeesLeaks) {
    const ProcessResources before;
    EXPECT_EQ(before.leakedSince(), "");
    FileDescriptor held(::open("/dev/null", O_RDONLY | O_CLOEXEC));
    EXPECT_NE(before.leakedSince().find("/dev/null"), std::string::npos);
    held.reset();
    const FileDescriptor waitEnd(::eventfd(0, EFD_CLOEXEC));
    const ProcessResources withEvent;
    std::thread waiting([&] {
        std::uint64_t value = 0;
        EXPECT_EQ(::read(waitEnd.get(), &value, sizeof value), 8);
    });
    EXPECT_NE(withEvent.leakedSince(), "");
    const std::uint64_t one = 1;
    EXPECT_EQ(::write(waitEnd.get(), &one, sizeof one), 8);
    waiting.join();
    EXPECT_EQ(withEvent.leakedSince(), "");
}

} // namespace
} // namespace zor::support
