// SPDX-License-Identifier: Apache-2.0
// What a change of entitlements makes of the map and its file, of system containers and of groups; reconciliation; and
// what a lost file keeps from being deleted.
#include "entitlements/ZOREntitlementMapping.h"
#include "entitlements/ZORGroupManager.h"
#include "world/World.h"

#include <algorithm>
#include <atomic>
#include <gtest/gtest.h>
#include <set>
#include <thread>
#include <unistd.h>

namespace zor::test {
namespace {

using plist::Array;
using plist::Dictionary;
using support::DiskCall;
using support::DiskCallInfo;
using support::hasLine;

const std::string file = std::string(libraryPath) + "/zor_entitlements.plist";
const char* const apps = "com.veltra.security.application-groups";
const char* const groups = "com.veltra.security.system-groups";
const char* const groupContainers = "com.veltra.security.system-group-containers";
const char* const systemContainer = "com.veltra.security.system-container";
const char* const byCaller = "com.veltra.Zorvane.EntitlementsRegisteredByCaller";
const char* const placeholder = "com.veltra.Zorvane.PlaceholderEntitlements";
const char* const parent = "com.veltra.Zorvane.ParentBundleID";
const char* const children = "com.veltra.Zorvane.ChildPluginBundleIDs";
const std::string noCount = "Failed to get reference count information for group type: ";

class Processing : public testing::Test {
protected:
    Processing() {
        world.write(groupMarkerPath, "");
        world.log.setLevel(logLevelDebug);
        world.load();
    }
    ZOREntitlementMapping& mapping() { return world.services().entitlements(); }
    ErrorCode process(const std::optional<Dictionary>& entitlements, const std::optional<std::string>& identifier,
                      const Dictionary& options = {}) {
        return mapping().processEntitlements(entitlements ? &*entitlements : nullptr,
                                             identifier ? &*identifier : nullptr, &options);
    }
    std::string make(std::uint32_t user, const std::string& identifier, ContainerClass containerClass) {
        return world.daemonsClient()
            .createOrLookupContainerForUser(user, &identifier, containerClass, {.createIfNecessary = true})
            .value()
            .path;
    }
    /// How often the file was replaced meanwhile.
    template <typename Function>
    std::size_t writesDuring(Function function) {
        std::size_t writes = 0;
        world.disk().arm({.filter = [&](const DiskCallInfo& call) {
            writes += call.call == DiskCall::rename && call.subject.ends_with(" -> zor_entitlements.plist");
            return false;
        }});
        function();
        world.disk().disarm();
        return writes;
    }
    void boot() {
        world.restart();
        world.load();
        world.daemonsClient().rebootContainerManagerSetup();
        world.daemonsClient().containerManagerSetup();
        world.drainDeathRow();
    }

    World world;
};

// Goal: a change lets go exactly the containers whose last reference it takes away, for every user that has them.
// Method: a table of what "a" and others had and what "a" gets; each group has a container of each kind and user; those
// that went are compared.
TEST_F(Processing, WhatAChangeReleases) {
    struct Row {
        const char* name;
        std::optional<Dictionary> before;
        std::optional<Dictionary> other;
        std::optional<Dictionary> after;
        std::set<std::string> gone;
    };
    const Dictionary both{{apps, Array{"g", "h"}}};
    const Dictionary unrelated{{"k", 1}};
    const Row rows[] = {
        {"one of two", both, {}, Dictionary{{apps, Array{"h"}}}, {"g"}},
        {"another order", both, {}, Dictionary{{apps, Array{"h", "g"}}}, {}},
        {"everything", both, {}, {}, {"g", "h"}},
        {"everything, as an empty dictionary", both, {}, Dictionary{}, {"g", "h"}},
        {"another holds it", both, Dictionary{{apps, Array{"g"}}}, {}, {"h"}},
        {"another holds it among things that are none", both, Dictionary{{apps, Array{5, "g"}}}, {}, {"h"}},
        {"another's string does not count", both, Dictionary{{apps, "g"}}, {}, {"g", "h"}},
        {"listed twice", Dictionary{{apps, Array{"g", "g"}}}, {}, {}, {}},
        {"its own string does not count", Dictionary{{apps, "g"}}, {}, {}, {}},
        {"the one counted is another's", Dictionary{{apps, "g"}}, Dictionary{{apps, Array{"g"}}}, {}, {}},
        {"from a list to a string", Dictionary{{apps, Array{"g"}}}, {}, Dictionary{{apps, "g"}}, {}},
        {"what is no list means none", Dictionary{{apps, Array{"g"}}}, {}, Dictionary{{apps, Array{"g", 5}}}, {"g"}},
        {"only another key", Dictionary{{apps, Array{"g"}}, {"k", 1}}, {}, Dictionary{{apps, Array{"g"}}}, {}},
        {"another group", Dictionary{{apps, Array{"g"}}}, {}, Dictionary{{apps, Array{"h"}}}, {"g"}},
        {"the same name of another kind", Dictionary{{apps, Array{"systemgroup.s"}}}, {}, {}, {}},
        {"a system group", Dictionary{{groups, Array{"systemgroup.s"}}}, {}, unrelated, {"systemgroup.s"}},
        {"by the other key", Dictionary{{groupContainers, Array{"systemgroup.s"}}}, {}, {}, {"systemgroup.s"}},
        {"the first key is empty",
         Dictionary{{groups, Array{}}, {groupContainers, Array{"systemgroup.s"}}},
         {},
         {},
         {"systemgroup.s"}},
        {"from key to key",
         Dictionary{{groups, Array{"systemgroup.s"}}},
         {},
         Dictionary{{groupContainers, Array{"systemgroup.s"}}},
         {}},
        {"another holds it by the other key",
         Dictionary{{groups, Array{"systemgroup.s"}}},
         Dictionary{{groupContainers, Array{"systemgroup.s"}}},
         {},
         {}},
        {"the other key is hidden",
         Dictionary{{groups, Array{"systemgroup.t"}}, {groupContainers, Array{"systemgroup.s"}}},
         {},
         {},
         {}},
        {"without its prefix", Dictionary{{groups, Array{"unprefixed"}}}, {}, {}, {}},
        {"a system container", Dictionary{{systemContainer, true}}, {}, unrelated, {"a"}},
        {"a system container, false",
         Dictionary{{systemContainer, true}},
         {},
         Dictionary{{systemContainer, false}},
         {"a"}},
        {"a system container, 1", Dictionary{{systemContainer, true}}, {}, Dictionary{{systemContainer, 1}}, {"a"}},
        {"a system container kept",
         Dictionary{{systemContainer, true}},
         {},
         Dictionary{{systemContainer, true}, {"k", 1}},
         {}},
        {"a system container it never had", unrelated, Dictionary{{systemContainer, true}}, {}, {}},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        for (const char* identifier : {"a", "other"})
            ASSERT_EQ(process({}, identifier), ErrorCode::success);
        ASSERT_EQ(process(row.before, "a"), ErrorCode::success);
        ASSERT_EQ(process(row.other, "other"), ErrorCode::success);
        std::multimap<std::string, std::string> paths;
        for (const char* group : {"g", "h"})
            for (const std::uint32_t user : {mobile, second})
                paths.emplace(group, make(user, group, ContainerClass::sharedAppGroup));
        for (const char* group : {"systemgroup.s", "unprefixed"})
            paths.emplace(group, make(499, group, ContainerClass::sharedSystemGroup));
        for (const char* identifier : {"a", "other"})
            paths.emplace(identifier, make(499, identifier, ContainerClass::dataSystem));
        EXPECT_LE(writesDuring([&] { EXPECT_EQ(process(row.after, "a"), ErrorCode::success); }), 1U);
        std::set<std::string> gone;
        for (const auto& [identifier, path] : paths)
            if (::access(path.c_str(), F_OK) != 0)
                gone.insert(identifier);
        EXPECT_EQ(gone, row.gone);
        for (const auto& [identifier, path] : paths)
            EXPECT_EQ(::access(path.c_str(), F_OK) != 0, row.gone.contains(identifier)) << path;
    }
    EXPECT_FALSE(world.exists("private/var/nowhere"));
}

// Goal: children and flags are recorded and forgotten as the options say, with one write for a call that changes
// something and none for one that does not. Method: calls in a row, the whole map after each.
TEST_F(Processing, TheMapAfterEachCall) {
    const Dictionary e{{"k", 1}};
    const Dictionary caller{{byCaller, true}};
    struct Row {
        const char* name;
        std::optional<Dictionary> entitlements;
        std::optional<std::string> identifier;
        Dictionary options;
        ErrorCode code;
        std::size_t writes;
        Dictionary map;
    };
    using enum ErrorCode;
    const Dictionary a{{"a", e}};
    const auto aWith = [&](const char* key, plist::Value value) {
        Dictionary map = a;
        map.set(key, std::move(value));
        return map;
    };
    const auto family = [&](std::initializer_list<const char*> names) {
        Dictionary map = a;
        Array list;
        for (const char* name : names) {
            list.emplace_back(name);
            map.set(name, e);
        }
        map.set(children, Dictionary{{"a", list}});
        return map;
    };
    const Dictionary aFlagged = aWith(byCaller, Dictionary{{"a", true}});
    Dictionary grown = a;
    for (const char* name : {"b", "c"})
        grown.set(name, e);
    const Row rows[] = {
        {"no identifier", e, {}, caller, identifierMissing, 0, {}},
        {"nothing to remove", {}, "a", {}, success, 0, {}},
        {"nothing as a dictionary", Dictionary{}, "a", {}, success, 0, {}},
        {"by its caller", e, "a", caller, success, 1, aFlagged},
        {"again", e, "a", caller, success, 0, aFlagged},
        {"a flag that is no boolean", e, "a", {{byCaller, 1}}, success, 1, a},
        {"a placeholder", e, "a", {{placeholder, true}}, success, 1, aWith(placeholder, Dictionary{{"a", true}})},
        {"no more", e, "a", {{placeholder, false}}, success, 1, a},
        {"a child", e, "b", {{parent, "a"}}, success, 1, family({"b"})},
        {"again", e, "b", {{parent, "a"}}, success, 0, family({"b"})},
        {"another child", e, "c", {{parent, "a"}}, success, 1, family({"b", "c"})},
        {"a key of the map's own", e, children, {}, invalidObject, 0, family({"b", "c"})},
        {"its removal", {}, byCaller, {}, invalidObject, 0, family({"b", "c"})},
        {"a parent of another type", e, "b", {{parent, 5}}, invalidObject, 0, family({"b", "c"})},
        {"the parent itself", e, "a", {}, success, 1, grown},
        {"a child alone", {}, "b", {}, success, 1, Dictionary{{"a", e}, {"c", e}}},
        {"another", {}, "c", {}, success, 1, a},
        {"the last", {}, "a", {}, success, 1, {}},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        EXPECT_EQ(writesDuring([&] { EXPECT_EQ(process(row.entitlements, row.identifier, row.options), row.code); }),
                  row.writes);
        EXPECT_EQ(mapping().entitlementMappingDict(), row.map);
    }
    // With its parent goes every child, though one of them cannot.
    for (const char* child : {"b", "c"})
        ASSERT_EQ(process(e, child, {{parent, "a"}}), success);
    ASSERT_TRUE(
        mapping()._setEntitlementDictionaryValues({Dictionary{{"a", Array{"b", placeholder, 5, "c"}}}}, {children}));
    ASSERT_EQ(process(e, "kept", caller), success);
    world.log.take();
    mapping().removeEntitlementDictionariesForIdentifierAndItsChildren("a");
    EXPECT_TRUE(hasLine(world.log.take(), 3, "_onQueue_removeEntitlementDictionariesForIdentifierAndItsChildren",
                        std::string("Failed to clear entitlements for ") + placeholder + " : 11"));
    EXPECT_EQ(mapping().entitlementMappingDict(), (Dictionary{{"kept", e}, {byCaller, Dictionary{{"kept", true}}}}));
}

// Goal: a change that could not be saved is 59 and no later call is answered with success before it is; one that no
// file could hold is refused for itself. Method: a disk that refuses once; a dictionary too large.
TEST_F(Processing, ChangesThatCannotBeSaved) {
    const Dictionary e{{"k", 1}};
    const auto renaming = [](const DiskCallInfo& call) { return call.call == DiskCall::rename; };
    for (const char* identifier : {"a", "a", "never there"}) {
        world.disk().arm({.error = ENOSPC, .filter = renaming});
        EXPECT_EQ(process(e, "a"), ErrorCode::entitlementFileNotWritten);
        EXPECT_EQ(process(std::string(identifier) == "a" ? std::optional(e) : std::nullopt, identifier),
                  ErrorCode::success);
        world.disk().disarm();
        world.restart();
        world.load();
        EXPECT_TRUE(mapping().entitlementsExistForIdentifier("a"));
        ASSERT_EQ(process({}, "a"), ErrorCode::success);
    }
    constexpr std::size_t tooLarge = std::size_t{65} << 20;
    EXPECT_EQ(process(Dictionary{{"k", plist::Data(tooLarge)}}, "large", {{parent, "b"}}),
              ErrorCode::entitlementFileNotWritten);
    EXPECT_EQ(mapping().entryCount(), 0U);
    EXPECT_EQ(process(e, "b"), ErrorCode::success);
}

// Goal: the boot removes groups that nobody lists, of users that are there, and keeps those of lists in any key.
// Method: containers of each, then a boot.
TEST_F(Processing, ABootRemovesGroupsWithoutReferences) {
    ASSERT_EQ(process(Dictionary{{apps, Array{"g", "g"}}, {groupContainers, Array{"systemgroup.s", "bare"}}}, "a"),
              ErrorCode::success);
    std::vector<std::string> kept;
    std::vector<std::string> gone;
    for (const std::uint32_t user : {mobile, second}) {
        kept.push_back(make(user, "g", ContainerClass::sharedAppGroup));
        kept.push_back(make(user, "h", ContainerClass::dataApplication));
        gone.push_back(make(user, "h", ContainerClass::sharedAppGroup));
        gone.push_back(make(user, "systemgroup.s", ContainerClass::sharedAppGroup));
    }
    kept.push_back(make(499, "systemgroup.s", ContainerClass::sharedSystemGroup));
    kept.push_back(make(499, "bare", ContainerClass::sharedSystemGroup));
    gone.push_back(make(499, "g", ContainerClass::sharedSystemGroup));
    boot();
    for (const std::string& path : kept)
        EXPECT_EQ(::access(path.c_str(), F_OK), 0) << path;
    for (const std::string& path : gone)
        EXPECT_NE(::access(path.c_str(), F_OK), 0) << path;
    EXPECT_TRUE(hasLine(world.log.take(), 3, "_cleanupUnreferencedGroupContainersForUser",
                        "Removing group container with identifier h for 502"));
}

// Goal: while an unreadable file lies aside, no group goes for want of a reference, at boots and at releases, and it
// does when the file is gone. Method: two boots over a lost file with registrations between them, then one without.
TEST_F(Processing, ALostFileStopsDeletions) {
    const Dictionary entitled{{apps, Array{"g"}}, {groups, Array{"systemgroup.s"}}};
    ASSERT_EQ(process(entitled, "a"), ErrorCode::success);
    const std::string paths[] = {make(mobile, "g", ContainerClass::sharedAppGroup),
                                 make(499, "systemgroup.s", ContainerClass::sharedSystemGroup)};
    const auto count = [&] {
        return std::ranges::count_if(paths, [](const auto& path) { return ::access(path.c_str(), F_OK) == 0; });
    };
    world.write(file, "nonsense");
    for (const char* bootName : {"first", "second"}) {
        SCOPED_TRACE(bootName);
        boot();
        const auto lines = world.log.take();
        for (const char* type : {"0", "1"})
            EXPECT_TRUE(hasLine(lines, 3, "reconcileGroupContainersOfType", noCount + type));
        EXPECT_EQ(count(), 2);
        ASSERT_EQ(process(entitled, "a"), ErrorCode::success);
        world.log.take();
        ASSERT_EQ(process({}, "a"), ErrorCode::success);
        const auto released = world.log.take();
        for (const char* type : {"0", "1"})
            EXPECT_TRUE(hasLine(released, 3, "_removeReferenceForGroupIdentifiers", noCount + type));
        EXPECT_EQ(count(), 2);
    }
    ASSERT_EQ(::unlink(mapping().lostFile()->c_str()), 0);
    boot();
    EXPECT_EQ(count(), 0);
}

// Goal: paths are the same at every asking, only of groups that the identifier has, only for users who have a home;
// what one disk error costs is one group. Method: askings in a row.
TEST_F(Processing, GroupPaths) {
    ASSERT_EQ(process(Dictionary{{apps, Array{"g", "h"}}, {groups, Array{"systemgroup.s", "bare"}}}, "a"),
              ErrorCode::success);
    const auto client = world.client({.bundleIdentifier = "b", .userId = mobile});
    const std::string a = "a";
    const std::string b = "b";
    ZORGroupManager& manager = world.services().groups();
    const auto keysOf = [](const Result<ZORGroupManager::Paths>& paths) {
        std::set<std::string> found;
        for (const auto& [group, path] : *paths)
            found.insert(group);
        return found;
    };
    EXPECT_FALSE(client->allowGroupIdLookup());
    EXPECT_TRUE(manager.groupContainerPathsForUser(mobile, *client, &b)->empty());
    EXPECT_TRUE(client->allowGroupIdLookup());
    world.disk().arm(
        {.error = ENOSPC, .filter = [](const DiskCallInfo& call) { return call.call == DiskCall::createFile; }});
    world.log.take();
    EXPECT_EQ(keysOf(manager.groupContainerPathsForUser(mobile, *client, &a)), (std::set<std::string>{"h"}));
    world.disk().disarm();
    EXPECT_TRUE(hasLine(world.log.take(), 3, "groupContainerPathsForUser",
                        "Failed to create or lookup group container-userId: 501, ID: a : 34"));
    const auto paths = manager.groupContainerPathsForUser(mobile, *client, &a);
    EXPECT_EQ(keysOf(paths), (std::set<std::string>{"g", "h"}));
    EXPECT_EQ(*manager.groupContainerPathsForUser(mobile, *client, &a), *paths);
    EXPECT_NE(*manager.groupContainerPathsForUser(second, *client, &a), *paths);
    EXPECT_EQ(keysOf(manager.groupContainerPathsForUser(499, *client, &a)), (std::set<std::string>{"systemgroup.s"}));
    EXPECT_TRUE(manager.groupContainerPathsForUser(504, *client, &a)->empty()); // no such user
    EXPECT_EQ(*manager.groupContainerIdentifiersForUser(499, &a), (std::vector<std::string>{"g", "h"}));
    EXPECT_TRUE(manager.groupContainerIdentifiersForUser(mobile, &b)->empty());
    for (const auto& error : {manager.groupContainerPathsForUser(mobile, *client, nullptr).error(),
                              manager.groupContainerIdentifiersForUser(mobile, nullptr).error()}) {
        EXPECT_TRUE(error.is(ErrorCode::invalidObject));
        EXPECT_EQ(error.description(), "Can't act on an invalid object: userId: 501, ID: (null)");
    }
}

// Goal: whoever holds a group has its container throughout, however often others come and go. Method: one identifier
// asks for its paths while others register and leave; its container stays the same one.
TEST_F(Processing, AHeldGroupStaysWhileOthersComeAndGo) {
    const Dictionary entitled{{apps, Array{"g"}}};
    const std::string holder = "holder";
    ASSERT_EQ(process(entitled, holder), ErrorCode::success);
    const std::string path = make(mobile, "g", ContainerClass::sharedAppGroup);
    constexpr int rounds = 30;
    std::atomic<int> wrong{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 3; ++t)
        threads.emplace_back([&, t] {
            for (int i = 0; i < rounds; ++i)
                wrong += process(i % 2 == 0 ? std::optional(entitled) : std::nullopt, "id" + std::to_string(t)) !=
                         ErrorCode::success;
        });
    threads.emplace_back([&] {
        const auto client = world.client({.bundleIdentifier = holder, .userId = mobile});
        for (int i = 0; i < rounds; ++i) {
            const auto paths = world.services().groups().groupContainerPathsForUser(mobile, *client, &holder);
            wrong += !paths || *paths != ZORGroupManager::Paths{{"g", path}} || ::access(path.c_str(), F_OK) != 0;
        }
    });
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_EQ(wrong, 0);
    ASSERT_EQ(process({}, holder), ErrorCode::success);
    EXPECT_NE(::access(path.c_str(), F_OK), 0);
}

} // namespace
} // namespace zor::test
