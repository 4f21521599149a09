// SPDX-License-Identifier: Apache-2.0
#include "crash/Scenarios.h"
#include "support/LongRun.h"
#include "support/PowerCut.h"

#include <gtest/gtest.h>

namespace zor::support {
namespace {

void loopOverCuts(const Scenario& scenario, DiskModel model, Home home = Home::onRoot) {
    // Two file systems have the product of each one's states.
    const bool two = home == Home::mounted;
    const std::size_t singleChangesMax = (two ? 4 : 24) / (isLongRun() ? 1 : 2);
    const std::size_t randomStates = isLongRun() ? 8 : two ? 2 : 4;
    const fs::Durability::Probe probe = model == DiskModel::unordered ? noOrderAnywhere : journalEverywhere;
    platform::LinuxDisk linuxDisk;
    Device device("/dev/shm", home);
    RecordingDisk disk(linuxDisk, device.root.path(), {"run"});
    // From the first launch on: what it makes is not synced by itself.
    disk.start();
    device.start(disk, probe);
    scenario.prepare(device);
    const std::size_t promisedBefore = device.promised.size();
    disk.mark();
    const DiskLog before = disk.log();
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
INSTANTIATE_TEST_SUITE_P(Home, HomePowerCutTest, ::testing::ValuesIn(homeScenarios()), scenarioName);

} // namespace
} // namespace zor::support
