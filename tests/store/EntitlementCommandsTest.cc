// SPDX-License-Identifier: Apache-2.0
// Deletion, entitlements and shared containers from a request's keys to a reply's, and the registration of a peer by
// its own messages.
#include "store/DispatchFixture.h"
#include "store/ZOREntitlementMapping.h"

#include <set>

namespace zor::test {
namespace {

using plist::Array;
using plist::Dictionary;
using support::DiskCall;
using support::DiskCallInfo;

const char* const byCaller = "com.veltra.Zorvane.EntitlementsRegisteredByCaller";

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
    // What cannot be made is not found, whatever the reason.
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
