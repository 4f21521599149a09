// SPDX-License-Identifier: Apache-2.0
// The effects of a change of entitlements on the map and its file, of system containers and of groups; reconciliation;
// what a lost file keeps from being deleted; and the files of the map and of the table of well-known containers,
// damaged, foreign, or such that cannot be written.
#include "operations/ZORGroupManager.h"
#include "store/ZOREntitlementMapping.h"
#include "world/World.h"

#include <gtest/gtest.h>

namespace zor::test {
namespace {

using plist::Array;
using plist::Dictionary;
using support::DiskCall;
using support::DiskCallInfo;
using Strings = std::vector<std::string>;

const char* const apps = "com.veltra.security.application-groups";
const char* const groups = "com.veltra.security.system-groups";
const char* const groupContainers = "com.veltra.security.system-group-containers";
const char* const systemContainer = "com.veltra.security.system-container";
const char* const placeholder = "com.veltra.Zorvane.PlaceholderEntitlements";
const char* const parent = "com.veltra.Zorvane.ParentBundleID";
const char* const children = "com.veltra.Zorvane.ChildPluginBundleIDs";

class Processing : public testing::Test {
protected:
    Processing() {
        world.write(groupMarkerPath, "");
        world.load();
    }
    ZOREntitlementMapping& mapping() { return world.services().entitlements(); }
    ErrorCode process(const std::optional<Dictionary>& entitlements, const std::string& identifier,
                      const Dictionary& options = {}) {
        return world.entitle(identifier, entitlements, options);
    }
    std::string make(std::uint32_t user, const std::string& identifier, ContainerClass containerClass) {
        return world.make(identifier, containerClass, false, user).path;
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

    World world;
};

// Goal: a registration that changes anything waits for who holds all identifiers. Method: a held lock, one beside it.
TEST_F(Processing, WaitsForAllIdentifiers) {
    std::optional<AllIdentifiersLock> held(std::in_place, world.services().locks(), LockMode::reading);
    auto answer = std::async(std::launch::async, [&] { return process(Dictionary{{"k", 1}}, "a"); });
    EXPECT_EQ(answer.wait_for(std::chrono::milliseconds(50)), std::future_status::timeout);
    held.reset();
    EXPECT_EQ(answer.get(), ErrorCode::success);
}

// Goal: exactly the containers whose last reference goes are let go, for every user that has them.
// Method: what "a" and "other" had and what "a" gets; each group has a container of each kind and user.
TEST_F(Processing, WhatAChangeReleases) {
    struct Row {
        const char* name;
        std::optional<Dictionary> before;
        std::optional<Dictionary> other;
        std::optional<Dictionary> after;
        std::set<std::string> gone;
    };
    const std::optional<Dictionary> none;
    const auto of = [](const char* key, plist::Value value) { return Dictionary{{key, std::move(value)}}; };
    const Dictionary g = of(apps, Array{"g"});
    const Dictionary h = of(apps, Array{"h"});
    const Dictionary both = of(apps, Array{"g", "h"});
    const Dictionary text = of(apps, "g");
    const Dictionary mixed = of(apps, Array{5, "g"});
    const Dictionary s = of(groups, Array{"systemgroup.s"});
    const Dictionary byOtherKey = of(groupContainers, Array{"systemgroup.s"});
    const Dictionary container = of(systemContainer, true);
    const Row rows[] = {
        {"one of two", both, none, h, {"g"}},
        {"everything, as an empty dictionary", both, none, Dictionary{}, {"g", "h"}},
        {"another holds it", both, g, none, {"h"}},
        {"another holds it among things that are none", both, mixed, none, {"h"}},
        {"another holds it as a string", both, text, none, {"h"}},
        {"listed twice", of(apps, Array{"g", "g"}), none, none, {}},
        {"its own string", text, none, none, {"g"}},
        {"from a list to a string", g, none, text, {}},
        {"what is no list means none", g, none, mixed, {"g"}},
        {"the same name of another kind", of(apps, Array{"systemgroup.s"}), none, none, {}},
        {"a system group", s, none, h, {"systemgroup.s"}},
        {"the first key is empty",
         Dictionary{{groups, Array{}}, {groupContainers, Array{"systemgroup.s"}}},
         none,
         none,
         {"systemgroup.s"}},
        {"from key to key", s, none, byOtherKey, {}},
        {"another holds it by the other key", s, byOtherKey, none, {}},
        {"without its prefix", of(groups, Array{"unprefixed"}), none, none, {}},
        {"a system container, 1", container, none, of(systemContainer, 1), {"a"}},
        {"a system container kept", container, none, container, {}},
        {"a system container it never had", h, container, none, {"h"}},
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
        for (const auto& [identifier, path] : paths) {
            EXPECT_EQ(isThere(path), !row.gone.contains(identifier)) << path;
            if (!isThere(path))
                gone.insert(identifier);
        }
        EXPECT_EQ(gone, row.gone);
    }
    EXPECT_FALSE(world.exists("private/var/nowhere"));
}

// Goal: children and flags as the options say, one write for each change. Method: the whole map after each call.
TEST_F(Processing, TheMapAfterEachCall) {
    const Dictionary e{{"k", 1}};
    const Dictionary caller{{byCaller, true}};
    struct Row {
        std::optional<Dictionary> entitlements;
        std::string identifier;
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
    const Row rows[] = {
        {{}, "a", {}, success, 0, {}},
        {e, "a", caller, success, 1, aFlagged},
        {e, "a", caller, success, 0, aFlagged},
        {e, "a", {{byCaller, 1}}, success, 1, a}, // a flag that is no boolean
        {e, "a", {{placeholder, true}}, success, 1, aWith(placeholder, Dictionary{{"a", true}})},
        {e, "a", {{placeholder, false}}, success, 1, a},
        {e, "b", {{parent, "a"}}, success, 1, family({"b"})},
        {e, "b", {{parent, "a"}}, success, 0, family({"b"})},
        {e, "c", {{parent, "a"}}, success, 1, family({"b", "c"})},
        {e, children, {}, invalidObject, 0, family({"b", "c"})}, // a key of the map's own
        {{}, byCaller, {}, invalidObject, 0, family({"b", "c"})},
        {e, "b", {{parent, 5}}, invalidObject, 0, family({"b", "c"})},
        {e, "a", {}, success, 1, Dictionary{{"a", e}, {"b", e}, {"c", e}}},
        {{}, "b", {}, success, 1, Dictionary{{"a", e}, {"c", e}}},
        {{}, "c", {}, success, 1, a},
        {{}, "a", {}, success, 1, {}},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(&row - rows);
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
    std::optional<EntitlementChange::Change> change;
    EXPECT_TRUE(world.services().store().entitlementChange.removeEntitlementDictionariesForIdentifierAndItsChildren(
        "a", change, AllIdentifiersWriteLock(world.services().locks())));
    EXPECT_TRUE(change);
    EXPECT_EQ(mapping().entitlementMappingDict(), (Dictionary{{"kept", e}, {byCaller, Dictionary{{"kept", true}}}}));
}

// Goal: an unsaved change is 59, and no later call succeeds before it is saved; one no file can hold is refused.
// Method: a disk that refuses once; a dictionary too large.
TEST_F(Processing, ChangesThatCannotBeSaved) {
    const Dictionary e{{"k", 1}};
    for (const char* identifier : {"a", "a", "never there"}) {
        world.refuse(DiskCall::rename, ENOSPC);
        EXPECT_EQ(process(e, "a"), ErrorCode::entitlementFileNotWritten);
        EXPECT_TRUE(mapping().entitlementsExistForIdentifier("a"));
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

// Goal: while a change is being saved, readers see it, nobody holds the lock, and only who asks for the same change
// waits. Method: in the first sync of a save, what others do.
TEST_F(Processing, ASaveHoldsOnlyItsOwnChange) {
    const Dictionary e{{"k", 1}};
    ASSERT_EQ(process(e, "before"), ErrorCode::success);
    std::future<ErrorCode> again;
    std::future<ErrorCode> next;
    std::atomic<bool> entered{false};
    world.disk().before = [&](const DiskCallInfo& call) {
        if (call.call != DiskCall::sync || entered.exchange(true))
            return;
        EXPECT_TRUE(mapping().entitlementsExistForIdentifier("a"));
        EXPECT_FALSE(world.services().locks().allAreHeldForWriting());
        EXPECT_EQ(process(e, "before"), ErrorCode::success);
        again = std::async(std::launch::async, [&] { return process(e, "a"); });
        next = std::async(std::launch::async, [&] { return process(e, "b"); });
        EXPECT_EQ(again.wait_for(std::chrono::milliseconds(50)), std::future_status::timeout);
        EXPECT_EQ(next.wait_for(std::chrono::milliseconds(50)), std::future_status::timeout);
        EXPECT_TRUE(mapping().entitlementsExistForIdentifier("b"));
    };
    EXPECT_EQ(process(e, "a"), ErrorCode::success);
    EXPECT_EQ(again.get(), ErrorCode::success);
    EXPECT_EQ(next.get(), ErrorCode::success);
    world.disk().before = nullptr;
    world.restart();
    for (const char* saved : {"before", "a", "b"})
        EXPECT_TRUE(mapping().entitlementsExistForIdentifier(saved));
}

// Goal: while an unreadable file lies aside no group and no system container goes. Method: two boots over it, releases
// between, one without.
TEST_F(Processing, ALostFileStopsDeletions) {
    const Dictionary entitled{{apps, Array{"g"}}, {groups, Array{"systemgroup.s"}}};
    ASSERT_EQ(process(entitled, "a"), ErrorCode::success);
    const std::string paths[] = {make(mobile, "g", ContainerClass::sharedAppGroup),
                                 make(499, "systemgroup.s", ContainerClass::sharedSystemGroup),
                                 make(499, "nobody's", ContainerClass::dataSystem)};
    const auto count = [&] { return std::ranges::count_if(paths, isThere); };
    world.write(entitlementFile, "nonsense");
    for (int boot = 0; boot < 2; ++boot) {
        world.reboot();
        EXPECT_EQ(world.complaints("reconcileGroupContainersOfType").size(), 2U);
        for (const auto& change : {std::optional(entitled), std::optional<Dictionary>()})
            ASSERT_EQ(process(change, "a"), ErrorCode::success);
        EXPECT_EQ(count(), 3);
    }
    std::filesystem::remove(mapping().lostFile()->path());
    world.reboot();
    EXPECT_EQ(count(), 0);
}

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
    // An administrator who accepts the first loss has not seen the second.
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
