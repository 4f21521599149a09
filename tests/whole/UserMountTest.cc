// SPDX-License-Identifier: Apache-2.0
// File systems that users mount in what is theirs, and that never answer.
#include "process/DaemonProcess.h"
#include "support/HangingFileSystem.h"
#include "support/LongRun.h"

#include <atomic>
#include <chrono>
#include <gtest/gtest.h>

namespace zor::whole {

namespace {

constexpr uid_t second = 502;
constexpr double patienceSeconds = 8;

double secondsOf(const std::function<void()>& work) {
    const auto begin = std::chrono::steady_clock::now();
    work();
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - begin).count();
}

/// A daemon that may end while a thread of its own waits for a dead file system: no sanitizer can stop and search that
/// thread for leaks, and threads that ended before it are none.
void startWithoutLeakSearch(DaemonProcess& daemon) {
    for (const auto& [variable, option] :
         {std::pair("TSAN_OPTIONS", ":report_thread_leaks=0"), std::pair("ASAN_OPTIONS", ":detect_leaks=0")}) {
        const char* const options = std::getenv(variable);
        ::setenv(variable, (std::string(options ? options : "") + option).c_str(), 1);
    }
    daemon.start();
}

using Asks = std::function<bool(zorvane::Client&)>;

/// Whether the daemon answers at all, be it with an error of its own.
bool isAnswered(const DaemonProcess& daemon, const Asks& ask) {
    auto client = zorvane::Client::connect({.root = daemon.root(), .timeoutMilliseconds = 8'000});
    return client && ask(*client);
}
bool come(const auto& answer) {
    return answer || answer.error().kind == zorvane::Error::Kind::daemon;
}

bool serves(const DaemonProcess& daemon, uid_t user) {
    auto client = zorvane::Client::connect({.root = daemon.root(), .timeoutMilliseconds = 8'000});
    auto lookup = dataContainer("app");
    lookup.user = user;
    return client && client->createOrLookup(lookup);
}

/// Each kind of request about the container, all answered.
void expectAnswers(const DaemonProcess& daemon, const zorvane::Client::Address& app) {
    using C = zorvane::Client&;
    const Asks requests[] = {
        [](C client) { return come(client.createOrLookup(dataContainer("app"))); },
        [](C client) { return come(client.createOrLookup(dataContainer("new"))); },
        [](C client) { return come(client.createOrLookup(dataContainer("t", true))); },
        [](C client) { return come(client.list(dataApplication, mobile, false)); },
        [&](C client) { return come(client.diskUsage(app)); },
        [&](C client) { return come(client.recreateDefaultStructure(app)); },
        [&](C client) { return come(client.setInfoValue(app, "k", zorvane::Value{true})); },
        [&](C client) { return come(client.setDataProtection({dataApplication, mobile, "app", 1})); },
        [](C client) { return come(client.processEntitlements({.identifier = "app"})); },
        [](C client) { return come(client.wipe(dataApplication, mobile, "app")); },
        [&](C client) { return come(client.stageForDelete({app})); },
        [](C client) { return come(client.emptyDeathRow()); },
    };
    for (const Asks& request : requests)
        EXPECT_TRUE(isAnswered(daemon, request)) << &request - requests;
}

} // namespace

// Goal: a file system that never answers, wherever a user can mount it, or a home that is served over a network, keeps
// nobody else, no end and no start waiting. Method: mounts on a real daemon's root whose server is silent.
TEST(UserMount, KeepsNobodyWaiting) {
    struct Row {
        const char* below; // of the home; "@" is the container
        uid_t server;
    };
    const Row rows[] = {{"", mobile},
                        {"", 0},
                        {"Containers", mobile},
                        {"Containers/Data/Application", mobile},
                        {"@", mobile},
                        {"@/Documents", mobile},
                        {"@/Documents/file", mobile},
                        {"@/.com.veltra.zorvane.metadata.plist", mobile}};
    for (const Row& row : rows) {
        SCOPED_TRACE(std::string(row.below) + " served by " + std::to_string(row.server));
        DaemonProcess daemon;
        // An entry may name a program of the user's.
        daemon.registerProgram("05-own", daemon.path("private/var/mobile/tool"), "");
        writeFile(daemon.path("private/var/mobile/tool"), "x");
        startWithoutLeakSearch(daemon);
        const auto made = daemon.client().createOrLookup(dataContainer("app")).value();
        ASSERT_TRUE(serves(daemon, second));
        writeFile(made.path + "/Documents/file", "x");
        const std::string below = row.below;
        const std::string place = below.starts_with('@')
                                      ? made.path + below.substr(1)
                                      : daemon.path("private/var/mobile") + (below.empty() ? "" : "/") + below;
        std::optional<support::HangingFileSystem> hanging(std::in_place, place, row.server);
        if (!hanging->mounted())
            GTEST_SKIP() << "file systems of users (FUSE) cannot be mounted here";
        std::atomic<bool> ended = false;
        std::thread lookups([&] {
            while (!ended) {
                EXPECT_LT(secondsOf([&] { EXPECT_TRUE(serves(daemon, second)); }), patienceSeconds);
                std::this_thread::sleep_for(std::chrono::milliseconds(20));
            }
        });
        expectAnswers(daemon, {dataApplication, mobile, "app", made.uuid});
        ended = true;
        lookups.join();
        EXPECT_LT(secondsOf([&] { EXPECT_EQ(daemon.terminate(), 0); }), patienceSeconds);
        for (const bool boot : {true, false}) {
            daemon.start(boot ? std::vector<std::string>{"--forget-boot"} : std::vector<std::string>());
            EXPECT_TRUE(serves(daemon, second));
            EXPECT_TRUE(
                isAnswered(daemon, [](auto& client) { return come(client.createOrLookup(dataContainer("other"))); }));
            EXPECT_LT(secondsOf([&] { EXPECT_EQ(daemon.terminate(), 0); }), patienceSeconds);
        }
        EXPECT_LT(secondsOf([&] { (void)daemon.tool({"check"}); }), patienceSeconds);
        hanging.reset();
        daemon.start();
        EXPECT_TRUE(serves(daemon, mobile)) << daemon.log();
    }
}

// Goal: a home that is served over a network and falls silent keeps nobody else, also right after it has answered.
// Method: a mount that answers until it has answered a request; then requests for it beside those of another user.
TEST(UserMount, AHomeThatFallsSilent) {
    DaemonProcess daemon;
    startWithoutLeakSearch(daemon);
    ASSERT_TRUE(serves(daemon, second));
    support::HangingFileSystem home(daemon.path("private/var/mobile"), 0);
    if (!home.mounted())
        GTEST_SKIP() << "file systems of users (FUSE) cannot be mounted here";
    home.answer(mobile);
    const auto asks = [&] {
        return isAnswered(daemon, [](auto& client) { return come(client.createOrLookup(dataContainer("new"))); });
    };
    EXPECT_LT(secondsOf([&] { EXPECT_TRUE(asks()); }), 1);
    EXPECT_TRUE(isAnswered(daemon, [](auto& one) { return come(one.emptyDeathRow()); })); // no pass is in its midst
    home.fallSilent();
    std::jthread asking([&] { EXPECT_TRUE(asks()); });
    auto client = daemon.client();
    auto another = dataContainer("another"); // made, which takes the lock
    another.user = second;
    for (int i = 0; i < 40; ++i) {
        another.identifier = "another" + std::to_string(i);
        EXPECT_LT(secondsOf([&] { EXPECT_TRUE(client.createOrLookup(another)); }), 1);
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
    }
    asking.join();
    EXPECT_LT(secondsOf([&] { EXPECT_EQ(daemon.terminate(), 0); }), patienceSeconds);
}

// Goal: what waits for ever, for a file system that only the system mounts, does not keep the daemon from ending: not a
// request, and work under way for a minute at most. Method: a mount whose server is silent in the place of a class of
// the system's, and a request for it; in the long form also one in the place of what is to be deleted.
TEST(SystemMount, KeepsNoEndWaiting) {
    struct Row {
        const char* place;
        bool isWork;
        int secondsMin;
        int secondsMax;
    };
    for (const auto& [place, isWork, secondsMin, secondsMax] :
         {Row{"private/var/containers/Data/System", false, 0, 15},
          Row{"private/var/root/Library/Caches/com.veltra.zorvaned/Dead", true, 50, 70}}) {
        if (isWork && !support::isLongRun())
            continue;
        DaemonProcess daemon;
        startWithoutLeakSearch(daemon);
        auto system = dataContainer("app");
        system.containerClass = 12; // Data/System
        system.user = 499;
        ASSERT_TRUE(daemon.client().createOrLookup(system));
        const support::HangingFileSystem hanging(daemon.path(place), 0);
        if (!hanging.mounted())
            GTEST_SKIP() << "file systems of users (FUSE) cannot be mounted here";
        std::thread request([&, isRemoval = isWork] {
            auto client = daemon.client();
            system.identifier = "another";
            EXPECT_FALSE(isRemoval ? come(client.emptyDeathRow()) : come(client.createOrLookup(system)));
        });
        std::this_thread::sleep_for(std::chrono::milliseconds(200)); // it waits
        const double seconds = secondsOf([&] { EXPECT_EQ(daemon.terminate(), 0); });
        EXPECT_TRUE(seconds > secondsMin && seconds < secondsMax) << seconds;
        request.join();
    }
}

} // namespace zor::whole
