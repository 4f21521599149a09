// SPDX-License-Identifier: Apache-2.0
// Changing the data-protection class of a container: what is judged, what is set where, what waits for an unlock, and
// what happens to the container meanwhile.
#include "operations/ZORDataProtectionManager.h"
#include "support/LongRun.h"
#include "support/OpenWatch.h"
#include "world/World.h"

#include <csignal>
#include <gtest/gtest.h>
#include <sys/file.h>

namespace zor::test {
namespace {

using Request = ZORDataProtectionManager::Request;

constexpr std::chrono::seconds patience(5);
const std::string key = "com.veltra.Brevance.ContentProtectionClass";
const std::string identifier = "com.example.app";
const std::string assertionFile = "run/zorvane/assertions/com.example.app";

/// The outcome that a completion was told; a second answer throws.
class Answers {
public:
    ZORDataProtectionManager::Completion completion() {
        return [this](ErrorCode code) { told_.set_value(static_cast<std::uint64_t>(code)); };
    }
    [[nodiscard]] std::vector<std::uint64_t> codes(std::chrono::seconds wait = std::chrono::seconds(0)) const {
        const bool isTold = answer_.wait_for(wait) == std::future_status::ready;
        return isTold ? std::vector{answer_.get()} : std::vector<std::uint64_t>();
    }

private:
    std::promise<std::uint64_t> told_;
    const std::shared_future<std::uint64_t> answer_ = told_.get_future().share();
};

class Protection : public testing::Test {
protected:
    Protection() : world({.logLevel = logLevelDebug}) {
        world.load();
        useContainer();
    }
    ~Protection() override {
        if (suspended)
            world.linux().roles().lockStateQueue.resume();
    }
    void useContainer() {
        container = world.make(identifier);
        path = world.relative(container.path) + "/";
        world.log.take();
    }
    ZORDataProtectionManager& manager() { return world.services().store().dataProtection; }
    static Request to(int protectionClass, bool retryIfLocked = false) {
        return {.userId = mobile,
                .identifier = identifier,
                .containerClass = application,
                .dataProtectionClass = protectionClass,
                .retryIfLocked = retryIfLocked};
    }
    void ask(const Request& request, Answers& answers) {
        manager().setDataProtectionOnDataContainerForUser(request, answers.completion());
    }
    std::uint64_t change(const Request& request) {
        Answers answers;
        ask(request, answers);
        const auto codes = answers.codes();
        return codes.size() == 1 ? codes.front() : 0;
    }
    /// As main does when it is told.
    void lock() {
        world.lockState.state = 1;
        world.linux().roles().lockStateQueue.suspend();
        suspended = true;
    }
    void unlock() {
        world.lockState.state = 0;
        world.linux().roles().lockStateQueue.resume();
        suspended = false;
    }
    [[nodiscard]] platform::FileDescriptor open(const std::string& relative) const {
        return platform::FileDescriptor(
            ::open(world.path(relative).c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    }
    int classOf(const std::string& relative) { return world.protection().classOf(open(relative).get()).value_or(-1); }
    void put(const std::string& file, int protectionClass) {
        world.write(path + file, "x");
        ASSERT_FALSE(world.protection().setClass(open(path + file).get(), protectionClass));
    }
    void record(int protectionClass) {
        const plist::Value value(protectionClass);
        ASSERT_TRUE(world.daemonsClient().setInfoValue(&value, &key, address(), UseLocking::yes));
    }
    std::optional<std::int64_t> recorded() {
        const auto value = world.daemonsClient().infoValueForKey(&key, address(), UseLocking::yes);
        return value ? value->asSigned() : std::nullopt;
    }
    [[nodiscard]] ZORClientConnection::ContainerAddress address() const { return addressOf(container); }

    World world;
    FoundContainer container;
    std::string path; // relative to the root, with a slash
    bool suspended = false;
};

// Goal: exactly the classes that the change's kind says. Method: recorded and requested class, files before and after.
TEST_F(Protection, WhatIsSet) {
    struct Row {
        std::optional<int> recorded;
        int requested;
        int directory;
        std::vector<std::pair<int, int>> files; // class before and after
    };
    const Row rows[] = {
        {std::nullopt, 1, 1, {{3, 1}, {4, 1}, {1, 1}, {2, 2}, {0, 0}}}, // stricter: all, but not what is stricter still
        {1, 3, 3, {{1, 1}, {3, 3}, {4, 4}}},                            // laxer: directories alone
        {std::nullopt, 0, 0, {{4, 3}, {3, 3}, {1, 1}, {2, 2}}},         // none: files get 3
        {0, 1, 1, {{3, 1}, {2, 2}}},
        {0, 3, 3, {{4, 4}, {1, 1}}},
        {4, 3, 3, {{4, 3}, {5, 3}, {1, 1}}},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(std::to_string(row.recorded.value_or(-1)) + " to " + std::to_string(row.requested));
        record(row.recorded.value_or(3));
        for (std::size_t i = 0; i < row.files.size(); ++i)
            put("Library/Caches/" + std::to_string(i), row.files[i].first);
        put("outside the items", 4);
        put("Tillwerk/file", 2);
        EXPECT_EQ(change(to(row.requested)), 1U);
        for (const char* directory : {"Documents", "Library", "Library/Caches", "tmp", "Tillwerk"})
            EXPECT_EQ(classOf(path + directory), row.directory) << directory;
        for (std::size_t i = 0; i < row.files.size(); ++i)
            EXPECT_EQ(classOf(path + "Library/Caches/" + std::to_string(i)), row.files[i].second) << i;
        EXPECT_EQ(classOf(path + "outside the items"), 4);
        EXPECT_EQ(recorded(), row.requested);
        EXPECT_TRUE(manager().pending().empty());
        EXPECT_EQ(classOf(path + names::metadataFile), 4); // the daemon's own file is read while the device is locked
    }
    record(7);
    EXPECT_EQ(change(to(7)), 1U); // what it has is no change
    EXPECT_EQ(change(to(257)), 1U);
    EXPECT_EQ(classOf(path + "Documents"), 257); // and none is cut to fewer bits
}

// Goal: a locked device answers 61, or is waited for under an assertion, through a second lock too; what is said
// meanwhile belongs to the request. Method: lock, ask, unlock by hand.
TEST_F(Protection, WaitsForTheUnlock) {
    put("Documents/file", 4);
    lock();
    EXPECT_EQ(change(to(1)), 61U);
    EXPECT_FALSE(recorded());
    Answers answers;
    {
        const LogSubject::Describe request = [](const LogSubject::Take& take) { take("ZORVANE_REQUEST", "7"); };
        const LogRequestScope asked(request);
        ask(to(1, true), answers);
    }
    EXPECT_TRUE(answers.codes().empty());
    ASSERT_EQ(manager().pending().size(), 1U);
    EXPECT_EQ(manager().pending()[0].dataProtectionClass, 1);
    EXPECT_FALSE(world.exists(assertionFile));
    EXPECT_EQ(world.services().platform().transactions.count(), 1U);
    EXPECT_EQ(world.log.request(), "ZORVANE_REQUEST=7 ");
    // Unlocked and at once locked again: the queue runs and finds the device locked.
    world.linux().roles().lockStateQueue.resume();
    for (int i = 0; i < 2000 && !world.exists(assertionFile); ++i)
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    std::this_thread::sleep_for(std::chrono::milliseconds(60)); // several retries
    EXPECT_TRUE(answers.codes().empty());
    EXPECT_EQ(world.read(assertionFile), "0");
    const auto held = open(assertionFile);
    EXPECT_NE(::flock(held.get(), LOCK_SH | LOCK_NB), 0);
    EXPECT_EQ(world.services().platform().assertions.held(), std::vector<std::string>{"com.example.app"});
    world.lockState.state = 0;
    suspended = false;
    EXPECT_EQ(answers.codes(patience), std::vector<std::uint64_t>{1});
    EXPECT_EQ(world.log.request(), "ZORVANE_REQUEST=7 ");
    EXPECT_FALSE(world.exists(assertionFile));
    EXPECT_EQ(::flock(held.get(), LOCK_SH | LOCK_NB), 0);
    EXPECT_EQ(classOf(path + "Documents/file"), 1);
    EXPECT_EQ(recorded(), 1);
}

// Goal: a container moved, replaced, wiped or deleted while a change waits, or while it is walked, is not recorded as
// changed. Method: each before the unlock, then in the moment in which the walk opens a directory.
TEST_F(Protection, TheContainerChangesMeanwhile) {
    struct Row {
        const char* name;
        std::function<void()> meanwhile;
        std::uint64_t code;
    };
    ZORClientConnection& client = world.daemonsClient();
    const auto wipe = [&] { ASSERT_TRUE(client.deleteDataContainerContentForUser(mobile, &identifier, application)); };
    const Row rows[] = {
        {"wiped", wipe, 10},
        {"renamed", [&] { ASSERT_TRUE(client.regenerateDirectoryUUIDForUser(address())); }, 10},
        {"replaced",
         [&] {
             const FoundContainer fresh = world.make(identifier, application, asTransient);
             ASSERT_TRUE(world.replace(&container, fresh));
         },
         10},
        {"deleted", [&] { ASSERT_TRUE(client.deleteContainerForUser(mobile, &identifier, application, false)); }, 21},
    };
    for (const Row& row : rows)
        for (const bool waits : {true, false}) {
            SCOPED_TRACE(row.name);
            useContainer();
            put("Documents/file", 4);
            Answers answers;
            std::atomic<bool> done{false};
            if (waits) {
                lock();
                ask(to(1, true), answers);
                row.meanwhile();
                unlock();
            } else {
                const support::OpenWatch watch(container.path + "/Documents", [&] {
                    if (!done.exchange(true))
                        row.meanwhile();
                    return true;
                });
                if (!watch.works())
                    GTEST_SKIP() << "skipped: needs root, and a kernel that lets an open be watched";
                ask(to(1), answers);
                EXPECT_TRUE(done);
            }
            EXPECT_EQ(answers.codes(patience), std::vector<std::uint64_t>{row.code});
            EXPECT_FALSE(recorded() || world.exists(assertionFile));
        }
    // Asked for again, what took the place is changed as a whole.
    useContainer();
    put("Documents/file", 4);
    EXPECT_EQ(change(to(1)), 1U);
    EXPECT_EQ(recorded(), 1);
}

// Goal: changes that wait do not pile up, but for an owner of the root. Method: a small limit, and a locked device.
TEST_F(Protection, OnlySoManyWait) {
    world.services().store().limits.protectionChangesMax = 1;
    lock();
    Request request = to(1, true);
    Answers first;
    ask(request, first);
    EXPECT_EQ(change(request), first.codes().empty() ? 61U : 0U);
    request.byOwner = true;
    Answers owners;
    ask(request, owners);
    unlock();
    EXPECT_EQ(first.codes(patience), std::vector<std::uint64_t>{1});
    EXPECT_EQ(owners.codes(patience), std::vector<std::uint64_t>{1});
}

// Goal: nothing outside a container changes its class, whatever its owner puts in it or swaps while it is walked.
// Method: links, a FIFO, hard links, a lease; then an owner that swaps a directory and a link while changes run.
TEST_F(Protection, HostileOwner) {
    namespace files = std::filesystem;
    const files::path documents = container.path + "/Documents";
    const files::path outside = world.path("etc/outside");
    world.write("etc/outside/file", "x");
    files::create_directory_symlink(outside, documents / "link");
    files::create_hard_link(outside / "file", documents / "hard");
    const std::string own = "private/var/mobile/own";
    world.write(own, "x");
    files::create_hard_link(world.path(own), documents / "own");
    ASSERT_EQ(::mkfifo((documents / "fifo").c_str(), 0666), 0);
    put("Documents/one", 3);
    put("Documents/others", 3);
    put("Documents/leased", 3);
    std::signal(SIGIO, SIG_IGN); // how a holder hears of an open
    platform::FileDescriptor leased(::open((documents / "leased").c_str(), O_RDWR | O_CLOEXEC));
    ASSERT_EQ(::fcntl(leased.get(), F_SETLEASE, F_WRLCK), 0);
    files::create_hard_link(documents / "one", container.path + "/Library/two");
    if (::geteuid() == 0) { // else all files are the owner's own
        ASSERT_EQ(::chown((documents / "one").c_str(), mobile, mobile), 0);
        ASSERT_EQ(::chown((documents / "own").c_str(), mobile, mobile), 0);
        ASSERT_EQ(::chown((documents / "others").c_str(), mobile + 1, mobile + 1), 0);
        // Between the two directories the owner moves another's file on, so that its one name is met twice.
        world.disk().arm({.filter = [&](const auto&) {
            (void)::rename((documents / "hard").c_str(), (container.path + "/Library/hard").c_str());
            return false;
        }});
    }
    EXPECT_EQ(change(to(1)), 1U);
    world.disk().disarm();
    leased.reset();
    EXPECT_EQ(classOf(path + "Documents/leased"), 1);
    EXPECT_EQ(classOf("etc/outside/file"), 3);
    EXPECT_EQ(classOf(own), 3);                    // its other name is outside, though it is the same user's
    EXPECT_EQ(classOf(path + "Documents/one"), 1); // all its names are in the container
    EXPECT_EQ(classOf(path + "Documents/others"), ::geteuid() == 0 ? 3 : 1);
    EXPECT_EQ(
        std::ranges::count_if(world.log.take(),
                              [](const auto& line) { return line.message.starts_with("Left the protection class"); }),
        1);
    files::remove(container.path + "/tmp");
    put("Documents/swapped/file", 3);
    std::jthread owner([&](const std::stop_token& stop) {
        while (!stop.stop_requested())
            (void)::renameat2(AT_FDCWD, (documents / "link").c_str(), AT_FDCWD, (documents / "swapped").c_str(),
                              RENAME_EXCHANGE);
    });
    const int rounds = support::isLongRun() ? 20'000 : 500;
    for (int i = 0; i < rounds; ++i)
        EXPECT_EQ(change(to(i % 2 == 0 ? 3 : 1)), 1U);
    owner.request_stop();
    owner.join();
    EXPECT_EQ(classOf("etc/outside/file"), 3);
    EXPECT_FALSE(world.exists(path + "tmp")); // an item that is missing is not made
}

// Goal: a tree that two threads share is changed to its last file, a directory after its files, and a failure or a lock
// in its middle is the change's. Method: many files; the disk refuses one, then the device locks; a look at the files
// whenever a directory's turn comes.
TEST_F(Protection, TwoThreadsShareALargeTree) {
    constexpr int count = 1000;
    const auto nameOfFile = [](int i) {
        return "Documents/" + (i % 10 == 0 ? "below/" : i % 2 == 0 ? std::string("many/") : "") + std::to_string(i);
    };
    const auto isSet = [](const support::DiskCallInfo& info) { return info.call == support::DiskCall::setAttribute; };
    for (int i = 0; i < count; ++i)
        world.write(path + nameOfFile(i), "x");
    world.disk().arm({.point = 500, .error = EACCES, .filter = isSet});
    EXPECT_EQ(change(to(1)), static_cast<std::uint64_t>(EACCES));
    world.disk().arm({.filter = [&, sets = 0](const auto& info) mutable {
        if (isSet(info) && ++sets == 200)
            world.lockState.state = 1;
        return false;
    }});
    EXPECT_EQ(change(to(1)), 61U);
    world.disk().disarm();
    world.lockState.state = 0;
    EXPECT_NE(classOf(path + "Documents"), 1);
    int directories = 0;
    world.disk().before = [&](const support::DiskCallInfo& call) {
        const std::filesystem::path changed = "/proc/self/fd/" + std::to_string(call.fd);
        if (!isSet(call) || !std::filesystem::is_directory(changed))
            return;
        ++directories;
        const std::string below = std::filesystem::read_symlink(changed).string() + "/";
        for (int i = 0; i < count; ++i)
            EXPECT_TRUE(!world.path(path + nameOfFile(i)).starts_with(below) || classOf(path + nameOfFile(i)) == 1)
                << i;
    };
    EXPECT_EQ(change(to(1)), 1U);
    world.disk().before = nullptr;
    EXPECT_GT(directories, 5);
    for (int i = 0; i < count; ++i)
        ASSERT_EQ(classOf(path + nameOfFile(i)), 1) << i;
}

// Goal: a forbidden open is the change's error; taken for a lock it would be tried again for ever. Method: a listener
// that refuses the opens of the container, then of a file in it.
TEST_F(Protection, AForbiddenOpenIsNoLock) {
    put("Documents/file", 4);
    for (const std::string& refused : {container.path, container.path + "/Documents/file"}) {
        SCOPED_TRACE(refused);
        Answers answers;
        {
            const support::OpenWatch refusal(refused, [] { return false; });
            if (!refusal.works())
                GTEST_SKIP() << "skipped: needs root, and a kernel that lets an open be refused";
            ask(to(1, true), answers);
            EXPECT_EQ(answers.codes(patience), std::vector<std::uint64_t>{EACCES});
        }
        (void)answers.codes(patience); // one that was taken for a lock ends now
    }
}

// Goal: assertions of one application share its file; a killed daemon's is taken over. Method: the real service.
TEST(TerminationAssertion, Files) {
    World world;
    const std::string file = "run/zorvane/assertions/a%2Fb";
    world.write(file, "1"); // left unlocked
    const auto ask = [&] {
        return world.linux().roles().assertions.acquire("a/b", platform::TerminationReason::critical,
                                                        [](const auto& error) { EXPECT_FALSE(error); });
    };
    auto first = ask();
    auto second = ask();
    EXPECT_EQ(world.read(file), "255");
    first.reset();
    EXPECT_TRUE(world.exists(file));
    second.reset();
    EXPECT_FALSE(world.exists(file));
}

} // namespace
} // namespace zor::test
