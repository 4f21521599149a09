// SPDX-License-Identifier: Apache-2.0
// The files of the entitlement map and of the table of well-known containers: missing, damaged, foreign, or such that
// cannot be written.
#include "world/World.h"

#include <filesystem>
#include <gtest/gtest.h>

namespace zor::test {
namespace {

using plist::Array;
using plist::Dictionary;
using Strings = std::vector<std::string>;

const std::string aside = entitlementFile + ".unreadable";

ErrorCode save(World& world) {
    return codeOf(world.services().entitlements()._setEntitlementDictionaryValues({Dictionary{{"k", 1}}}, {"b"}));
}

// Goal: a file that cannot be believed is kept aside once, and known as lost. Method: all kinds; a second loss.
TEST(EntitlementMapping, AnUnreadableFileIsKeptAside) {
    const std::string good = binary(Dictionary{{"a", Dictionary{{"k", 1}}}});
    const std::function<void(World&)> rows[] = {
        [](World& world) { world.write(entitlementFile, "nonsense"); },
        [](World& world) { world.write(entitlementFile, binary(Array{})); },
        [](World& world) { world.write(entitlementFile, ""); },
        [&](World& world) { world.write(entitlementFile, good, 0666); },
        [&](World& world) {
            world.write("elsewhere", good);
            world.makeDirectories(libraryPath);
            world.link(world.path("elsewhere"), entitlementFile);
        },
        [](World& world) { world.makeDirectories(entitlementFile); },
    };
    for (const auto& make : rows) {
        SCOPED_TRACE(&make - rows);
        World world;
        make(world);
        const std::string was = world.item(entitlementFile);
        EXPECT_EQ(world.services().entitlements().entryCount(), 0U);
        EXPECT_EQ(world.item(aside), was);
        EXPECT_FALSE(world.exists(entitlementFile));
        ASSERT_EQ(save(world), ErrorCode::success);
        world.restart();
        EXPECT_EQ(world.services().entitlements().lostFile(), FileURL::file(world.path(aside)));
        EXPECT_TRUE(world.services().entitlements().entitlementsExistForIdentifier("b"));
    }
    World world;
    for (const char* loss : {"first loss", "second loss"}) {
        world.write(entitlementFile, loss);
        world.restart();
        world.load();
    }
    EXPECT_EQ(world.read(aside), "first loss");
    // Who accepts the first loss has not seen the second.
    std::filesystem::remove(world.path(aside));
    EXPECT_EQ(world.services().entitlements().lostFile(), FileURL::file(world.path(entitlementFile)));
    ASSERT_EQ(save(world), ErrorCode::success);
    EXPECT_EQ(world.read(aside), "second loss");
    std::filesystem::remove(world.path(aside));
    EXPECT_FALSE(world.services().entitlements().lostFile());
}

// Goal: a lost file that cannot be moved aside is never written over, and goes aside with the first save that can move
// it. Method: no move of it succeeds while the map is loaded and saved once.
TEST(EntitlementMapping, AnUnreadableFileThatCannotBeMoved) {
    World world;
    world.write(entitlementFile, "nonsense");
    world.disk().arm({.error = EIO, .span = support::FaultSpan::fromThenOn, .filter = [](const auto& call) {
                          return call.call == support::DiskCall::rename &&
                                 call.subject.find("unreadable") != std::string::npos;
                      }});
    ZOREntitlementMapping& mapping = world.services().entitlements();
    EXPECT_EQ(mapping.lostFile(), FileURL::file(world.path(entitlementFile)));
    EXPECT_EQ(save(world), ErrorCode::entitlementFileNotWritten);
    EXPECT_EQ(world.read(entitlementFile), "nonsense");
    EXPECT_TRUE(mapping.lostFile());
    world.disk().disarm();
    EXPECT_EQ(save(world), ErrorCode::success);
    EXPECT_EQ(world.read(aside), "nonsense");
    EXPECT_EQ(mapping.lostFile(), FileURL::file(world.path(aside)));
    world.restart();
    EXPECT_TRUE(world.services().entitlements().entitlementsExistForIdentifier("b"));
}

// Goal: the file's table stands for the built-in one, but for rows that lead elsewhere. Method: rows, then bad files.
TEST(Whitelist, TheTableFile) {
    World world;
    const std::string longest(255, 'n');
    const Dictionary rows{{"good", "name"},  {"longest", longest}, {"tooLong", longest + "n"},
                          {"twice", "name"}, {"slash", "a/b"},     {"up", ".."},
                          {"hidden", ".n"},  {"empty", ""},        {"number", 5}};
    world.write("etc/zorvane/wellknown.plist",
                binary(Dictionary{{"System", rows}, {"SystemGroup", Dictionary{{"systemgroup.x", "name"}}}}));
    const ZORWhitelist& table = world.services().whitelist();
    EXPECT_EQ(table.wellknownSystemContainers(), (Strings{"good", "longest"}));
    EXPECT_EQ(*table.wellknownSystemGroupContainerForId("systemgroup.x"), "name");
    EXPECT_EQ(world.log.take(3, "ZORWhitelist").size(), 7U);
    for (const bool writable : {false, true}) {
        world.write("etc/zorvane/wellknown.plist", writable ? binary(Dictionary{}) : "nonsense",
                    writable ? 0666 : 0644);
        world.restart();
        EXPECT_TRUE(world.services().whitelist().systemContainerIdIsWellknown("com.veltra.settingsd"));
    }
}

} // namespace
} // namespace zor::test
