// SPDX-License-Identifier: Apache-2.0
// The files of the entitlement map and of the table of well-known containers: missing, damaged, foreign, or such that
// cannot be written.
#include "world/World.h"

#include <gtest/gtest.h>
#include <unistd.h>

namespace zor::test {
namespace {

using plist::Array;
using plist::Dictionary;
using Strings = std::vector<std::string>;

const std::string aside = entitlementFile + ".unreadable";

Result<void> set(World& world, const std::vector<Dictionary>& values, const Strings& identifiers) {
    return world.services().entitlements()._setEntitlementDictionaryValues(values, identifiers);
}

// Goal: a file that cannot be believed is kept aside once, and known as lost. Method: all kinds; a second loss.
TEST(EntitlementMapping, AnUnreadableFileIsKeptAside) {
    const std::string good = binary(Dictionary{{"a", Dictionary{{"k", 1}}}});
    const std::pair<const char*, std::function<void(World&)>> rows[] = {
        {"damaged", [](World& world) { world.write(entitlementFile, "nonsense"); }},
        {"array", [](World& world) { world.write(entitlementFile, binary(Array{})); }},
        {"empty", [](World& world) { world.write(entitlementFile, ""); }},
        {"writable by others", [&](World& world) { world.write(entitlementFile, good, 0666); }},
        {"link",
         [&](World& world) {
             world.write("elsewhere", good);
             world.makeDirectories(libraryPath);
             ASSERT_EQ(::symlink(world.path("elsewhere").c_str(), world.path(entitlementFile).c_str()), 0);
         }},
        {"directory", [](World& world) { world.makeDirectories(entitlementFile); }},
    };
    for (const auto& [name, make] : rows) {
        SCOPED_TRACE(name);
        World world;
        make(world);
        const std::string was = world.item(entitlementFile);
        ZOREntitlementMapping& mapping = world.services().entitlements();
        EXPECT_EQ(mapping.entryCount(), 0U);
        EXPECT_FALSE(world.exists(entitlementFile));
        EXPECT_EQ(world.item(aside), was);
        EXPECT_EQ(mapping.lostFile(), FileURL::file(world.path(aside)));
        ASSERT_TRUE(set(world, {Dictionary{{"k", 1}}}, {"b"}));
        EXPECT_TRUE(mapping.lostFile());
        world.restart();
        EXPECT_TRUE(world.services().entitlements().lostFile());
        EXPECT_TRUE(world.services().entitlements().entitlementsExistForIdentifier("b"));
    }
    World world;
    for (const char* loss : {"first loss", "second loss"}) {
        world.write(entitlementFile, loss);
        world.restart();
        world.load();
    }
    EXPECT_EQ(world.read(aside), "first loss");
    EXPECT_EQ(world.read(entitlementFile), "second loss");
    // Who accepts the first loss has not seen the second.
    ASSERT_EQ(::unlink(world.path(aside).c_str()), 0);
    EXPECT_EQ(world.services().entitlements().lostFile(), FileURL::file(world.path(entitlementFile)));
    ASSERT_TRUE(set(world, {Dictionary{{"k", 1}}}, {"b"}));
    EXPECT_EQ(world.read(aside), "second loss");
    ASSERT_EQ(::unlink(world.path(aside).c_str()), 0);
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
    const auto save = [&] { return codeOf(set(world, {Dictionary{{"k", 1}}}, {"b"})); };
    ZOREntitlementMapping& mapping = world.services().entitlements();
    EXPECT_EQ(mapping.lostFile(), FileURL::file(world.path(entitlementFile)));
    EXPECT_EQ(save(), ErrorCode::entitlementFileNotWritten);
    EXPECT_EQ(world.read(entitlementFile), "nonsense");
    EXPECT_TRUE(mapping.lostFile());
    world.disk().disarm();
    EXPECT_EQ(save(), ErrorCode::success);
    EXPECT_EQ(world.read(aside), "nonsense");
    EXPECT_EQ(mapping.lostFile(), FileURL::file(world.path(aside)));
    world.restart();
    EXPECT_TRUE(world.services().entitlements().entitlementsExistForIdentifier("b"));
}

// Goal: the file's table stands for the built-in one, but for rows that lead elsewhere. Method: rows, then bad files.
TEST(Whitelist, TheTableFile) {
    World world;
    const std::string longest(255, 'n');
    world.write("etc/zorvane/wellknown.plist",
                binary(Dictionary{{"System", Dictionary{{"good", "name"},
                                                        {"longest", longest},
                                                        {"tooLong", longest + "n"},
                                                        {"twice", "name"},
                                                        {"slash", "a/b"},
                                                        {"up", ".."},
                                                        {"hidden", ".name"},
                                                        {"empty", ""},
                                                        {"number", 5}}},
                                  {"SystemGroup", Dictionary{{"systemgroup.x", "name"}}}}));
    const ZORWhitelist& table = world.services().whitelist();
    EXPECT_EQ(table.wellknownSystemContainers(), (Strings{"good", "longest"}));
    EXPECT_EQ(table.wellknownSystemGroupContainers(), Strings{"systemgroup.x"});
    EXPECT_EQ(*table.wellknownSystemGroupContainerForId("systemgroup.x"), "name");
    EXPECT_FALSE(table.systemContainerIdIsWellknown("com.veltra.settingsd"));
    EXPECT_EQ(world.log.take(3, "ZORWhitelist").size(), 7U);
    for (const bool writable : {false, true}) {
        world.write("etc/zorvane/wellknown.plist", writable ? binary(Dictionary{}) : "nonsense",
                    writable ? 0666 : 0644);
        world.restart();
        EXPECT_TRUE(world.services().whitelist().systemContainerIdIsWellknown("com.veltra.settingsd"));
        const auto said = world.log.take(3, "forSystem");
        ASSERT_EQ(said.size(), 1U);
        EXPECT_TRUE(said[0].starts_with("The table of well-known containers is not used: ")) << said[0];
    }
}

} // namespace
} // namespace zor::test
