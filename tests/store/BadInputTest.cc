// SPDX-License-Identifier: Apache-2.0
// Goal: whatever stands in a request in the place of what is meant, the command answers with its code and the disk
// stays as it was. Method: a good request for each command; every key in turn absent, of every other type and out of
// range, the whole tree compared; then the good one.
#include "ipc/Identifiers.h"
#include "store/DispatchFixture.h"

namespace zor::test {
namespace {

using plist::Array;
using plist::Data;
using plist::Dictionary;
using plist::Value;

const std::string group = "systemgroup.com.example";
const std::string notUtf8 = "a\xff\xfe";

/// Names that a client may think of; all but the last are text.
const std::vector<std::string> names = {"",
                                        ".",
                                        "..",
                                        "../../etc/passwd",
                                        "a/b",
                                        "/",
                                        "a\nb",
                                        "a\tb\x01\x1b[2J\x7f",
                                        "%s%n%@",
                                        "\xc3\xa4\xe2\x82\xac\xf0\x9f\x92\xa9",
                                        std::string(255, 'x'),
                                        std::string(256, 'x'),
                                        std::string(256, '/'),
                                        std::string(70'000, 'x'),
                                        notUtf8};

/// One key of a request. A key with a code for names that mean nothing is tried with every one of them, a UUID with one
/// that no container has. "@app" and the like stand for UUIDs of containers.
struct Key {
    const char* name;
    Value good;
    /// The code when it is absent or of another type; 0 leaves these out.
    std::uint64_t unread;
    std::uint64_t unknown = 0;
    /// Further bad values with their codes.
    std::vector<std::pair<Value, std::uint64_t>> more = {};
};

enum class Asks { installer, client };

struct Row {
    std::uint64_t command;
    Asks asks;
    std::vector<Key> keys;
};

std::vector<Key> operator+(std::vector<Key> keys, Key key) {
    keys.push_back(std::move(key));
    return keys;
}

Value nested(int depth) {
    Value value = 1;
    for (int i = 0; i < depth; ++i)
        value = Array{value};
    return value;
}

const std::vector<Row>& rows() {
    const Key user = {"UserID", 501, 38, 0, {{0, 38}, {33, 38}, {500, 38}, {511, 38}, {0xFFFFFFFFU, 38}, {-501, 38}}};
    const Key ownUser = {"UserID", 501, 38, 0, {{502, 38}, {33, 38}}};
    const Key ownName = {"Identifier", "com.example", 1, 1};
    const std::vector<Key> place = {
        {"ContainerClass", 2, 38, 0, {{0, 38}, {1, 38}, {14, 38}, {~std::uint64_t{0}, 38}, {-2, 38}}}, user};
    const std::vector<Key> known = place + Key{"UUID", "@app", 11, 21} + Key{"Identifier", "app", 21, 21};
    static const std::vector<Row> all = {
        {0, Asks::installer, place + Key{"Identifier", "new", 0} + Key{"CreateIfNecessary", true, 21}},
        {0, Asks::installer, place + Key{"Identifier", "app", 1, 21} + Key{"Transient", false, 1}},
        {1, Asks::installer, place + Key{"Transient", true, 1}},
        {2,
         Asks::installer,
         {{"OldContainerUUID", "@app", 27, 21},
          {"OldContainerClass", 2, 38, 0, {{0, 38}, {14, 38}, {4, 23}}},
          {"OldIdentifier", "app", 21, 21},
          {"OldContainerUserID", 501, 38, 0, {{500, 38}, {502, 56}}},
          {"NewContainerUUID", "@fresh", 11, 21},
          {"NewContainerClass", 2, 38, 0, {{0, 38}, {14, 38}, {4, 23}}},
          {"NewIdentifier", "app", 21, 21},
          {"NewContainerUserID", 501, 38, 0, {{500, 38}, {502, 56}}}}},
        {3,
         Asks::installer,
         {{"ContainerClassesArray",
           Array{2, 1},
           11,
           0,
           {{Array{2}, 11}, {Array{2, "1"}, 11}, {Array{2, 1, 2}, 11}, {Array{-2, 1}, 11}, {Array{2, 14}, 38}}},
          {"UUIDsArray",
           Array{"@app", "@bundle"},
           11,
           0,
           {{Array{"@app"}, 11},
            {Array{"@app", "b"}, 11},
            {Array{"@app", Data(15)}, 11},
            {Array{Data(16), Data(16)}, 1}}},
          {"UserIDsArray",
           Array{1, 33},
           40,
           0,
           {{Array{1, 34}, 38}, {Array{1, "33"}, 38}, {Array{34, 33}, 38}, {Array{1, 33, 1}, 11}, {Array{1, -33}, 38}}},
          {"IdentifiersArray", Array{"app", "bundle"}, 11, 0, {{Array{"app"}, 11}, {Array{5, true}, 1}}}}},
        {4, Asks::installer, {}},
        {5, Asks::installer,
         known + Key{"Key", "kept", 38, 0, {{notUtf8, 34}}} +
             Key{"Value", "v", 0, 0, {{notUtf8, 34}, {nested(64), 34}, {std::string(std::size_t{1} << 20, 'x'), 34}}}},
        {6, Asks::installer, known + Key{"Key", "kept", 38, 24}},
        {7, Asks::installer, known + Key{"InfoDictRequested", true, 1}},
        {8, Asks::installer, known},
        {9, Asks::installer, known},
        {10, Asks::installer, place + Key{"Identifier", "app", 11, 21}},
        {11, Asks::client, {ownUser, {"Identifier", "plug-in", 18, 55}}},
        {12, Asks::installer, place + Key{"Identifier", "app", 18, 21}},
        {13, Asks::client, {ownUser, ownName}},
        {14, Asks::installer, {user, ownName}},
        {15, Asks::client, {{"Identifier", "com.example", 1, 55}}},
        {16, Asks::client, {ownName}},
        {17, Asks::client, {{"GroupIdentifier", group, 55, 55}, {"Identifier", "com.example", 1, 21}}},
        {18,
         Asks::installer,
         {{"Identifier", "kept", 18},
          {"Entitlements", Dictionary{{"a", true}}, 11, 0, {{Dictionary{{notUtf8, true}}, 59}}},
          {"OptionsDictionary", Dictionary{}, 11}}},
        {19, Asks::installer,
         place + Key{"Identifier", "app", 11, 21} + Key{"IsThirdParty", true, 1} + Key{"RetryIfLocked", true, 1} +
             Key{"DataProtectionClass",
                 0,
                 1,
                 0,
                 {{2, 38}, {5, 38}, {-1, 38}, {256, 38}, {std::int64_t{1} << 32 | 2, 38}}}},
        {20, Asks::installer, known},
        {21, Asks::installer, known},
        {22, Asks::installer, {user, {"NumRetryCrashes", 0, 1}}},
    };
    return all;
}

/// Absent, and a value of each type that `good` has not. An absent dictionary is one that says nothing.
std::vector<std::optional<Value>> unreadable(const Value& good) {
    std::vector<std::optional<Value>> others = {2.0, plist::Date{}, Data(15), Data(17)};
    if (!good.asDictionary())
        others.insert(others.end(), {std::nullopt, Dictionary{{"a", 1}}});
    if (!good.asUnsigned())
        others.emplace_back(1);
    if (!good.asString() || good.asString()->starts_with('@'))
        others.insert(others.end(), {"2", "", std::string(70'000, 'x')});
    if (!good.asString() || !good.asString()->starts_with('@'))
        others.emplace_back(Data(16));
    if (!good.asBoolean())
        others.emplace_back(true);
    if (!good.asArray())
        others.emplace_back(Array{Dictionary{}});
    return others;
}

class BadInput : public Dispatch {
protected:
    void asClient() {
        as(grant("com.example", Dictionary{{std::string(powers::wipeContainer), Array{"plug-in"}},
                                           {systemContainer, true},
                                           {systemGroups, Array{group}}}));
    }
    /// Everything but what waits to be removed.
    [[nodiscard]] std::string tree() const { return support::readTree(world.path(), {dead}).describe(); }
    void expectTree(const std::string& before, const std::string& what) { ASSERT_TRUE(tree() == before) << what; }
    void expect(const Dictionary& message, std::uint64_t code, const std::string& what) {
        const Dictionary reply = request(message);
        EXPECT_EQ(errorOf(reply), code) << what;
        if (code != 1) {
            EXPECT_EQ(reply.size(), reply.find("ReplyDiskUsage") ? 2U : 1U) << what;
        }
    }
};

class BadRequest : public BadInput, public testing::WithParamInterface<Row> {};

TEST_P(BadRequest, IsRefusedAndChangesNothing) {
    const Row& row = GetParam();
    asInstaller();
    const std::map<std::string, Data> uuids = {{"@app", makeContainer("app")},
                                               {"@fresh", makeContainer("app", 2, asTransient)},
                                               {"@bundle", makeContainer("bundle", 1)}};
    std::function<Value(const Value&)> filled = [&](const Value& value) -> Value {
        if (const Array* array = value.asArray()) {
            Array copy;
            std::ranges::transform(*array, std::back_inserter(copy), filled);
            return copy;
        }
        const auto uuid = value.asString() ? uuids.find(*value.asString()) : uuids.end();
        return uuid == uuids.end() ? value : Value(uuid->second);
    };
    const auto goodOf = [&](const Row& one) {
        Dictionary message{{"Command", one.command}};
        for (const Key& key : one.keys)
            message.set(key.name, filled(key.good));
        return message;
    };
    // The containers that the requests find, and the directories that any of them may make.
    for (const char* identifier : {"installer", "gone"})
        (void)makeContainer(identifier);
    (void)makeContainer("plug-in", 4);
    expect({{"Command", 10}, {"ContainerClass", 2}, {"UserID", 501}, {"Identifier", "gone"}}, 1, "for death row");
    expect({{"ContainerClass", 7}, {"UserID", 501}, {"Identifier", "none"}}, 21, "for a class");
    expect({{"Command", 1}, {"ContainerClass", 1}, {"UserID", 33}, {"Transient", true}}, 1, "for a class");
    for (const Row& one : rows())
        if (one.command == 5 || one.command == 18 || one.command == 19)
            expect(goodOf(one), 1, "what is kept");
    asClient();
    expect({{"Command", 15}}, 1, "a system container");
    expect({{"Command", 16}}, 1, "a system group");
    if (row.asks == Asks::installer)
        asInstaller();
    world.internalBuild.internal = row.command == 22;
    const std::string before = tree();
    std::atomic<int> changes{0};
    world.disk().arm({.filter = [&](const support::DiskCallInfo&) {
        ++changes;
        return false;
    }});
    const auto attempt = [&](const char* key, const std::optional<Value>& value, std::uint64_t code) {
        // A text that can be no identifier is told before anything is looked up.
        const std::string* text = value ? value->asString() : nullptr;
        if (text && std::string_view(key).ends_with("Identifier") && !ipc::isIdentifier(*text))
            code = 11;
        Dictionary message = goodOf(row);
        message.erase(key);
        if (value)
            message.set(key, filled(*value));
        const std::string what = std::string(key) + " " + plist::describe(value ? &*value : nullptr).substr(0, 100);
        expect(message, code, what);
        if (changes.exchange(0) != 0)
            expectTree(before, what);
    };
    for (const Key& key : row.keys) {
        for (const auto& value : key.unread != 0 ? unreadable(key.good) : std::vector<std::optional<Value>>())
            attempt(key.name, value, key.unread);
        for (const auto& [value, code] : key.more)
            attempt(key.name, value, code);
        if (key.unknown != 0 && key.good.asString()->starts_with('@'))
            attempt(key.name, Data(16), key.unknown);
        else if (key.unknown != 0)
            for (const std::string& name : names)
                attempt(key.name, name, key.unknown);
        expectTree(before, key.name); // what does not go through the disk, too
    }
    world.disk().disarm();
    EXPECT_EQ(world.services().locks().identifiersInUse(), 0U);
    expect(goodOf(row), 1, "the good one");
}

INSTANTIATE_TEST_SUITE_P(Commands, BadRequest, testing::ValuesIn(rows()));

// Goal: a name is only a name: whatever text it is, what is made under it is found by a later daemon too, and leaves
// nothing when it goes. Method: for each name a container, and a group whose only member has that name.
TEST_F(BadInput, NamesAreOnlyNames) {
    asInstaller();
    std::vector<std::string> tried = names;
    tried.insert(tried.begin(), "the first makes what stays");
    std::string before;
    for (const std::string& name : tried) {
        SCOPED_TRACE(name.substr(0, 20) + " " + std::to_string(name.size()));
        const bool isText = ipc::isIdentifier(name);
        const std::uint64_t code = isText ? 1 : 11;
        Dictionary container{{"ContainerClass", 2}, {"UserID", 501}, {"Identifier", name}, {"CreateIfNecessary", true}};
        const Dictionary groups{{appGroups, Array{name}}};
        expect(container, code, "made");
        expect({{"Command", 18}, {"Identifier", name}, {"Entitlements", groups}}, code, "registered");
        if (isText) {
            world.restart();
            const Dictionary found = request(container);
            EXPECT_TRUE(found.isTrue("ReplyExisted") && *found.string("ReplyIdentifier") == name);
            expect({{"Command", 13}, {"UserID", 501}, {"Identifier", name}}, 1, "its group");
            container.set("Command", 10);
            expect(container, 1, "deleted");
        }
        expect({{"Command", 18}, {"Identifier", name}}, code, "let go");
        before = before.empty() ? tree() : before;
        expectTree(before, "all gone");
    }
}

} // namespace
} // namespace zor::test
