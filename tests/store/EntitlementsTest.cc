// SPDX-License-Identifier: Apache-2.0
// The entitlement map and the table of well-known containers: queries, what a change writes and when, files that are
// missing, damaged, foreign or cannot be written.
#include "world/World.h"

#include <atomic>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

namespace zor::test {
namespace {

using plist::Array;
using plist::Dictionary;
using support::hasLine;
using support::LogLine;
using Strings = std::vector<std::string>;

const std::string file = std::string(libraryPath) + "/zor_entitlements.plist";
const std::string aside = file + ".unreadable";
const char* const apps = "com.veltra.security.application-groups";
const char* const groups = "com.veltra.security.system-groups";
const char* const groupContainers = "com.veltra.security.system-group-containers";

std::string missingMessage(const World& world) {
    return "Failed to read entitlement mapping file at " + world.path(file) + ".  It may not exist yet";
}

TEST(EntitlementMapping, AMissingFileIsAnEmptyMap) {
    World world;
    EXPECT_EQ(world.services().entitlements().entryCount(), 0U);
    EXPECT_EQ(world.log.take(), (std::vector<LogLine>{{3, "_readEntitlementMappingFromDisk", missingMessage(world)}}));
    EXPECT_FALSE(world.exists(file));
    EXPECT_FALSE(world.services().entitlements().lostFile());
    ASSERT_TRUE(world.services().entitlements()._setEntitlementDictionaryValues({Dictionary{{"k", true}}}, {"a"}));
    EXPECT_TRUE(world.item(file).starts_with("file 0644"));
    EXPECT_TRUE(world.read(file).starts_with("bplist00"));
}

// Goal: what each entitlement value means, and what is said of those that mean nothing. Method: one identifier a row,
// in a file that a daemon reads.
TEST(EntitlementMapping, Queries) {
    struct Row {
        const char* identifier;
        Dictionary entitlements;
        std::optional<Strings> appGroups;
        std::optional<Strings> systemGroups;
        Strings said;
    };
    const std::string noString = " contains non-string values; ignoring.";
    const std::string noType = " does not contain supported types; ignoring.";
    const std::string noPrefix = " does not have proper prefix, ignoring.";
    const Row rows[] = {
        {"none", {{"other", 1}}, {}, {}, {}},
        {"one", {{apps, "g"}, {groups, "systemgroup.a"}}, Strings{"g"}, Strings{"systemgroup.a"}, {}},
        {"many",
         {{apps, Array{"b", "a", "b"}}, {groups, Array{"systemgroup.b", "systemgroup.a", "systemgroup.b"}}},
         Strings{"a", "b"},
         Strings{"systemgroup.a", "systemgroup.b"},
         {}},
        {"empty", {{apps, Array{}}, {groups, Array{}}}, Strings{}, {}, {}},
        {"number", {{apps, Array{"a", 1}}}, {}, {}, {std::string("Entitlement ") + apps + " for number" + noString}},
        {"wrong",
         {{apps, true}, {groups, Dictionary{}}},
         {},
         {},
         {std::string("Entitlement ") + apps + " for wrong" + noType,
          std::string("Entitlement ") + groups + " for wrong" + noType}},
        {"prefix",
         {{groups, Array{"systemgroup.a", "b", "systemgroup"}}},
         {},
         Strings{"systemgroup.a"},
         {"System group ID b" + noPrefix, "System group ID systemgroup" + noPrefix}},
        {"alternative", {{groupContainers, "systemgroup.c"}}, {}, Strings{"systemgroup.c"}, {}},
        {"both", {{groups, "systemgroup.a"}, {groupContainers, "systemgroup.c"}}, {}, Strings{"systemgroup.a"}, {}},
        {"emptyFirst", {{groups, Array{}}, {groupContainers, "systemgroup.c"}}, {}, Strings{"systemgroup.c"}, {}},
        {"badFirst",
         {{groups, 1}, {groupContainers, "systemgroup.c"}},
         {},
         Strings{"systemgroup.c"},
         {std::string("Entitlement ") + groups + " for badFirst" + noType}},
        {"unprefixedFirst",
         {{groups, "x"}, {groupContainers, "systemgroup.c"}},
         {},
         Strings{},
         {"System group ID x" + noPrefix}},
    };
    World world;
    Dictionary map;
    for (const Row& row : rows)
        map.set(row.identifier, row.entitlements);
    map.set("container", Dictionary{{"com.veltra.security.system-container", true}});
    map.set("noContainer", Dictionary{{"com.veltra.security.system-container", 1}});
    map.set("notADictionary", "text");
    map.set("com.veltra.Zorvane.EntitlementsRegisteredByCaller",
            Dictionary{{"byCaller", true}, {"notByCaller", false}, {"number", 1}});
    world.write(file, binary(map));
    ZOREntitlementMapping& mapping = world.services().entitlements();
    EXPECT_TRUE(world.log.take().empty());
    for (const Row& row : rows) {
        SCOPED_TRACE(row.identifier);
        EXPECT_TRUE(mapping.entitlementsExistForIdentifier(row.identifier));
        EXPECT_EQ(mapping.appGroupIdentifiersForIdentifier(row.identifier), row.appGroups);
        // An empty first list and no second key: nothing, or an empty list, to which callers do the same.
        const auto systemGroups = mapping.systemGroupIdentifiersForIdentifier(row.identifier);
        if (row.systemGroups || (systemGroups && !systemGroups->empty())) {
            EXPECT_EQ(systemGroups, row.systemGroups);
        }
        Strings said;
        for (const LogLine& line : world.log.take()) {
            EXPECT_EQ(line.level, 3);
            said.push_back(line.message);
        }
        EXPECT_EQ(said, row.said);
    }
    EXPECT_TRUE(mapping.identifierHasSystemContainer("container"));
    EXPECT_FALSE(mapping.identifierHasSystemContainer("noContainer"));
    EXPECT_FALSE(mapping.identifierHasSystemContainer("notADictionary"));
    EXPECT_FALSE(mapping.identifierHasSystemContainer("missing"));
    EXPECT_TRUE(mapping.entitlementsExistForIdentifier("notADictionary"));
    EXPECT_FALSE(mapping.entitlementsExistForIdentifier("missing"));
    EXPECT_FALSE(mapping.appGroupIdentifiersForIdentifier("missing"));
    EXPECT_TRUE(mapping.identifierHasCallerRegisteredEntitlements("byCaller"));
    for (const char* identifier : {"notByCaller", "number", "missing"})
        EXPECT_FALSE(mapping.identifierHasCallerRegisteredEntitlements(identifier));
}

// Goal: a change is written once, whole, and only when something changes. Method: the file's inode tells whether it was
// replaced; a new daemon tells what it holds.
TEST(EntitlementMapping, SettingWritesOnceWhenSomethingChanges) {
    World world;
    const auto set = [&](const std::vector<Dictionary>& values, const Strings& identifiers) {
        return world.services().entitlements()._setEntitlementDictionaryValues(values, identifiers);
    };
    const auto inode = [&] {
        struct stat status{};
        return ::stat(world.path(file).c_str(), &status) == 0 ? status.st_ino : 0;
    };
    const Dictionary a{{apps, Array{"g"}}};
    const Dictionary b{{"k", 1}};
    ASSERT_TRUE(set({a, b}, {"a", "b"}));
    const ino_t first = inode();
    world.disk().arm({.filter = [](const auto&) -> bool {
        ADD_FAILURE() << "an unchanged map was written";
        return false;
    }});
    EXPECT_TRUE(set({a, b, Dictionary{}}, {"a", "b", "never there"}));
    EXPECT_TRUE(set({}, {}));
    world.disk().disarm();
    EXPECT_EQ(inode(), first);
    const auto counts = set({a}, {"a", "b"});
    ASSERT_FALSE(counts);
    EXPECT_TRUE(counts.error().is(ErrorCode::entitlementCountsDiffer));
    EXPECT_EQ(counts.error().description(), "Can't act on an invalid input: values count: 1, IDs count: 2");
    std::size_t renames = 0;
    world.disk().arm({.filter = [&](const support::DiskCallInfo& call) {
        renames +=
            call.call == support::DiskCall::rename && call.subject.find("zor_entitlements.plist") != std::string::npos;
        return false;
    }});
    world.log.setLevel(logLevelDebug);
    world.log.take();
    EXPECT_TRUE(set({Dictionary{}, a, b}, {"a", "b", "c"}));
    world.disk().disarm();
    EXPECT_EQ(renames, 1U);
    const auto said = world.log.take();
    EXPECT_TRUE(hasLine(said, 7, "_setEntitlementDictionaryValues", "Staging Entitlement Mapping for ID: a : (null)"));
    EXPECT_TRUE(hasLine(said, 7, "_setEntitlementDictionaryValues", "Wrote entitlement mappings to disk after set"));
    world.restart();
    ZOREntitlementMapping& mapping = world.services().entitlements();
    EXPECT_EQ(mapping.entryCount(), 2U);
    EXPECT_FALSE(mapping.entitlementsExistForIdentifier("a"));
    EXPECT_EQ(mapping.appGroupIdentifiersForIdentifier("b"), Strings{"g"});
    EXPECT_TRUE(mapping.entitlementsExistForIdentifier("c"));
}

// Goal: a save that fails is error 59, the change stays in memory and the old file on disk, whichever call fails.
// Method: fail each call of a save in turn.
TEST(EntitlementMapping, AFailedSave) {
    World world;
    ASSERT_TRUE(world.services().entitlements()._setEntitlementDictionaryValues({Dictionary{{"k", 1}}}, {"old"}));
    const std::string before = world.read(file);
    std::size_t failed = 0;
    for (std::size_t point = 1;; ++point) {
        const std::string identifier = "new" + std::to_string(point);
        world.log.take();
        world.disk().arm({.point = point, .error = ENOSPC});
        const auto set =
            world.services().entitlements()._setEntitlementDictionaryValues({Dictionary{{"k", 1}}}, {identifier});
        const bool met = world.disk().met();
        world.disk().disarm();
        EXPECT_TRUE(world.services().entitlements().entitlementsExistForIdentifier(identifier));
        if (!met)
            break;
        if (set)
            continue; // the failing call was not one that counts
        ++failed;
        EXPECT_TRUE(set.error().is(ErrorCode::entitlementFileNotWritten));
        EXPECT_EQ(set.error().description(), "Failed to write entitlement mapping file at " + world.path(file));
        const auto said = world.log.take();
        EXPECT_TRUE(hasLine(said, 3, "_setEntitlementDictionaryValues",
                            "Error writing entitlement mappings to disk after set : ZORErrorDomain 59 \"Failed to "
                            "write entitlement mapping file at " +
                                world.path(file) + "\""));
        const bool mayBeNew = world.disk().metCall().call == support::DiskCall::sync; // of the directory
        EXPECT_TRUE(mayBeNew || world.read(file) == before);
        if (mayBeNew) {
            world.write(file, before);
        }
    }
    EXPECT_GE(failed, 4U);
    world.restart();
    EXPECT_TRUE(world.services().entitlements().entitlementsExistForIdentifier("new1")); // the last save held all
}

// Goal: a file that is there and cannot be believed is moved aside once, never written over, and its loss is remembered
// until it is removed. Method: everything that can be wrong with it, then a second loss.
TEST(EntitlementMapping, AnUnreadableFileIsKeptAside) {
    struct Row {
        const char* name;
        std::function<void(World&)> make;
    };
    const std::string good = binary(Dictionary{{"a", Dictionary{{"k", 1}}}});
    const Row rows[] = {
        {"damaged", [](World& world) { world.write(file, "nonsense"); }},
        {"array", [](World& world) { world.write(file, binary(Array{})); }},
        {"empty", [](World& world) { world.write(file, ""); }},
        {"writable by others", [&](World& world) { world.write(file, good, 0666); }},
        {"link",
         [&](World& world) {
             world.write("elsewhere", good);
             world.makeDirectories(libraryPath);
             ASSERT_EQ(::symlink(world.path("elsewhere").c_str(), world.path(file).c_str()), 0);
         }},
        {"directory", [](World& world) { world.makeDirectories(file); }},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        World world;
        row.make(world);
        const std::string was = world.item(file);
        ZOREntitlementMapping& mapping = world.services().entitlements();
        EXPECT_EQ(mapping.entryCount(), 0U);
        EXPECT_TRUE(hasLine(world.log.take(), 3, "_readEntitlementMappingFromDisk", missingMessage(world)));
        EXPECT_FALSE(world.exists(file));
        EXPECT_EQ(world.item(aside), was);
        EXPECT_EQ(mapping.lostFile(), FileURL::file(world.path(aside)));
        ASSERT_TRUE(mapping._setEntitlementDictionaryValues({Dictionary{{"k", 1}}}, {"b"}));
        EXPECT_TRUE(mapping.lostFile());
        world.restart();
        EXPECT_TRUE(world.services().entitlements().lostFile());
        EXPECT_TRUE(world.services().entitlements().entitlementsExistForIdentifier("b"));
    }
    World world;
    world.write(file, "first loss");
    world.load();
    world.write(file, "second loss");
    world.restart();
    world.load();
    EXPECT_EQ(world.read(aside), "first loss");
    EXPECT_EQ(world.read(file), "second loss");
    // Who accepts the first loss has not seen the second.
    ASSERT_EQ(::unlink(world.path(aside).c_str()), 0);
    EXPECT_EQ(world.services().entitlements().lostFile(), FileURL::file(world.path(file)));
    ASSERT_TRUE(world.services().entitlements()._setEntitlementDictionaryValues({Dictionary{{"k", 1}}}, {"b"}));
    EXPECT_EQ(world.read(aside), "second loss");
    ASSERT_EQ(::unlink(world.path(aside).c_str()), 0);
    EXPECT_FALSE(world.services().entitlements().lostFile());
}

// Goal: a file that could be neither read nor moved aside is lost all the same, and nothing is written over it; it goes
// aside with the first save that can move it. Method: no rename succeeds while the map is loaded and saved once.
TEST(EntitlementMapping, AnUnreadableFileThatCannotBeMoved) {
    World world;
    world.write(file, "nonsense");
    world.disk().arm({.error = EIO, .span = support::FaultSpan::fromThenOn, .filter = [](const auto& call) {
                          return call.call == support::DiskCall::rename &&
                                 call.subject.find("unreadable") != std::string::npos;
                      }});
    ZOREntitlementMapping& mapping = world.services().entitlements();
    const auto save = [&] { return mapping._setEntitlementDictionaryValues({Dictionary{{"k", 1}}}, {"b"}); };
    EXPECT_EQ(mapping.lostFile(), FileURL::file(world.path(file)));
    const auto refused = save();
    ASSERT_FALSE(refused);
    EXPECT_TRUE(refused.error().is(ErrorCode::entitlementFileNotWritten));
    EXPECT_EQ(world.read(file), "nonsense");
    EXPECT_TRUE(mapping.lostFile());
    world.disk().disarm();
    ASSERT_TRUE(save());
    EXPECT_EQ(world.read(aside), "nonsense");
    EXPECT_EQ(mapping.lostFile(), FileURL::file(world.path(aside)));
    world.restart();
    EXPECT_TRUE(world.services().entitlements().entitlementsExistForIdentifier("b"));
}

// Goal: queries and changes at once. Method: each thread sets and removes its own identifier and must see it.
TEST(EntitlementMapping, ManyThreads) {
    World world;
    world.load();
    std::atomic<int> wrong{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t)
        threads.emplace_back([&, t] {
            ZOREntitlementMapping& mapping = world.services().entitlements();
            const std::string own = "id" + std::to_string(t);
            for (int i = 0; i < 20; ++i) {
                wrong += !mapping._setEntitlementDictionaryValues({Dictionary{{apps, own}}}, {own});
                wrong += mapping.appGroupIdentifiersForIdentifier(own) != Strings{own};
                wrong += !mapping._setEntitlementDictionaryValues({Dictionary{}}, {own});
                wrong += mapping.entitlementsExistForIdentifier(own);
            }
        });
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_EQ(wrong, 0);
}

TEST(Whitelist, BuiltInTables) {
    World world;
    const ZORWhitelist& table = world.services().whitelist();
    EXPECT_EQ(table.wellknownSystemContainers(), Strings{"com.veltra.settingsd"});
    EXPECT_EQ(table.wellknownSystemGroupContainers(),
              (Strings{"systemgroup.com.veltra.certificates", "systemgroup.com.veltra.dictionaries",
                       "systemgroup.com.veltra.fonts", "systemgroup.com.veltra.timezone"}));
    for (std::uint64_t number = 0; number <= 14; ++number) {
        const auto containerClass = static_cast<ContainerClass>(number);
        EXPECT_EQ(table.containerIdIsWellknown("com.veltra.settingsd", containerClass), number == 12);
        EXPECT_EQ(table.containerIdIsWellknown("systemgroup.com.veltra.fonts", containerClass), number == 13);
        EXPECT_EQ(table.wellknownContainerForId("com.veltra.settingsd", containerClass) != nullptr, number == 12);
        EXPECT_EQ(table.directoryNameIsWellknown("com.veltra.settingsd", containerClass), number == 12);
    }
    EXPECT_FALSE(table.systemContainerIdIsWellknown("systemgroup.com.veltra.fonts"));
    EXPECT_FALSE(table.systemGroupContainerIdIsWellknown("com.veltra.settingsd"));
    EXPECT_FALSE(table.systemContainerIdIsWellknown("COM.VELTRA.SETTINGSD"));
    for (const std::string& identifier : table.wellknownSystemGroupContainers())
        EXPECT_EQ(*table.wellknownSystemGroupContainerForId(identifier), identifier);
}

// Goal: the table of the file stands in place of the built-in one; a row that could lead anywhere else is said and left
// out; a file that cannot be believed is said and not used. Method: a table of rows; then files.
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
