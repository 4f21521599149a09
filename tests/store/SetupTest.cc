// SPDX-License-Identifier: Apache-2.0
// The setup of a launch and of a boot: what counts as orphaned, what is swept, who is skipped; and the sandbox
// mappings.
#include "world/World.h"

#include <gtest/gtest.h>
#include <new>

namespace zor::test {
namespace {

const std::string shared = sharedPath;
constexpr const char* goodUuid = "11111111-0000-4000-8000-000000000000";
constexpr const char* bareUuid = "22222222-0000-4000-8000-000000000000";
constexpr const char* cleanup = "_cleanupOrphanedDataForUser";

// Goal: an entry is kept or goes by its name and metadata file alone. Method: a table judged after one boot.
TEST(Setup, Orphans) {
    World world;
    world.write(
        "etc/zorvane/wellknown.plist",
        binary(plist::Dictionary{{"System", plist::Dictionary{{"com.veltra.settingsd", "com.veltra.settingsd"},
                                                              {"com.veltra.other", "short-name"}}},
                                 {"SystemGroup", plist::Dictionary{{"systemgroup.com.veltra.fonts", "fonts"}}}}));
    struct Row {
        std::string directory;
        const char* name;
        std::string file; // "" when it is missing
        bool stays;
    };
    const std::string good = binary(metadataOf(2, mobile, "a"));
    const std::string system = shared + "/Data/System";
    const std::string group = shared + "/Shared/SystemGroup";
    const std::string secondsGroups = "private/var/second/Containers/Shared/AppGroup";
    const Row rows[] = {
        {applications, goodUuid, good, true},
        {applications, "abcdef00-0000-4000-8000-00000000000a", good, true},
        {applications, "33333333-0000-4000-8000-000000000000", "invalid", true},
        {applications, bareUuid, "", false},
        {applications, "Junk", good, false},
        {applications, "com.veltra.settingsd", good, false},
        {applications, ".hidden", "", true},
        {secondsGroups, bareUuid, "", false},
        {shared + "/Bundle/Framework", goodUuid, good, true},
        {shared + "/Bundle/Framework", "fonts", good, false},
        {system, "com.veltra.settingsd", good, true},
        {system, "short-name", good, true},
        {system, "com.veltra.other", good, true}, // an identifier of the table
        {system, "fonts", good, false},
        {system, "com.veltra.Settingsd", good, false},
        {group, "fonts", good, true},
        {group, "systemgroup.com.veltra.fonts", good, true},
        {group, "short-name", good, false},
        {group, "com.veltra.settingsd", "", false},
    };
    for (const Row& row : rows) {
        const std::string path = row.directory + "/" + row.name;
        world.makeDirectories(path);
        if (!row.file.empty())
            world.write(path + "/" + names::metadataFile, row.file);
    }
    const std::string fileNamed = applications + "/44444444-0000-4000-8000-000000000000";
    world.write(fileNamed, "a file with a good name");
    // Hidden items of moves across file systems lie beside what is moved, and beside where that goes.
    const std::string parents[] = {applications,
                                   shared,
                                   shared + "/Bundle",
                                   mobileContainers,
                                   mobileCaches,
                                   cachesPath,
                                   "private/var/brevad/Library/Caches"};
    for (const std::string& parent : parents)
        world.makeDirectories(parent + "/.zorvaned-copy-abcdef");
    world.daemonsClient().rebootContainerManagerSetup();
    std::multiset<std::string> gone = {"Temp", "Temp", "Temp", "com.veltra.zorvaned"};
    for (std::size_t i = 0; i < std::size(parents); ++i)
        gone.insert(".zorvaned-copy-abcdef");
    for (const Row& row : rows) {
        EXPECT_EQ(world.exists(row.directory + "/" + row.name), row.stays) << row.directory << "/" << row.name;
        if (!row.stays)
            gone.insert(row.name);
    }
    EXPECT_TRUE(world.exists(fileNamed));
    const auto dying = world.deathRow();
    EXPECT_EQ(std::multiset<std::string>(dying.begin(), dying.end()), gone);
}

// Goal: a table of well-known names that cannot be read whole costs no container, and moves none; one that says less
// than it did does. Method: bad files, a boot over a name that only the file can give; a boot with a good one.
TEST(Setup, ATableThatCannotBeReadDeletesNothing) {
    const std::string system = shared + "/Data/System";
    const std::string other = "com.veltra.other";
    const std::string settings = "com.veltra.settingsd";
    const auto naming = [](plist::Value names) { return binary(plist::Dictionary{{"System", std::move(names)}}); };
    const std::tuple<const char*, std::string, mode_t> rows[] = {
        {"nonsense", "x", 0644},
        {"writable by others", naming(plist::Dictionary{{other, "short-name"}}), 0664},
        {"a row", naming(plist::Dictionary{{other, "short/name"}}), 0644},
        {"no dictionary", naming(plist::Array{other}), 0644},
    };
    for (const auto& [name, bytes, mode] : rows) {
        SCOPED_TRACE(name);
        World world;
        for (const std::string& owner : {other, settings})
            ASSERT_EQ(world.entitle(owner, plist::Dictionary{{std::string(entitlementKeys::systemContainer), true}}),
                      ErrorCode::success);
        world.putContainer(system + "/short-name", metadataOf(12, 499, other, bareUuid));
        world.putContainer(system + "/" + goodUuid, metadataOf(12, 499, settings, goodUuid));
        const auto boot = [&](const std::string& table, mode_t tableMode) {
            world.write("etc/zorvane/wellknown.plist", table, tableMode);
            world.reboot();
        };
        boot(bytes, mode);
        EXPECT_EQ(world.names(system), (std::vector<std::string>{goodUuid, "short-name"}));
        EXPECT_EQ(world.complaints(cleanup).size(), 1U);
        boot(naming(plist::Dictionary{{settings, "settings"}}), 0644);
        EXPECT_EQ(world.names(system), std::vector<std::string>{"settings"});
    }
}

// Goal: a pass that fails ends alone. Method: memory runs out once.
TEST(Setup, EndsWithOnePass) {
    World world;
    bool thrown = false;
    world.load();
    world.makeDirectories(applications + "/Junk");
    world.disk().arm({.filter = [&](const support::DiskCallInfo& call) -> bool {
        if (thrown || call.call != support::DiskCall::rename)
            return false;
        thrown = true;
        throw std::bad_alloc();
    }});
    world.boot();
    world.disk().disarm();
    EXPECT_EQ(
        std::ranges::count_if(world.services().store().setup.passes(), [](const auto& pass) { return pass.failed; }),
        1);
    EXPECT_FALSE(world.exists(applications + "/Junk"));
}

} // namespace
} // namespace zor::test
