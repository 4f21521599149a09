// SPDX-License-Identifier: Apache-2.0
#include "process/DaemonProcess.h"
#include "process/Relay.h"
#include "support/Frames.h"
#include "zorvane/zorvane.h"

#include <gtest/gtest.h>

#include <memory>
#include <poll.h>
#include <unistd.h>

namespace zor::whole {
namespace {

using Result = std::unique_ptr<zorvane_result, decltype(&zorvane_result_free)>;
using Client = std::unique_ptr<zorvane_client, decltype(&zorvane_client_free)>;
using Async = std::unique_ptr<zorvane_async, decltype(&zorvane_async_free)>;
using Value = std::unique_ptr<zorvane_value, decltype(&zorvane_value_free)>;

constexpr std::int64_t patience = 20'000;
constexpr const char* app = "org.example.notes";
constexpr const char* plugin = "org.example.plugin";
constexpr const char* group = "group.org.example";
constexpr const char* systemGroup = "systemgroup.org.example";

Client connected(const std::string& root) {
    zorvane_error error;
    Client client(zorvane_connect(root.c_str(), patience, &error), zorvane_client_free);
    EXPECT_TRUE(client) << error.message;
    return client;
}

zorvane_address addressOf(const char* identifier, const zorvane_result* found) {
    zorvane_address address{ZORVANE_DATA_APPLICATION, mobile, identifier, {}};
    if (const std::uint8_t* uuid = zorvane_result_uuid(found))
        std::memcpy(address.uuid, uuid, sizeof address.uuid);
    return address;
}

Value listOf(const char* text) {
    Value list(zorvane_value_list(), zorvane_value_free);
    EXPECT_EQ(zorvane_value_append(list.get(), zorvane_value_string(text)), ZORVANE_OK);
    return list;
}

/// A map with a value of every type.
Value everyType() {
    Value map(zorvane_value_map(), zorvane_value_free);
    const auto set = [&](const char* key, zorvane_value* value) {
        EXPECT_EQ(zorvane_value_set(map.get(), key, value), ZORVANE_OK) << key;
    };
    set("boolean", zorvane_value_boolean(1));
    set("integer", zorvane_value_integer(-7));
    set("unsigned", zorvane_value_unsigned(~std::uint64_t{0}));
    set("real", zorvane_value_real(0.5));
    set("string", zorvane_value_string("caf\xc3\xa9"));
    set("data", zorvane_value_data("\0\1", 2));
    set("date", zorvane_value_date(12.5));
    set("list", listOf("element").release());
    set("map", zorvane_value_map());
    return map;
}

bool isEveryType(const zorvane_value* map) {
    const auto at = [&](const char* key) { return zorvane_value_get(map, key); };
    std::size_t bytes = 0;
    const void* const data = zorvane_value_get_data(at("data"), &bytes);
    std::string keys;
    for (const char* key = nullptr; (key = zorvane_value_next_key(map, key));)
        keys += std::string(key) + std::to_string(zorvane_value_type(at(key))) + " ";
    EXPECT_EQ(keys, "boolean1 data6 date7 integer2 list8 map9 real4 string5 unsigned3 ");
    return zorvane_value_get_boolean(at("boolean")) == 1 && zorvane_value_get_integer(at("integer")) == -7 &&
           zorvane_value_get_unsigned(at("unsigned")) == ~std::uint64_t{0} &&
           zorvane_value_get_real(at("real")) == 0.5 && zorvane_value_get_real(at("date")) == 12.5 && bytes == 2 &&
           std::memcmp(data, "\0\1", 2) == 0 && std::string("caf\xc3\xa9") == zorvane_value_get_string(at("string")) &&
           std::string("element") == zorvane_value_get_string(zorvane_value_at(at("list"), 0));
}

/// One call: its request, how it ends, and what its answer has to be.
struct Row {
    const char* what;
    std::function<zorvane_request*()> request;
    int kind = ZORVANE_OK;
    std::uint64_t code = 0;
    std::function<bool(const zorvane_result*)> isRight = {};
};

void expectRows(zorvane_client* client, const std::vector<Row>& rows) {
    for (const Row& row : rows) {
        SCOPED_TRACE(row.what);
        zorvane_result* answer = nullptr;
        zorvane_error error{};
        EXPECT_EQ(zorvane_call(client, row.request(), &answer, &error), row.kind) << error.message;
        const Result result(answer, zorvane_result_free);
        EXPECT_EQ(error.kind, static_cast<std::uint32_t>(row.kind));
        EXPECT_EQ(error.code, row.code);
        EXPECT_EQ(result == nullptr, row.kind != ZORVANE_OK);
        EXPECT_EQ(*error.message == '\0', row.kind == ZORVANE_OK);
        EXPECT_TRUE(!row.isRight || row.isRight(result.get()));
    }
}

/// A daemon that lets this program do all that there is.
std::unique_ptr<DaemonProcess> started() {
    auto daemon = std::make_unique<DaemonProcess>();
    daemon->registerProgram("10-tests", ownProgram(),
                            "<key>Entitlements</key><dict><key>com.veltra.private.Zorvane.allowed</key><true/>"
                            "<key>com.veltra.private.Zorvane.wipeContainer</key><array><string>" +
                                std::string(plugin) + "</string></array></dict>");
    daemon->start();
    return daemon;
}

/// The other side: this version; a later one, which says more; the first one, which knew nothing of pages.
enum class Other { same, later, first };
class Versions : public testing::TestWithParam<Other> {};
INSTANTIATE_TEST_SUITE_P(CInterface, Versions, testing::Values(Other::same, Other::later, Other::first));

void speakAs(Other other, plist::Dictionary& message) {
    if (other == Other::later)
        message.set("OfALaterVersion", plist::Array{plist::Dictionary{{"Deep", true}}});
    for (const std::string_view later : {ipc::keys::pageAfter, ipc::keys::replyNextPage})
        if (other == Other::first)
            message.erase(later);
}

// Goal: every command works through the C interface and fails as the header says, also where client and daemon are of
// different versions. Method: a table of calls, in their order, of a real daemon behind a relay.
TEST_P(Versions, EveryCommand) {
    const auto daemon = started();
    const Relay relay(
        *daemon, [](ipc::Command) { return Fate::passedOn; },
        [](Relay::Message, plist::Dictionary& message) { speakAs(GetParam(), message); });
    const Client client = connected(relay.root());
    Result found(nullptr, zorvane_result_free);
    Result fresh(nullptr, zorvane_result_free);
    const auto lookUp = [&](Result& kept, const char* identifier, std::uint32_t flags) {
        zorvane_result* result = nullptr;
        EXPECT_EQ(zorvane_call(client.get(),
                               zorvane_request_lookup(ZORVANE_DATA_APPLICATION, mobile, identifier, flags), &result,
                               nullptr),
                  ZORVANE_OK);
        kept.reset(result);
        return addressOf(identifier, result);
    };
    const auto has = [](const char* path) { return path && *path == '/'; };
    const zorvane_address container = lookUp(found, app, ZORVANE_CREATE);
    const zorvane_address transient = lookUp(fresh, app, ZORVANE_CREATE | ZORVANE_TRANSIENT);
    const Value all = everyType();
    Value entitlements(zorvane_value_map(), zorvane_value_free);
    for (const auto& [key, value] : {std::pair("com.veltra.security.application-groups", listOf(group).release()),
                                     std::pair("com.veltra.security.system-groups", listOf(systemGroup).release()),
                                     std::pair("com.veltra.security.system-container", zorvane_value_boolean(1))})
        EXPECT_EQ(zorvane_value_set(entitlements.get(), key, value), ZORVANE_OK);
    const auto lookup = [](const char* identifier, std::uint32_t flags) {
        return [=] { return zorvane_request_lookup(ZORVANE_DATA_APPLICATION, mobile, identifier, flags); };
    };
    const auto isNotes = [&](const zorvane_result* result) {
        return zorvane_result_identifier(result) == std::string(app) && has(zorvane_result_path(result)) &&
               std::memcmp(zorvane_result_uuid(result), container.uuid, 16) == 0 && zorvane_result_existed(result);
    };
    const auto oneEntry = [&](const char* identifier, bool withPath) {
        return [=](const zorvane_result* result) {
            return zorvane_result_count(result) == 1 && has(zorvane_result_path_at(result, 0)) == withPath &&
                   zorvane_result_identifier_at(result, 0) == std::string(identifier) &&
                   !zorvane_result_identifier_at(result, 1);
        };
    };
    const auto hasPath = [&](const zorvane_result* result) { return has(zorvane_result_path(result)); };
    expectRows(
        client.get(),
        {
            {"lookup", lookup(app, 0), ZORVANE_OK, 0, isNotes},
            {"nothing there", lookup("org.example.absent", 0), ZORVANE_NOT_FOUND, 21},
            {"an unknown flag", lookup(app, 1U << 20U), ZORVANE_OTHER, 0},
            {"another command's flag", lookup(app, ZORVANE_THIRD_PARTY), ZORVANE_OTHER, 0},
            {"an empty identifier", lookup("", ZORVANE_CREATE), ZORVANE_OTHER, 0},
            {"no UTF-8", lookup("\xff", ZORVANE_CREATE), ZORVANE_OTHER, 0},
            {"no memory", [] { return static_cast<zorvane_request*>(nullptr); }, ZORVANE_OTHER, 0},
            {"no container", [] { return zorvane_request_metadata(nullptr); }, ZORVANE_OTHER, 0},
            {"list", [] { return zorvane_request_list(ZORVANE_DATA_APPLICATION, mobile, 0); }, ZORVANE_OK, 0,
             oneEntry(app, false)},
            {"page", [] { return zorvane_request_list_page(ZORVANE_DATA_APPLICATION, mobile, 0, app); }, ZORVANE_OK, 0,
             [](const auto* page) {
                 const std::size_t left = GetParam() == Other::first ? 1 : 0; // the whole list is its first page
                 return zorvane_result_count(page) == left && !zorvane_result_next_page(page);
             }},
            {"set info", [&] { return zorvane_request_set_info(&container, "k", all.get()); }},
            {"info", [&] { return zorvane_request_info(&container, "k"); }, ZORVANE_OK, 0,
             [](const auto* result) { return isEveryType(zorvane_result_value(result)); }},
            {"no such key", [&] { return zorvane_request_info(&container, "other"); }, ZORVANE_NOT_FOUND, 24},
            {"metadata", [&] { return zorvane_request_metadata(&container); }, ZORVANE_OK, 0,
             [&](const auto* result) {
                 return hasPath(result) && !zorvane_result_transient(result) &&
                        isEveryType(zorvane_value_get(zorvane_result_value(result), "k"));
             }},
            {"remove info", [&] { return zorvane_request_set_info(&container, "k", nullptr); }},
            {"disk usage", [&] { return zorvane_request_disk_usage(&container); }, ZORVANE_OK, 0,
             [](const auto* result) { return zorvane_result_bytes(result) > 0; }},
            {"recreate", [&] { return zorvane_request_recreate_structure(&container); }},
            {"regenerate", [&] { return zorvane_request_regenerate_directory(&container); }},
            {"protect", [] { return zorvane_request_set_protection(ZORVANE_DATA_APPLICATION, mobile, app, 1, 0); }},
            {"protect wrongly",
             [] { return zorvane_request_set_protection(ZORVANE_DATA_APPLICATION, mobile, app, 2, 0); }, ZORVANE_OTHER,
             38},
            {"replace", [&] { return zorvane_request_replace(&container, &transient); }},
            {"wipe", [] { return zorvane_request_wipe(ZORVANE_DATA_APPLICATION, mobile, app); }},
            {"make a plug-in's",
             [] { return zorvane_request_lookup(ZORVANE_DATA_KOLVEX_PLUGIN, mobile, plugin, ZORVANE_CREATE); }},
            {"wipe it", [] { return zorvane_request_wipe_plugin_data(mobile, plugin); }},
            {"wipe another's", [] { return zorvane_request_wipe_plugin_data(mobile, app); }, ZORVANE_REFUSED, 55},
            {"no map", [&] { return zorvane_request_register(app, listOf("a").get(), nullptr, 0); }, ZORVANE_OTHER, 0},
            {"register", [&] { return zorvane_request_register(app, entitlements.get(), nullptr, 0); }},
            {"groups", [] { return zorvane_request_group_paths(mobile, app); }, ZORVANE_OK, 0, oneEntry(group, true)},
            {"group names", [] { return zorvane_request_group_identifiers(mobile, app); }, ZORVANE_OK, 0,
             oneEntry(group, false)},
            {"system container", [] { return zorvane_request_system_path(app); }, ZORVANE_OK, 0, hasPath},
            {"system groups", [] { return zorvane_request_system_group_paths(app); }, ZORVANE_OK, 0,
             oneEntry(systemGroup, true)},
            {"another's system group", [] { return zorvane_request_system_group_path(systemGroup, app); },
             ZORVANE_REFUSED, 55},
            {"unregister", [] { return zorvane_request_register(app, nullptr, nullptr, 0); }},
            {"delete", [] { return zorvane_request_delete(ZORVANE_DATA_APPLICATION, mobile, app, 0); }},
            {"again", [] { return zorvane_request_delete(ZORVANE_DATA_APPLICATION, mobile, app, 0); },
             ZORVANE_NOT_FOUND, 21},
            {"stage", [&] { return zorvane_request_stage_for_delete(&container, 1); }},
            {"empty death row", [] { return zorvane_request_empty_death_row(); }},
            {"status", [] { return zorvane_request_status(); }, ZORVANE_OK, 0,
             [](const auto* result) {
                 const zorvane_value* peer = zorvane_value_get(zorvane_result_value(result), "Peer");
                 return zorvane_value_get_boolean(zorvane_value_get(peer, "Known")) == 1;
             }},
            {"retry test", [] { return zorvane_request_retry_test(mobile, 3); }},
        });
}

/// The outcomes of calls, in the order of their callbacks.
struct Answers {
    std::string kinds;
    static void take(void* data, zorvane_result* result, const zorvane_error* error) {
        static_cast<Answers*>(data)->kinds += error ? std::to_string(error->kind) : result ? "0" : "?";
        zorvane_result_free(result);
    }
};

bool isReadable(const Async& async, int milliseconds) {
    pollfd descriptor{.fd = zorvane_async_fd(async.get()), .events = POLLIN, .revents = 0};
    return ::poll(&descriptor, 1, milliseconds) == 1;
}

Async asyncOf(const std::string& root, std::int64_t timeout = patience) {
    return {zorvane_async_new(root.c_str(), timeout, nullptr), zorvane_async_free};
}

zorvane_request* notesRequest(std::uint32_t flags) {
    return zorvane_request_lookup(ZORVANE_DATA_APPLICATION, mobile, app, flags);
}

// Goal: calls are answered in their order through the descriptor, also across a daemon's end and start, and one that
// was cancelled is not answered. Method: a loop over poll, with a real daemon that is killed and started.
TEST(CInterface, AnswersComeThroughTheDescriptor) {
    const auto daemon = started();
    const Async async = asyncOf(daemon->root());
    Answers answers;
    const auto start = [&](zorvane_request* request) {
        return zorvane_async_start(async.get(), request, Answers::take, &answers, nullptr);
    };
    const auto await = [&](std::size_t count) {
        while (answers.kinds.size() < count && isReadable(async, patience))
            zorvane_async_dispatch(async.get());
    };
    EXPECT_FALSE(isReadable(async, 0));
    (void)start(notesRequest(0));
    (void)start(notesRequest(ZORVANE_CREATE));
    (void)start(notesRequest(1U << 20U));
    await(3);
    EXPECT_EQ(answers.kinds, "105");
    EXPECT_FALSE(isReadable(async, 0));

    // An answer that waits for the dispatch is the last thing that can be cancelled.
    const std::uint64_t call = start(notesRequest(0));
    EXPECT_TRUE(isReadable(async, patience));
    EXPECT_EQ(zorvane_async_cancel(async.get(), call), 1);
    EXPECT_EQ(zorvane_async_cancel(async.get(), call), 0);
    EXPECT_EQ(zorvane_async_dispatch(async.get()), 0U);
    EXPECT_FALSE(isReadable(async, 0));

    daemon->kill();
    (void)start(notesRequest(0));
    await(4);
    daemon->start();
    (void)start(notesRequest(0));
    await(5);
    EXPECT_EQ(answers.kinds, "10530");
}

// Goal: a daemon that is silent holds up neither a call longer than its time, nor a cancel, nor the end of the object.
// Method: a server that reads and never answers.
TEST(CInterface, SilenceHoldsNobodyUp) {
    const support::FakeServer silent([](int socket) {
        while (support::receiveFrame(socket))
            ;
    });
    zorvane_error error{};
    const Client client(zorvane_connect(silent.root().c_str(), 100, &error), zorvane_client_free);
    EXPECT_EQ(zorvane_call(client.get(), notesRequest(0), nullptr, &error), ZORVANE_TIMED_OUT);
    EXPECT_NE(std::strstr(error.message, "100 ms"), nullptr) << error.message;
    EXPECT_NE(*error.advice, '\0');

    Answers answers;
    Async async = asyncOf(silent.root(), ZORVANE_TIMEOUT_NEVER);
    const std::uint64_t call = zorvane_async_start(async.get(), notesRequest(0), Answers::take, &answers, nullptr);
    (void)zorvane_async_start(async.get(), notesRequest(1U << 20U), Answers::take, &answers, nullptr);
    EXPECT_FALSE(isReadable(async, 50));
    EXPECT_EQ(zorvane_async_cancel(async.get(), call), 1);
    EXPECT_TRUE(isReadable(async, patience));
    EXPECT_EQ(zorvane_async_dispatch(async.get()), 1U);
    (void)zorvane_async_start(async.get(), notesRequest(0), Answers::take, &answers, nullptr);
    EXPECT_FALSE(isReadable(async, 50));
    async.reset();
    EXPECT_EQ(answers.kinds, "5");
}

// Goal: programs of others build against the installed library as its packages say, and work. Method: the installed
// examples, built with pkg-config and CMake, run one after the other as programs that the daemon knows.
TEST(CInterface, InstalledForOthers) {
    const std::string build = ZORVANE_BINARY_DIR;
    if (::access((build + "/packaging/libzorvane.so").c_str(), F_OK) != 0)
        GTEST_SKIP() << "this build has no library for others";
    const support::TemporaryDirectory place("/tmp");
    const std::string sources = ZORVANE_SOURCE_DIR;
    const std::string python = std::filesystem::canonical("/usr/bin/python3");
    const Outcome built = runProgram({sources + "/tests/client/consumers.sh", sources, build, place.path()});
    ASSERT_EQ(built.exitStatus, 0) << built.output;
    DaemonProcess daemon;
    const auto known = [&](const std::string& program) {
        daemon.registerProgram(
            "30-" + program.substr(program.rfind('/') + 1), program,
            "<key>Entitlements</key><dict><key>com.veltra.private.Zorvane.allowed</key><true/></dict>");
    };
    const std::vector<std::string> programs = {"c99", "cxx17", "notes-c", "notes-cxx", "notes-cxx23", "notes-glib"};
    for (const std::string& program : programs)
        known(place.path() + "/bin/" + program);
    known(python);
    const std::string copy = place.path() + "/bin/python";
    std::filesystem::copy_file(python, copy);
    known(copy);
    daemon.start();
    const auto run = [&](std::vector<std::string> words, const std::string& end) {
        SCOPED_TRACE(words.back());
        words.insert(words.begin(), {"/usr/bin/env", "LD_LIBRARY_PATH=" + place.path() + "/lib",
                                     "PYTHONPATH=" + place.path() + "/usr/local/lib/python3/dist-packages"});
        words.push_back(daemon.root());
        const Outcome outcome = runProgram(words);
        EXPECT_EQ(outcome.exitStatus, 0) << outcome.output;
        EXPECT_TRUE(outcome.output.ends_with(end)) << outcome.output;
    };
    for (int starts = 0; const std::string& program : programs) {
        const std::string path = place.path() + "/bin/" + program;
        if (program != "notes-glib")
            run({path}, ", start " + std::to_string(++starts) + "\n");
        else if (::access(path.c_str(), X_OK) == 0)
            run({path}, ", found\n");
    }
    run({python, sources + "/packaging/examples/python/notes.py"}, ", start 6\n");
    run({copy, sources + "/tests/client/commands.py"}, "");
}

} // namespace
} // namespace zor::whole
