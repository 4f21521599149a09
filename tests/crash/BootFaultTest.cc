// SPDX-License-Identifier: Apache-2.0
// The first launch of a boot over a device that an older system left, with each of its calls failing, the daemon ending
// at each, and the power going after each.
#include "crash/Scenarios.h"
#include "store/ZOREntitlementMapping.h"
#include "support/FaultDisk.h"
#include "support/LongRun.h"
#include "support/PowerCut.h"
#include "support/ProcessResources.h"

namespace zor::support {
namespace {

constexpr const char* bundleUuid = "11111111-0000-4000-8000-000000000000";
constexpr const char* wellknownUuid = "22222222-0000-4000-8000-000000000000";
constexpr const char* dataUuid = "33333333-0000-4000-8000-000000000000";
constexpr const char* unentitledUuid = "44444444-0000-4000-8000-000000000000";
const std::string systemPlace = std::string(test::sharedPath) + "/Data/System";

/// A container as an older system left it, with a file that tells it from others.
void put(const test::World& world, const std::string& path, const plist::Dictionary& metadata,
         const std::vector<const char*>& inside = {}, mode_t insideMode = 0755) {
    world.putContainer(path, metadata);
    for (const char* directory : inside)
        world.makeDirectories(path + "/" + directory, {}, insideMode);
    world.write(path + "/content", *metadata.string("ZORMetadataIdentifier"));
    struct stat top{};
    must(::stat(world.path(path).c_str(), &top) == 0 &&
             ::lchown(world.path(path + "/content").c_str(), top.st_uid, top.st_gid) == 0,
         "no content");
}

struct OldDevice {
    explicit OldDevice(platform::Disk& ofTheBoot, Home home = Home::onRoot)
        : disk(ofTheBoot), device("/dev/shm", home) {
        (void)device.marker.make();
        device.start(disk, journalEverywhere);
        test::World& world = device.daemon->world;
        must(world.entitle("com.veltra.settingsd", entitlements({}, {}, true)) == ErrorCode::success,
             "no entitlements");
        const std::vector<const char*> inData = {"Documents", "Library", "Library/Caches", "Library/Preferences",
                                                 "tmp"};
        plist::Dictionary data = test::metadataOf(2, mobileUser, "com.example.data", dataUuid);
        data.set("ZORMetadataInfo",
                 plist::Dictionary{{"com.veltra.Brevance.GroupContainerIDs", plist::Array{"group.old"}}});
        put(world, std::string(test::mobileContainers) + "/Bundle/Application/" + bundleUuid,
            test::metadataOf(1, mobileUser, "com.example.bundle", bundleUuid));
        put(world, test::applications + "/" + dataUuid, data, inData);
        put(world, test::applications + "/Junk", test::metadataOf(2, mobileUser, "junk"), inData);
        for (const auto& [uuid, identifier] :
             {std::pair(wellknownUuid, "com.veltra.settingsd"), std::pair(unentitledUuid, "com.example.unentitled")})
            put(world, systemPlace + "/" + uuid, test::metadataOf(12, systemUser, identifier, uuid), inData, 0777);
        device.daemon.reset();
        device.marker.forget();
    }

    platform::Disk& disk;
    ProcessResources before;
    Device device;
};

std::uint64_t changesOf(StoreDaemon& daemon) {
    std::uint64_t changes = 0;
    for (const auto& pass : daemon.world.services().store().setup.passes())
        changes += pass.changed;
    return changes;
}

/// Judges what the old device must have become. A bundle whose owner could not be changed for once stays as it is, in
/// place and whole: the migration is not made again for its sake.
enum class Bundle { known, inPlace };
std::string judgeMigrated(const std::string& root, StoreDaemon& daemon, Bundle expected) {
    const TestRoot at("", root);
    if (at.read("private/var/containers/Bundle/Application/" + std::string(bundleUuid) + "/content") !=
            "com.example.bundle" ||
        at.exists(std::string(test::mobileContainers) + "/Bundle"))
        return "the bundle is not where it belongs";
    if (at.names(systemPlace) != std::vector<std::string>{"com.veltra.settingsd"} ||
        at.read(systemPlace + "/com.veltra.settingsd/content") != "com.veltra.settingsd")
        return "system containers are not what they have to be";
    if (at.exists(test::applications + "/Junk"))
        return "an orphan is still there";
    const auto groups = daemon.entitlements().appGroupIdentifiersForIdentifier("com.example.data");
    if (!groups || *groups != std::vector<std::string>{"group.old"})
        return "the group identifiers are lost";
    std::vector<Request> known = {{"com.example.data", ContainerClass::dataApplication, 501},
                                  {"com.veltra.settingsd", ContainerClass::dataSystem, 499}};
    if (expected == Bundle::known)
        known.push_back({"com.example.bundle", ContainerClass::bundleApplication, 33});
    for (const Request& request : known)
        if (!daemon.lookUp(request).acknowledged)
            return request.identifier + " is not found";
    return expected == Bundle::known ? judgeStore(readTree(root, {"run"}), Transients::judged).complaint : "";
}

/// Only one error that hits the bundle's owner may leave that as it was; then the migration counts as done beside it.
Bundle expectationAfter(const OldDevice& old, const FaultOutcome& outcome) {
    const std::string var = old.device.root.path() + "/private/var";
    const bool done = test::isThere(var + "/root/Library/Zorvane/zor_bundle_migration_complete.plist");
    const std::string place = var + "/containers/Bundle/Application/" + bundleUuid;
    struct stat status{};
    const bool asItWas = ::lstat(place.c_str(), &status) == 0 && status.st_uid == mobileUser;
    const bool oneError = !outcome.stopped && outcome.fault.span == FaultSpan::once;
    return done && asItWas && oneError ? Bundle::inPlace : Bundle::known;
}

/// Judges a boot that finishes the migration, and one that finds nothing to do.
std::string judgeNextBoots(const std::string& root, Bundle expected) {
    platform::LinuxDisk disk{platform::Syncs::off};
    test::FlagBootMarker marker;
    for (const bool isLast : {false, true}) {
        marker.forget();
        StoreDaemon daemon(root, marker, disk, journalEverywhere);
        daemon.launch();
        if (std::string complaint = judgeMigrated(root, daemon, expected); !complaint.empty())
            return "after the next boot: " + complaint + daemon.log();
        // The transient directories, two of the system's and one of the user's, go at each boot.
        constexpr std::uint64_t transientDirectories = 3;
        if (isLast && changesOf(daemon) != transientDirectories)
            return "the boot after it found something to do: " + daemon.log();
    }
    return "";
}

std::string judge(OldDevice& old, const FaultOutcome& outcome) {
    const Bundle expected = expectationAfter(old, outcome);
    Device& device = old.device;
    device.daemon.reset();
    if (std::string leaked = old.before.leakedSince(); !leaked.empty())
        return "leaked: " + leaked;
    return judgeNextBoots(device.root.path(), expected);
}

// Goal: whatever call of a boot's setup fails, and wherever the daemon ends in it, the next boot brings an older
// system's containers to their places, loses none, and the one after it has nothing left to do. Method: one of each
// kind, and the fault at the first, second, ... call of the first boot until it meets none.
TEST(BootFaultTest, TheNextBootFinishesIt) {
    for (const Fault& fault : {Fault{.kind = FaultKind::error, .error = EIO},
                               Fault{.kind = FaultKind::error, .error = ENOSPC, .span = FaultSpan::fromThenOn},
                               Fault{.kind = FaultKind::stop}}) {
        platform::LinuxDisk linuxDisk;
        const LoopReport report = forEachFaultPoint(
            linuxDisk, fault, [](FaultDisk& disk) { return std::make_unique<OldDevice>(disk); },
            [](const std::unique_ptr<OldDevice>& old) { old->device.start(old->disk, journalEverywhere); },
            [](const std::unique_ptr<OldDevice>& old, const FaultOutcome& outcome) { return judge(*old, outcome); });
        EXPECT_EQ(report.complaint, "");
        EXPECT_GT(report.examined, 30U);
    }
}

struct FileSystemOfTheBoot {
    std::string name;
    DiskModel model;
    Home home = Home::onRoot;
};

class BootPowerCutTest : public ::testing::TestWithParam<FileSystemOfTheBoot> {};

// Goal: the same wherever the power goes in that boot, on a file system that keeps order, on one that keeps none, and
// between two. Method: the boot recorded once; each state that a cut after one of its calls may leave is booted twice.
TEST_P(BootPowerCutTest, TheNextBootFinishesIt) {
    const auto& [name, model, home] = GetParam();
    if (home == Home::mounted && !test::MountedHome::canBe())
        GTEST_SKIP() << "needs root";
    platform::LinuxDisk linuxDisk;
    OldDevice old(linuxDisk, home);
    Device& device = old.device;
    RecordingDisk disk(linuxDisk, device.root.path(), {"run"});
    disk.start();
    device.start(disk, model == DiskModel::unordered ? noOrderAnywhere : journalEverywhere);
    ASSERT_EQ(judgeMigrated(device.root.path(), *device.daemon, Bundle::known), "");
    device.daemon.reset();
    ASSERT_EQ(disk.complaint(), "");
    const LoopReport report = forEachPowerCut(
        disk.log(),
        {.model = model, .randomStatesPerCut = isLongRun() ? 8U : 1U, .singleChangesMax = isLongRun() ? 24U : 4U},
        [](const PowerCutState&, const std::string& root) { return judgeNextBoots(root, Bundle::known); });
    EXPECT_EQ(report.complaint, "");
    EXPECT_GT(report.examined, 30U);
}

INSTANTIATE_TEST_SUITE_P(Boot, BootPowerCutTest,
                         ::testing::Values(FileSystemOfTheBoot{"ordered", DiskModel::orderedJournal},
                                           FileSystemOfTheBoot{"unordered", DiskModel::unordered},
                                           FileSystemOfTheBoot{"between_two", DiskModel::orderedJournal,
                                                               Home::mounted}),
                         [](const auto& row) { return row.param.name; });

} // namespace
} // namespace zor::support
