// SPDX-License-Identifier: Apache-2.0
#include "zorvane/Client.h"
#include "ipc/Frame.h"
#include "ipc/Identifiers.h"
#include "ipc/Protocol.h"
#include "support/FakeServer.h"
#include "support/Frames.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <future>

namespace zorvane {
namespace {

namespace ipc = zor::ipc;
namespace plist = zor::plist;
using Kind = Error::Kind;

using zor::support::frameOf;

plist::Data reply(const plist::Value& root, std::uint64_t id) {
    return frameOf(root, id, ipc::frameIsReply);
}

void put(int socket, const plist::Data& bytes) {
    zor::support::sendAll(socket, bytes);
}

/// The next request; empty at the end of the stream.
plist::Dictionary next(int socket, std::uint64_t& id) {
    const auto request = zor::support::receiveFrame(socket);
    EXPECT_TRUE(!request || (request->header.isValidRequest() && request->header.expectsReply()));
    id = request ? request->header.id : 0;
    return request ? request->message() : plist::Dictionary();
}

ConnectOptions optionsOf(const std::string& root, std::uint32_t timeoutMilliseconds = 10'000) {
    return {.root = root, .timeoutMilliseconds = timeoutMilliseconds};
}

/// Reads one request of one client and then does what the test says.
class ScriptedDaemon : public zor::support::FakeServer {
public:
    using Script = std::function<void(int socket, std::uint64_t id)>;
    explicit ScriptedDaemon(Script script, std::size_t depth = 1)
        : FakeServer(
              [script = std::move(script)](int socket) {
                  std::uint64_t id = 0;
                  if (!next(socket, id).empty())
                      script(socket, id);
              },
              Accepts::one, depth) {}
    [[nodiscard]] Client connect(std::uint32_t timeoutMilliseconds = 10'000) const {
        auto client = Client::connect(optionsOf(root(), timeoutMilliseconds));
        EXPECT_TRUE(client) << client.error().message;
        return std::move(*client);
    }
};

plist::Dictionary found() {
    return {{"ReplyError", std::uint64_t{1}},
            {"ReplyUUID", plist::Data(16, 0xAB)},
            {"ReplyExisted", true},
            {"ReplyPath", "/somewhere"},
            {"ReplyIdentifier", "a.b"}};
}

plist::Dictionary without(plist::Dictionary dictionary, std::string_view key) {
    dictionary.erase(key);
    return dictionary;
}

plist::Dictionary with(plist::Dictionary dictionary, std::string_view key, plist::Value value) {
    dictionary.set(key, std::move(value));
    return dictionary;
}

// A call ends with the right kind of error and no crash, whatever a daemon sends or does not send.
TEST(Client, EveryAnswerHasItsKind) {
    struct Row {
        const char* what;
        ScriptedDaemon::Script script;
        std::optional<Kind> kind;
        std::uint64_t code = 0;
    };
    const auto answer = [](const plist::Value& root) {
        return [root](int socket, std::uint64_t id) { put(socket, reply(root, id)); };
    };
    const auto bytes = [](plist::Data data) {
        return [data = std::move(data)](int socket, std::uint64_t) { put(socket, data); };
    };
    const std::vector<Row> rows = {
        {"right", answer(found()), std::nullopt},
        {"another's reply first",
         [](int socket, std::uint64_t id) {
             put(socket, reply(plist::Dictionary{{"ReplyError", std::uint64_t{5}}}, id + 7));
             put(socket, reply(found(), id));
         },
         std::nullopt},
        {"in single bytes",
         [](int socket, std::uint64_t id) {
             for (const std::uint8_t byte : reply(found(), id))
                 put(socket, {byte});
         },
         std::nullopt},
        {"closed without an answer", [](int, std::uint64_t) {}, Kind::refused},
        {"half a header", bytes({1, 0, 0}), Kind::refused},
        {"half a payload", bytes(frameOf(100, 2, 1, plist::Data(50))), Kind::refused},
        {"a gigabyte promised, nothing sent", bytes(frameOf(1'000'000'000, 2, 1, {})), Kind::refused},
        {"more than a client takes", bytes(frameOf(0xFFFF'FFFF, 2, 1, {})), Kind::protocol},
        {"no length", bytes(frameOf(0, 2, 1, {})), Kind::protocol},
        {"no reply bit", bytes(frameOf(4, 0, 1, plist::Data(4))), Kind::protocol},
        {"unknown flag", bytes(frameOf(4, 6, 1, plist::Data(4))), Kind::protocol},
        {"no property list", bytes(frameOf(4, 2, 1, plist::Data(4))), Kind::protocol},
        {"an array", answer(plist::Array{}), Kind::protocol},
        {"no code", answer(without(found(), "ReplyError")), Kind::protocol},
        {"code of another type", answer(with(found(), "ReplyError", "1")), Kind::protocol},
        {"no path", answer(without(found(), "ReplyPath")), Kind::protocol},
        {"short UUID", answer(with(found(), "ReplyUUID", plist::Data(15))), Kind::protocol},
        {"not found", answer(plist::Dictionary{{"ReplyError", std::uint64_t{21}}}), Kind::daemon, 21},
        {"a code from the future", answer(plist::Dictionary{{"ReplyError", ~std::uint64_t{0}}}), Kind::daemon,
         ~std::uint64_t{0}},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.what);
        const ScriptedDaemon daemon(row.script);
        Client client = daemon.connect();
        const auto container = client.createOrLookup({.containerClass = 2, .identifier = "a.b"});
        if (!row.kind) {
            ASSERT_TRUE(container) << container.error().message;
            EXPECT_EQ(container->path, "/somewhere");
            EXPECT_EQ(container->identifier, "a.b");
            EXPECT_TRUE(container->existed);
            EXPECT_EQ(uuidText(container->uuid), "ABABABAB-ABAB-ABAB-ABAB-ABABABABABAB");
            continue;
        }
        ASSERT_FALSE(container);
        EXPECT_EQ(container.error().kind, *row.kind) << container.error().message;
        EXPECT_EQ(container.error().code, row.code);
        EXPECT_FALSE(container.error().message.empty());
    }
}

// A list is whole or an error: pairs of arrays that do not fit each other.
TEST(Client, ListsAreJudged) {
    const plist::Value uuid = plist::Data(16, 1);
    struct Row {
        plist::Dictionary message;
        std::optional<std::size_t> count;
    };
    const plist::Dictionary empty = {{"ReplyError", std::uint64_t{1}}};
    const auto lists = [&](plist::Array identifiers, plist::Array uuids) {
        return with(with(empty, "ReplyIdsArray", std::move(identifiers)), "ReplyUUIDsArray", std::move(uuids));
    };
    for (const Row& row : std::initializer_list<Row>{
             {lists({}, {}), 0},
             {lists({"a", "b"}, {uuid, uuid}), 2},
             {lists({"a", "b"}, {uuid}), std::nullopt},
             {lists({"a"}, {uuid, uuid}), std::nullopt},
             {lists({std::uint64_t{1}}, {uuid}), std::nullopt},
             {lists({"a"}, {"b"}), std::nullopt},
             {empty, std::nullopt},
         }) {
        const ScriptedDaemon daemon([&](int socket, std::uint64_t id) { put(socket, reply(row.message, id)); });
        const auto list = daemon.connect().list(2, 501, false);
        EXPECT_EQ(list ? std::optional(list->size()) : std::nullopt, row.count);
        EXPECT_TRUE(list || list.error().kind == Kind::protocol);
    }
}

// A list comes in as many pages as there are, and one that would not come to its end is refused.
TEST(Client, ListsComeInPages) {
    for (const bool ends : {true, false}) {
        std::string asked;
        const ScriptedDaemon daemon([&](int socket, std::uint64_t id) {
            plist::Dictionary page{{"ReplyError", std::uint64_t{1}},
                                   {"ReplyIdsArray", plist::Array{"a"}},
                                   {"ReplyUUIDsArray", plist::Array{plist::Data(16, 1)}},
                                   {"ReplyNextPage", "a"}};
            put(socket, reply(page, id));
            const plist::Dictionary request = next(socket, id);
            asked = request.string("PageAfter") ? *request.string("PageAfter") : "";
            if (ends)
                page.erase("ReplyNextPage");
            put(socket, reply(page, id));
        });
        const auto list = daemon.connect().list(2, 501, false);
        EXPECT_EQ(list ? list->size() : 0, ends ? 2U : 0U);
        EXPECT_EQ(asked, "a");
    }
}

// A call takes no longer than its time, from a daemon that is silent and from one that sends a byte now and then.
TEST(Client, TimeRunsOut) {
    for (const bool drips : {false, true}) {
        std::promise<void> over;
        const ScriptedDaemon daemon([&, done = over.get_future().share()](int socket, std::uint64_t id) {
            for (const std::uint8_t byte : reply(found(), id)) {
                if (done.wait_for(std::chrono::milliseconds(20)) == std::future_status::ready)
                    return;
                if (drips)
                    put(socket, {byte});
            }
            done.wait();
        });
        Client client = daemon.connect(150);
        const auto begin = std::chrono::steady_clock::now();
        const auto done = client.emptyDeathRow();
        const auto taken = std::chrono::steady_clock::now() - begin;
        // Nor does a connect, where others have taken all the room for those who wait.
        std::vector<Client> waiting;
        auto another = Client::connect(optionsOf(daemon.root(), 150));
        for (; another && waiting.size() < 8; another = Client::connect(optionsOf(daemon.root(), 150)))
            waiting.push_back(std::move(*another));
        over.set_value();
        EXPECT_TRUE(!another && another.error().kind == Kind::timedOut);
        EXPECT_TRUE(!done && done.error().kind == Kind::timedOut);
        EXPECT_GE(taken, std::chrono::milliseconds(150));
        EXPECT_LT(taken, std::chrono::seconds(5));
    }
}

// A daemon that is not there is said so, with the path: no directory, or a socket that nobody listens on any more.
TEST(Client, NobodyThere) {
    const auto expectUnreachable = [](const ConnectOptions& options) {
        const auto client = Client::connect(options);
        ASSERT_FALSE(client);
        EXPECT_EQ(client.error().kind, Kind::unreachable);
        EXPECT_NE(client.error().message.find(options.root + "/run/zorvane/com.veltra.zorvaned"), std::string::npos)
            << client.error().message;
        const auto answer = status(options);
        ASSERT_FALSE(answer);
        EXPECT_EQ(answer.error().kind, Kind::unreachable);
    };
    expectUnreachable({.root = "/nonexistent"});
    ScriptedDaemon gone([](int, std::uint64_t) {});
    auto client = Client::connect(optionsOf(gone.root()));
    ASSERT_TRUE(client);
    // Hung up upon while it waits, and then before it has sent all: why is not known in either case.
    for (int call = 0; call < 2; ++call) {
        const auto done = client->emptyDeathRow();
        ASSERT_FALSE(done);
        EXPECT_EQ(done.error().kind, Kind::refused);
        EXPECT_NE(done.error().message.find("whom it takes this program for"), std::string::npos)
            << done.error().message;
    }
    gone.stopListening();
    expectUnreachable(optionsOf(gone.root()));
}

TEST(Client, RootsOfAnyLength) {
    for (const std::size_t depth : {48U, 49U, 50U, 51U, 52U, 53U, 54U, 55U, 250U}) {
        const ScriptedDaemon daemon([](int socket, std::uint64_t id) { put(socket, reply(found(), id)); }, depth);
        EXPECT_TRUE(daemon.connect().createOrLookup({.containerClass = 2, .identifier = "a.b"})) << depth;
    }
}

} // namespace
} // namespace zorvane
