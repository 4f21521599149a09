// SPDX-License-Identifier: Apache-2.0
// The entitlement map and the table of well-known containers: queries, what a change writes and when, files that are
// missing, damaged, foreign or cannot be written.
#include "world/World.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

namespace zor::test {
namespace {

using plist::Array;
using plist::Dictionary;
using Strings = std::vector<std::string>;

const std::string aside = entitlementFile + ".unreadable";
const char* const apps = "com.veltra.security.application-groups";
const char* const groups = "com.veltra.security.system-groups";
const char* const groupContainers = "com.veltra.security.system-group-containers";

Result<void> set(World& world, const std::vector<Dictionary>& values, const Strings& identifiers) {
    return world.services().entitlements()._setEntitlementDictionaryValues(values, identifiers);
}

TEST(EntitlementMapping, AMissingFileIsAnEmptyMap) {
    World world;
    EXPECT_EQ(world.services().entitlements().entryCount(), 0U);
    EXPECT_FALSE(world.exists(entitlementFile));
    EXPECT_FALSE(world.services().entitlements().lostFile());
}

/// "a b" of a list, "-" of none.
std::string shown(const std::optional<Strings>& list) {
    std::string text;
    for (const std::string& one : list.value_or(Strings{"-"}))
        text += (text.empty() ? "" : " ") + one;
    return text;
}

// Goal: what each form of a group entitlement means. Method: one identifier a row.
TEST(EntitlementMapping, Queries) {
    struct Row {
        const char* identifier;
        Dictionary entitlements;
        const char* appGroups;
        const char* systemGroups;
    };
    const std::pair<std::string, plist::Value> c{groupContainers, "systemgroup.c"};
    const Row rows[] = {
        {"none", {{"other", 1}}, "-", "-"},
        {"one", {{apps, "g"}, {groups, "systemgroup.a"}}, "g", "systemgroup.a"},
        {"many", {{apps, Array{"b", "a", "b"}}}, "a b", "-"},
        {"manySystem", {{groups, Array{"systemgroup.b", "systemgroup.a"}}}, "-", "systemgroup.a systemgroup.b"},
        {"number", {{apps, Array{"a", 1}}}, "-", "-"},
        {"wrong", {{apps, true}}, "-", "-"},
        {"prefix", {{groups, Array{"systemgroup.a", "b"}}}, "-", "systemgroup.a"},
        {"alternative", {c}, "-", "systemgroup.c"},
        {"both", {{groups, "systemgroup.a"}, c}, "-", "systemgroup.a"},
        {"emptyFirst", {{groups, Array{}}, c}, "-", "systemgroup.c"},
        {"unprefixedFirst", {{groups, "x"}, c}, "-", ""},
    };
    World world;
    Dictionary map;
    for (const Row& row : rows)
        map.set(row.identifier, row.entitlements);
    map.set("notADictionary", "text");
    world.write(entitlementFile, binary(map));
    ZOREntitlementMapping& mapping = world.services().entitlements();
    for (const Row& row : rows) {
        SCOPED_TRACE(row.identifier);
        EXPECT_EQ(shown(mapping.appGroupIdentifiersForIdentifier(row.identifier)), row.appGroups);
        EXPECT_EQ(shown(mapping.systemGroupIdentifiersForIdentifier(row.identifier)), row.systemGroups);
    }
    for (const char* identifier : {"notADictionary", "missing"})
        EXPECT_FALSE(mapping.appGroupIdentifiersForIdentifier(identifier));
}

// Goal: a change is written once, whole, and only when there is one. Method: renames counted; a new daemon.
TEST(EntitlementMapping, SettingWritesOnceWhenSomethingChanges) {
    World world;
    std::size_t renames = 0;
    const auto count = [&](const support::DiskCallInfo& call) {
        renames += call.call == support::DiskCall::rename && call.subject.ends_with(" -> zor_entitlements.plist");
        return false;
    };
    const Dictionary a{{apps, Array{"g"}}};
    const Dictionary b{{"k", 1}};
    ASSERT_TRUE(set(world, {a, b}, {"a", "b"}));
    world.disk().arm({.filter = count});
    EXPECT_TRUE(set(world, {a, b, Dictionary{}}, {"a", "b", "never there"}));
    EXPECT_TRUE(set(world, {}, {}));
    EXPECT_EQ(renames, 0U);
    EXPECT_TRUE(set(world, {Dictionary{}, a, b}, {"a", "b", "c"}));
    world.disk().disarm();
    EXPECT_EQ(renames, 1U);
    world.restart();
    EXPECT_EQ(world.services().entitlements().entitlementMappingDict(), (Dictionary{{"b", a}, {"c", b}}));
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
