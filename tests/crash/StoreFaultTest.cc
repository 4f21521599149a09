// SPDX-License-Identifier: Apache-2.0
#include "crash/Scenarios.h"
#include "fs/Durability.h"
#include "support/FaultDisk.h"
#include "support/LongRun.h"
#include "support/PowerCut.h"
#include "support/ProcessResources.h"

namespace zor::support {
namespace {

struct FaultWorld {
    FaultWorld(FaultDisk& faultDisk, const std::string& parent, Home home) : disk(faultDisk), device(parent, home) {}
    /// A mounted home stands for file systems that keep no order, so that the calls for those meet their faults too.
    [[nodiscard]] fs::Durability::Probe probe() const {
        return device.home == Home::mounted ? noOrderAnywhere : journalEverywhere;
    }

    FaultDisk& disk;
    ProcessResources before;
    Device device;
};

std::unique_ptr<FaultWorld> makeWorld(const std::string& parent, Home home, const Scenario& scenario, FaultDisk& disk) {
    auto world = std::make_unique<FaultWorld>(disk, parent, home);
    // The setup of the boot has its own scenario; without it, the directories that operations make are missing.
    (void)world->device.marker.make();
    world->device.exchanges = scenario.exchanges;
    world->device.start(disk, world->probe());
    scenario.prepare(world->device);
    return world;
}

std::string judgeRunningDaemon(Device& device, const Scenario& scenario, const FaultOutcome& outcome) {
    const FileTree tree = readTree(device.root.path(), {"run"});
    if (const std::string complaint = scenario.withoutDamage(judgeStore(tree, Transients::judged).complaint);
        !complaint.empty())
        return "as the error left it: " + complaint;
    for (const auto& [id, inode] : tree.inodes)
        for (const auto& [name, entry] : inode.entries)
            if (outcome.fault.span == FaultSpan::once && fs::isWriteLeftover(name))
                return "one error left " + name;
    if (outcome.fault.span == FaultSpan::once && device.home == Home::onRoot) {
        if (std::string complaint = scenario.afterOneError ? scenario.afterOneError(device.root.path()) : "";
            !complaint.empty())
            return "after one error: " + complaint;
    }
    if (device.daemon->world.services().locks().identifiersInUse() != 0)
        return "an identifier is still locked";
    if (!scenario.goesOnAfterErrors)
        return "";
    // With a lock left behind this would never end.
    for (const Request& request : scenario.requests) {
        if (!device.create(request))
            return "the daemon does not go on: " + device.daemon->log();
    }
    scenario.act(device);
    return "";
}

std::string judge(FaultWorld& world, const Scenario& scenario, const FaultOutcome& outcome) {
    Device& device = world.device;
    if (!outcome.stopped && device.daemon) {
        if (std::string complaint = judgeRunningDaemon(device, scenario, outcome); !complaint.empty())
            return complaint;
    }
    device.daemon.reset();
    if (std::string leaked = world.before.leakedSince(); !leaked.empty())
        return "leaked: " + leaked;
    const Leftovers leftovers = outcome.stopped ? Leftovers::none : Leftovers::ofErrors;
    std::string complaint = scenario.withoutDamage(judgeAfterRestart(device.root.path(), device.marker, world.probe(),
                                                                     device.promised, scenario.requests, leftovers));
    if (complaint.empty() && scenario.also)
        complaint = scenario.also(device.root.path(), device.acted);
    return complaint;
}

void loopOverFaults(const std::string& parent, Home home, const Scenario& scenario, const Fault& fault) {
    platform::LinuxDisk linuxDisk;
    const LoopReport report = forEachFaultPoint(
        linuxDisk, fault, [&](FaultDisk& disk) { return makeWorld(parent, home, scenario, disk); },
        [&](const std::unique_ptr<FaultWorld>& world) { scenario.act(world->device); },
        [&](const std::unique_ptr<FaultWorld>& world, const FaultOutcome& outcome) {
            return judge(*world, scenario, outcome);
        });
    EXPECT_EQ(report.complaint, "");
    EXPECT_GT(report.examined, scenario.pointsMin) << "an operation without disk calls was tested";
}

const std::vector<Fault> faults = {
    {.kind = FaultKind::error, .error = EIO},
    {.kind = FaultKind::error, .error = EACCES},
    {.kind = FaultKind::error, .error = ENOSPC, .span = FaultSpan::fromThenOn},
    {.kind = FaultKind::stop},
};

// Goal: whatever call fails, and wherever the daemon ends, no container is half made under its final name, nothing
// acknowledged is lost, staging and death row are empty after the next launch, nothing is leaked, and the daemon goes
// on. Method: each operation with the fault at the first, second, ... call until a run meets none; the tree judged as
// it lies, then a launch over it.
class StoreFaultTest : public ::testing::TestWithParam<Scenario> {};

TEST_P(StoreFaultTest, StandsEveryFault) {
    for (const Fault& fault : faults)
        loopOverFaults("/dev/shm", Home::onRoot, GetParam(), fault);
}

// The same with the user's home on a file system of its own, where a move is a copy and a removal.
class HomeFaultTest : public ::testing::TestWithParam<Scenario> {};

TEST_P(HomeFaultTest, StandsEveryFaultBetweenFileSystems) {
    if (!test::MountedHome::canBe())
        GTEST_SKIP() << "skipped: only root may mount a home";
    for (const Fault& fault : faults) {
        if (fault.error != EACCES)
            loopOverFaults("/dev/shm", Home::mounted, GetParam(), fault);
    }
}

// The same on whatever file system holds temporary files, where a disk has other limits and answers than memory.
class DiskFaultTest : public ::testing::TestWithParam<Scenario> {};

TEST_P(DiskFaultTest, StandsEveryStop) {
    loopOverFaults("/var/tmp", Home::onRoot, GetParam(), {.kind = FaultKind::stop});
}

INSTANTIATE_TEST_SUITE_P(Store, StoreFaultTest, ::testing::ValuesIn(allScenarios()), scenarioName);
INSTANTIATE_TEST_SUITE_P(Disk, DiskFaultTest, ::testing::ValuesIn(homeScenarios({"replace"})), scenarioName);
// Those that have found faults of their own; each of the others takes as long for what these find too.
INSTANTIATE_TEST_SUITE_P(
    Home, HomeFaultTest,
    ::testing::ValuesIn(homeScenarios({"replace", "replace without exchange", "recovery of a replace"})), scenarioName);

void loopOverCuts(const Scenario& scenario, DiskModel model, Home home = Home::onRoot) {
    // Two file systems have the product of each one's states.
    const bool two = home == Home::mounted;
    const std::size_t singleChangesMax = (two ? 4 : 24) / (isLongRun() ? 1 : 2);
    const std::size_t randomStates = isLongRun() ? 8 : two ? 2 : 4;
    const fs::Durability::Probe probe = model == DiskModel::unordered ? noOrderAnywhere : journalEverywhere;
    platform::LinuxDisk linuxDisk;
    Device device("/dev/shm", home);
    device.exchanges = scenario.exchanges;
    RecordingDisk disk(linuxDisk, device.root.path(), {"run"});
    // From the first launch on: what it makes is not synced by itself.
    disk.start();
    device.start(disk, probe);
    scenario.prepare(device);
    const std::size_t promisedBefore = device.promised.size();
    disk.mark();
    const DiskLog before = disk.log();
    const ZORLocks* locks = &device.daemon->world.services().locks();
    // Nobody waits for the disk under the lock of all. Without order passes run in the test's only thread, where they
    // may.
    device.daemon->world.disk().before = [&](const DiskCallInfo& call) {
        const bool waits = call.call == DiskCall::sync || call.call == DiskCall::syncFileSystem;
        EXPECT_FALSE(waits && model == DiskModel::orderedJournal && locks->allAreHeldForWriting()) << call.describe();
    };
    scenario.act(device);
    disk.mark();
    ASSERT_EQ(disk.complaint(), "");
    device.daemon.reset();
    const DiskLog log = disk.log();
    ASSERT_GT(log.operations.size(), before.operations.size());

    const LoopReport report =
        forEachPowerCut(log,
                        {.model = model,
                         .randomStatesPerCut = randomStates,
                         .singleChangesMax = singleChangesMax,
                         .firstCut = before.operations.size()},
                        [&](const PowerCutState& state, const std::string& root) {
                            const bool acted = state.marksPassed > 1;
                            std::vector<Acknowledged> promised;
                            for (std::size_t i = 0; i < (acted ? device.promised.size() : promisedBefore); ++i) {
                                promised.push_back(device.promised[i]);
                                promised.back().path.replace(0, device.root.path().size(), root);
                            }
                            test::FlagBootMarker marker;
                            std::string complaint = scenario.withoutDamage(
                                judgeAfterRestart(root, marker, probe, promised, scenario.requests));
                            if (complaint.empty() && scenario.also)
                                complaint = scenario.also(root, acted);
                            return complaint;
                        });
    EXPECT_EQ(report.complaint, "");
    EXPECT_GT(scenario.callsPerStateMax * report.examined, log.operations.size() - before.operations.size());
}

// Goal: a power cut anywhere leaves no container half made under its final name and loses nothing acknowledged, on a
// file system that keeps order and on one that keeps none. Method: each operation recorded once; the states that a cut
// after each of its calls may leave are built, judged as they lie, and launched over.
class StorePowerCutTest : public ::testing::TestWithParam<Scenario> {};

TEST_P(StorePowerCutTest, StandsEveryCutWithAnOrderedJournal) {
    loopOverCuts(GetParam(), DiskModel::orderedJournal);
}

TEST_P(StorePowerCutTest, StandsEveryCutWithoutOrder) {
    loopOverCuts(GetParam(), DiskModel::unordered);
}

class HomePowerCutTest : public ::testing::TestWithParam<Scenario> {};

TEST_P(HomePowerCutTest, StandsEveryCutBetweenFileSystems) {
    if (!test::MountedHome::canBe())
        GTEST_SKIP() << "skipped: only root may mount a home";
    loopOverCuts(GetParam(), DiskModel::orderedJournal, Home::mounted);
    loopOverCuts(GetParam(), DiskModel::unordered, Home::mounted);
}

INSTANTIATE_TEST_SUITE_P(Store, StorePowerCutTest, ::testing::ValuesIn(allScenarios()), scenarioName);
INSTANTIATE_TEST_SUITE_P(
    Home, HomePowerCutTest,
    ::testing::ValuesIn(homeScenarios({"replace", "replace without exchange", "replace and deletion"})), scenarioName);

} // namespace
} // namespace zor::support
