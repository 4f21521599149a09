// SPDX-License-Identifier: Apache-2.0
#include "crash/Scenarios.h"
#include "support/FaultLoop.h"
#include "support/LongRun.h"
#include "support/ProcessResources.h"

#include <gtest/gtest.h>

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

std::unique_ptr<FaultWorld> makeWorld(const std::string& parent, Home home, const Scenario& scenario, FaultKind kind,
                                      FaultDisk& disk) {
    auto world = std::make_unique<FaultWorld>(disk, parent, home);
    // The setup of the boot has its own scenario; without it, the directories that operations make are missing.
    world->device.marker.make();
    world->device.start(disk, world->probe());
    scenario.prepare(world->device);
    // A child that ends has to have a daemon of its own.
    if (kind == FaultKind::exit)
        world->device.daemon.reset();
    return world;
}

void act(FaultWorld& world, const Scenario& scenario) {
    Device& device = world.device;
    if (!device.daemon)
        device.daemon = std::make_unique<StoreDaemon>(device.root.path(), device.marker, world.disk, world.probe());
    scenario.act(device);
}

std::string judgeRunningDaemon(Device& device, const Scenario& scenario, const FaultOutcome& outcome) {
    const StoreFindings findings = judgeStore(readTree(device.root.path(), {"run"}), Transients::judged);
    if (const std::string complaint = scenario.withoutDamage(findings.complaint); !complaint.empty())
        return "as the error left it: " + complaint;
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
    SCOPED_TRACE(fault.describe());
    platform::LinuxDisk linuxDisk;
    const LoopReport report = forEachFaultPoint(
        linuxDisk, fault, [&](FaultDisk& disk) { return makeWorld(parent, home, scenario, fault.kind, disk); },
        [&](const std::unique_ptr<FaultWorld>& world) { act(*world, scenario); },
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
    {.kind = FaultKind::exit},
};

// Goal: whatever call fails, and wherever the daemon ends, no container is half made under its final name, nothing
// acknowledged is lost, staging and death row are empty after the next launch, nothing is leaked, and the daemon goes
// on. Method: each operation with the fault at the first, second, ... call until a run meets none; the tree judged as
// it lies, then a launch over it.
class StoreFaultTest : public ::testing::TestWithParam<Scenario> {};

TEST_P(StoreFaultTest, StandsEveryFault) {
    for (const Fault& fault : faults)
        // What an end of the process leaves, a stop leaves too: one scenario shows that.
        if (fault.kind != FaultKind::exit || isLongRun() || GetParam().name == "replace")
            loopOverFaults("/dev/shm", Home::onRoot, GetParam(), fault);
}

// The same with the user's home on a file system of its own, where a move is a copy and a removal.
class HomeFaultTest : public ::testing::TestWithParam<Scenario> {};

TEST_P(HomeFaultTest, StandsEveryFaultBetweenFileSystems) {
    if (!test::MountedHome::canBe())
        GTEST_SKIP() << "skipped: only root may mount a home";
    for (const Fault& fault : faults) {
        if (fault.kind != FaultKind::exit && fault.error != EACCES)
            loopOverFaults("/dev/shm", Home::mounted, GetParam(), fault);
    }
}

// The same on whatever file system holds temporary files, where a disk has other limits and answers than memory.
class DiskFaultTest : public ::testing::TestWithParam<Scenario> {};

TEST_P(DiskFaultTest, StandsEveryStop) {
    loopOverFaults("/var/tmp", Home::onRoot, GetParam(), {.kind = FaultKind::stop});
}

INSTANTIATE_TEST_SUITE_P(Store, StoreFaultTest, ::testing::ValuesIn(allScenarios()), scenarioName);
INSTANTIATE_TEST_SUITE_P(Disk, DiskFaultTest, ::testing::ValuesIn(homeScenarios()), scenarioName);
INSTANTIATE_TEST_SUITE_P(Home, HomeFaultTest, ::testing::ValuesIn(homeScenarios()), scenarioName);

} // namespace
} // namespace zor::support
