// SPDX-License-Identifier: Apache-2.0
// The way of a message: who is admitted to which command, what is said and done to those who are not, who sends the
// reply, and the commands from a request's keys to a reply's, the registration of a peer by its own messages among
// them.
#include "daemon/commands/Commands.h"
#include "store/DispatchFixture.h"
#include "store/ZOREntitlementMapping.h"

namespace zor::test {
namespace {

using plist::Array;
using plist::Dictionary;
using support::DiskCall;
using support::DiskCallInfo;
using support::LogLine;

using Kind = platform::ServiceEvent::Kind;

// Goal: each way of being refused ends the connection without a reply, and is said. Method: a table, then events that
// are no messages.
TEST_F(Dispatch, Refusals) {
    struct Row {
        std::shared_ptr<const platform::IdentityGrant> granted;
        Dictionary message;
        std::vector<LogLine> lines;
    };
    const LogLine noEntry{3, admission, "Failed to copy signing ID for pid 4711 : a.plist: why"};
    const LogLine noWipe{3, admission, "No entitled containers to wipe"};
    const Dictionary list{{"Command", 1}};
    const Row rows[] = {
        {grant("a", everything), {{"Command", 23}}, {{3, handler, "Invalid command index: 23"}}},
        {nullptr, {{"Command", ~std::uint64_t{0}}}, {{3, handler, "Invalid command index: -1"}}},
        {nullptr, {}, {noEntry}},
        {nullptr, list, {noEntry, missing("(null)", powers::allowed)}},
        {grant("com.example", {}), {}, {}},
        {grant("com.example", {}), list, {missing("com.example", powers::allowed)}},
        {grant("com.example", noPowers), {{"Command", 11}}, {noWipe, missing("com.example", powers::wipeContainer)}},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(&row - rows);
        as(row.granted);
        expectRefused(row.message);
        EXPECT_EQ(world.log.take(), row.lines);
    }
    EXPECT_EQ(world.services().dispatcher().counts().refused, std::size(rows));
    as(grant("com.example", noPowers));
    handle({.kind = Kind::invalid, .request = {}, .reply = nullptr});
    EXPECT_TRUE(connection.cancelled == 0 && world.log.take().empty());
    for (const Kind kind : {Kind::other, Kind::message}) {
        handle({.kind = kind, .request = {}, .reply = nullptr});
        EXPECT_EQ(std::exchange(connection.cancelled, 0), 1);
        EXPECT_EQ(world.log.take(), (std::vector<LogLine>{{3, handler, "Dictionary does not have reply context"}}));
    }
    EXPECT_EQ(world.services().dispatcher().counts().served, 0U);
    const Dictionary message{{"Command", 1}, {"Identifier", "a"}, {"ContainerClass", 2}, {"UserID", 501}};
    handle({.kind = Kind::message, .request = message, .reply = std::make_shared<FakeReply>(), .requestId = 77});
    EXPECT_EQ(world.log.request(), "ZORVANE_PEER_PID=4711 ZORVANE_PEER_UID=501 ZORVANE_REQUEST=77 ZORVANE_COMMAND=1 "
                                   "ZORVANE_IDENTIFIER=a ZORVANE_CLASS=2 ZORVANE_USER=501 ");
}

// Goal: exactly the entitled are admitted and get one reply each. Method: all commands against all kinds of peer.
TEST_F(Dispatch, EveryCommandAdmitsByItsEntitlement) {
    const std::set<std::uint64_t> unguarded = {0, 13, 15, 16, 17};
    enum class Admits { none, basic, basicAndWipe, all };
    struct Row {
        std::optional<Dictionary> entitlements;
        Admits admits;
    };
    const std::string wipeKey(powers::wipeContainer);
    const Row rows[] = {
        {std::nullopt, Admits::none},
        {noPowers, Admits::basic},
        {Dictionary{{std::string(powers::otherIdLookup), true}}, Admits::basic},
        {Dictionary{{std::string(powers::allowed), 1}}, Admits::basic},
        {Dictionary{{wipeKey, "x"}}, Admits::basic},
        {Dictionary{{wipeKey, Array{}}}, Admits::basicAndWipe},
        {everything, Admits::all},
        {Dictionary{{std::string(powers::allowed), true}, {wipeKey, true}}, Admits::all},
    };
    ASSERT_EQ(commandTable.size(), 23U);
    for (std::uint64_t command = 0; command < commandTable.size(); ++command) {
        EXPECT_EQ(commandTable[command].replyFlag == ReplyFlag::handlerReplies, command == 4 || command == 19);
        for (const Row& row : rows) {
            SCOPED_TRACE("command " + std::to_string(command) + " as " + std::to_string(&row - rows));
            as(grant("com.example", row.entitlements));
            const bool admitted = row.admits == Admits::all ||
                                  (unguarded.contains(command) && row.admits != Admits::none) ||
                                  (command == 11 && row.admits == Admits::basicAndWipe);
            const Dictionary message{{"Command", command}};
            if (admitted) {
                EXPECT_NE(errorOf(request(message)), 0U);
            } else {
                expectRefused(message);
            }
        }
    }
}

// Goal: two commands give up what even the most powerful peer has: the wipe of an entitled plug-in its power over
// others, the retry test its service on other builds. Method: a peer that may do all.
TEST_F(Dispatch, CommandsThatDropPowers) {
    as(grant("installer", Dictionary{{std::string(powers::allowed), true},
                                     {std::string(powers::wipeContainer), Array{"com.plugin"}}}),
       0);
    for (const auto& [identifier, error] : {std::pair("com.other", 55U), std::pair("com.plugin", 1U)}) {
        (void)makeContainer(identifier, 4);
        EXPECT_EQ(errorOf(request({{"Command", 11}, {"UserID", 501}, {"Identifier", identifier}})), error);
    }
    world.log.take();
    EXPECT_EQ(errorOf(request({{"Command", 22}, {"UserID", 501}, {"NumRetryCrashes", 0}})), 1U);
    EXPECT_EQ(
        world.log.take(),
        (std::vector<LogLine>{{3, "retryTest", "People really shouldn't be calling this on non-internal installs!"}}));
}

// Goal: the reply to command 4 comes once, when the pass has run, with its code. Method: hold the queue.
TEST_F(Dispatch, TheDeferredReplyComesOnceAfterThePass) {
    as(grant("com.example", everything));
    world.makeDirectories(dead + "/temp.abcdef/old");
    platform::WorkQueue& queue = world.linux().roles().deathRowQueue;
    queue.suspend();
    const auto channel = std::make_shared<FakeReply>();
    handle({.kind = Kind::message, .request = {{"Command", 4}}, .reply = channel});
    EXPECT_TRUE(channel->replies().empty());
    EXPECT_TRUE(world.exists(dead + "/temp.abcdef/old"));
    queue.resume();
    world.drainDeathRow();
    EXPECT_EQ(channel->replies(), (std::vector<Dictionary>{{{"ReplyError", std::uint64_t{1}}}}));
    EXPECT_TRUE(world.names(dead).empty());
    EXPECT_EQ(connection.cancelled, 0);
}

// Goal: a client without powers cannot pile up work that keeps the daemon busy. Method: with the queue held, it has one
// transient container after the other thrown away.
TEST_F(Dispatch, PassesDoNotPileUp) {
    const platform::Platform platform = world.linux().roles();
    platform.deathRowQueue.suspend();
    for (int i = 0; i < 20; ++i)
        handle({.kind = Kind::message,
                .request = {{"ContainerClass", 2}, {"UserID", 501}, {"CreateIfNecessary", true}, {"Transient", true}},
                .reply = std::make_shared<FakeReply>()});
    EXPECT_EQ(platform.transactions.count(), 1U);
    EXPECT_EQ(world.names(dead).size(), 19U);
    platform.deathRowQueue.resume();
    world.drainDeathRow();
    EXPECT_TRUE(world.names(dead).empty());
}

// Goal: an identifier longer than one may be is an invalid object, and so are more groups than one may have. Method:
// every command with every key that holds identifiers.
TEST_F(Dispatch, IdentifiersAndGroupsAreBounded) {
    const std::string longest(1024, 'i');
    const plist::Value tooLong(std::string(1025, 'i'));
    as(grant("com.example", everything), 0);
    const Dictionary rows{{"Identifier", tooLong},    {"OldIdentifier", tooLong},
                          {"NewIdentifier", tooLong}, {"GroupIdentifier", tooLong},
                          {"PageAfter", tooLong},     {"IdentifiersArray", Array{"a", tooLong}}};
    for (std::uint64_t command = 0; command < commandTable.size(); ++command)
        for (const auto& [key, value] : rows)
            EXPECT_EQ(errorOf(request({{"Command", command}, {key, value}})), 11U) << command << key;
    EXPECT_EQ(makeContainer(longest.c_str()).size(), 16U);
    const auto registering = [&](plist::Value groups, plist::Value parent) {
        return errorOf(request(
            {{"Command", 18},
             {"Identifier", "a"},
             {"Entitlements", Dictionary{{appGroups, std::move(groups)}}},
             {"OptionsDictionary", Dictionary{{std::string(ipc::keys::parentBundleIdOption), std::move(parent)}}}}));
    };
    EXPECT_EQ(registering(Array(1000, longest), longest), 1U);
    EXPECT_EQ(registering(Array(1001, "g"), "p"), 11U);
    EXPECT_EQ(registering(Array{"g", tooLong}, "p"), 11U);
    EXPECT_EQ(registering(tooLong, "p"), 11U);
    EXPECT_EQ(registering("g", tooLong), 11U);
}

// Goal: no client without powers throws away what is just being installed. Method: it asks for the installer's and the
// system's transient containers, which would, and for one of its own user's.
TEST_F(Dispatch, TransientContainersOfOthersStay) {
    asInstaller();
    const plist::Data installing = makeContainer("app", 1, true);
    as(grant("com.example", noPowers));
    for (const auto& [containerClass, user, error] : {std::array{1, 33, 55}, {13, 499, 55}, {2, 501, 21}})
        EXPECT_EQ(
            errorOf(request(
                {{"ContainerClass", containerClass}, {"UserID", user}, {"Identifier", "app"}, {"Transient", true}})),
            static_cast<std::uint64_t>(error))
            << containerClass;
    asInstaller();
    const Dictionary left = request({{"Command", 1}, {"ContainerClass", 1}, {"UserID", 33}, {"Transient", true}});
    EXPECT_EQ(*left.array("ReplyUUIDsArray"), Array{installing});
}

// Goal: a list is whole, also in pages, whatever goes between two of them. Method: three containers, pages of two.
TEST_F(Dispatch, Lists) {
    asInstaller();
    Array all;
    for (const char* identifier : {"a", "b", "c"})
        all.emplace_back(makeContainer(identifier));
    Dictionary list{{"Command", 1}, {"ContainerClass", 2}, {"UserID", 1}};
    EXPECT_EQ(request(list).array("ReplyIdsArray")->size(), 3U);
    world.services().store().limits.listPageMax = 2;
    list.set("PageAfter", "");
    const Dictionary first = request(list);
    ASSERT_TRUE(first.string("ReplyNextPage"));
    list.set("PageAfter", *first.string("ReplyNextPage"));
    EXPECT_EQ(*first.array("ReplyIdsArray"), (Array{"a", "b"}));
    EXPECT_EQ(*first.array("ReplyUUIDsArray"), (Array{all[0], all[1]}));
    ASSERT_EQ(world.stage(world.make("b")), ErrorCode::success);
    const Dictionary last{
        {"ReplyError", std::uint64_t{1}}, {"ReplyIdsArray", Array{"c"}}, {"ReplyUUIDsArray", Array{all[2]}}};
    EXPECT_EQ(request(list), last);
}

// Goal: a refused client cannot fill the log, nor another's share. Method: more refusals than a second's share, and
// lines that grow when they are escaped.
TEST_F(Dispatch, RefusalsAreLimitedForEachUser) {
    constexpr std::size_t refusals = 2000;
    const auto refuse = [&] { handle({.kind = Kind::message, .request = {{"Command", 99}}, .reply = nullptr}); };
    for (std::size_t i = 0; i < refusals; ++i)
        refuse();
    EXPECT_LT(world.log.take(3, handler).size(), refusals);
    as(grant(std::string(1000, '\x01'), noPowers), second);
    for (int i = 0; i < 24; ++i)
        handle({.kind = Kind::message, .request = {{"Command", 1}}, .reply = nullptr});
    EXPECT_EQ(world.log.take(3, "checkEntitlementsAndInitClientObject").size(), 4U);
}

class Shared : public Dispatch {
protected:
    Shared() { asInstaller(); }
    void asClient(const std::optional<std::string>& identifier, Dictionary entitlements = {}) {
        as(grant(identifier, std::move(entitlements)));
    }
    std::uint64_t codeOf(const Dictionary& message) { return errorOf(request(message)); }
    ZOREntitlementMapping& mapping() { return world.services().entitlements(); }
    std::set<std::string> groupsIn(const Dictionary& reply) {
        std::set<std::string> found;
        if (const Dictionary* paths = reply.dictionary("ReplyGroupContainerDict"))
            for (const auto& [group, path] : *paths) {
                EXPECT_TRUE(path.asString() && isThere(*path.asString())) << group;
                found.insert(group);
            }
        return found;
    }
};

// Goal: who is fenced in reaches its own identifier and no other, whatever its powers. Method: a table of requests.
TEST_F(Shared, OnlyItsOwnIdentifier) {
    (void)codeOf({{"Command", 18}, {"Identifier", "other"}, {"Entitlements", Dictionary{{appGroups, Array{"g"}}}}});
    const auto fenced = [&](const std::optional<std::string>& identifier) {
        auto granted = std::make_shared<platform::IdentityGrant>(*grant(identifier, everything));
        granted->onlyOwnIdentifier = true;
        as(granted);
    };
    struct Row {
        std::uint64_t command;
        std::optional<std::string> client;
        const char* identifier;
        std::uint64_t code;
    };
    const Row rows[] = {{0, "app", nullptr, 1},   {0, "app", "app", 1},     {0, "app", "other", 55},
                        {0, {}, "other", 55},     {0, {}, nullptr, 11},     {13, "app", nullptr, 1},
                        {13, "app", "app", 1},    {13, "app", "other", 55}, {14, "app", nullptr, 1},
                        {14, "app", "other", 55}, {16, "app", "app", 1},    {16, "app", "other", 55}};
    for (const auto& [command, client, identifier, code] : rows) {
        SCOPED_TRACE(std::to_string(command) + " for " + (identifier ? identifier : "(none)"));
        fenced(client);
        Dictionary message{{"Command", command}, {"UserID", 1}, {"ContainerClass", 2}, {"CreateIfNecessary", true}};
        if (identifier)
            message.set("Identifier", identifier);
        const Dictionary reply = request(message);
        EXPECT_EQ(errorOf(reply), code);
        EXPECT_EQ(reply.size() == 1, code != 1);
    }
    EXPECT_FALSE(world.find("other"));
}

// Goal: whose system container and which system group a client reaches. Method: a table of clients and requests.
TEST_F(Shared, SystemContainersAndGroups) {
    const Dictionary owner{{systemContainer, true}};
    const Dictionary member{{systemGroups, Array{"systemgroup.s", "bare"}}};
    const Dictionary powerful{{std::string(powers::otherIdLookup), true}};
    const auto container = [](const char* identifier) {
        return identifier ? Dictionary{{"Command", 15}, {"Identifier", identifier}} : Dictionary{{"Command", 15}};
    };
    const auto group = [](plist::Value identifier) {
        return Dictionary{{"Command", 17}, {"GroupIdentifier", std::move(identifier)}};
    };
    const auto groupOf = [&](const char* identifier, const char* name) {
        Dictionary message = group(name);
        message.set("Identifier", identifier);
        return message;
    };
    struct Row {
        const char* name;
        std::optional<std::string> client;
        Dictionary entitlements;
        Dictionary message;
        std::uint64_t code;
    };
    const Row rows[] = {
        {"its own", "owner", owner, container(nullptr), 1},
        {"not entitled to one", "plain", {}, container(nullptr), 55},
        {"another's, who is entitled", "plain", {}, container("owner"), 1},
        {"a well-known one", "plain", {}, container("com.veltra.settingsd"), 1},
        {"another's, who is not", "plain", {}, container("nobody"), 55},
        {"any, with the power", "lookup", powerful, container("nobody"), 1},
        {"nobody's", std::nullopt, {}, container(nullptr), 11},
        {"its group", "member", member, group("systemgroup.s"), 1},
        {"a group without its prefix", "member", member, group("bare"), 55},
        {"a well-known group", "plain", {}, group("systemgroup.com.veltra.fonts"), 1},
        {"an unknown group", "plain", {}, group("systemgroup.s"), 55},
        {"another's group", "plain", {}, groupOf("member", "systemgroup.s"), 55},
        {"its group, as another", "member", member, groupOf("plain", "systemgroup.s"), 21},
        {"no client", std::nullopt, {}, group("systemgroup.s"), 55},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        asClient(row.client, row.entitlements);
        const Dictionary reply = request(row.message);
        EXPECT_EQ(errorOf(reply), row.code);
        const std::string* path = reply.string("ReplyPath");
        EXPECT_EQ(path != nullptr && isThere(*path), row.code == 1);
        EXPECT_EQ(reply.size(), row.code == 1 ? 2U : 1U);
    }
    // A container that cannot be made is not found, whatever the reason.
    asClient("newcomer", {{systemGroups, Array{"systemgroup.n"}}});
    (void)request({{"Command", 13}, {"UserID", 1}}); // registers
    world.refuse(DiskCall::rename, EIO);
    EXPECT_EQ(codeOf(group("systemgroup.n")), 21U);
}

// Goal: a peer is registered by its messages, never over what an installer registered, and never refused for it.
// Method: messages in a row, the map after each.
TEST_F(Shared, PeersRegisterThemselves) {
    const Dictionary first{{appGroups, Array{"g"}}};
    const Dictionary changed{{appGroups, Array{"h"}}};
    const Dictionary flag{{"app", true}};
    const Dictionary ask{{"Command", 13}, {"UserID", 1}};
    const auto registered = [&] { return mapping().entitlementMappingDict(); };
    asClient("app", first);
    EXPECT_EQ(groupsIn(request(ask)), (std::set<std::string>{"g"})); // served with what it brought
    EXPECT_EQ(registered(), (Dictionary{{"app", first}, {byCaller, flag}}));
    world.disk().arm({.filter = [](const DiskCallInfo& call) {
        ADD_FAILURE() << call.describe();
        return false;
    }});
    EXPECT_EQ(groupsIn(request(ask)), (std::set<std::string>{"g"}));
    world.disk().disarm();
    asClient("app", changed);
    EXPECT_EQ(groupsIn(request(ask)), (std::set<std::string>{"h"}));
    EXPECT_EQ(registered(), (Dictionary{{"app", changed}, {byCaller, flag}}));
    // Removed by somebody, it is registered again at once, though its registration was not due at its last message.
    (void)request(ask);
    EXPECT_EQ(world.entitle("app", {}), ErrorCode::success);
    EXPECT_EQ(groupsIn(request(ask)), (std::set<std::string>{"h"}));
    EXPECT_EQ(registered(), (Dictionary{{"app", changed}, {byCaller, flag}}));
    asInstaller();
    EXPECT_EQ(codeOf({{"Command", 18}, {"Identifier", "app"}, {"Entitlements", first}}), 1U);
    asClient("app", changed);
    EXPECT_EQ(groupsIn(request(ask)), (std::set<std::string>{"g"}));
    EXPECT_EQ(*registered().dictionary("app"), first);

    // Without entitlements to store only the flag is.
    asClient("bare");
    (void)request(ask);
    EXPECT_TRUE(registered().dictionary(byCaller)->isTrue("bare"));
    EXPECT_EQ(registered().find("bare"), nullptr);
    // A registration that cannot be saved is made up for.
    asClient("late", first);
    world.disk().arm({.error = ENOSPC, .filter = [](const DiskCallInfo& call) {
                          return call.subject.ends_with("-> zor_entitlements.plist");
                      }});
    EXPECT_EQ(codeOf(ask), 1U);
    world.disk().disarm();
    EXPECT_EQ(codeOf(ask), 1U);
    world.restart();
    EXPECT_TRUE(mapping().identifierHasCallerRegisteredEntitlements("late"));
}

} // namespace
} // namespace zor::test
