// SPDX-License-Identifier: Apache-2.0
// Changing the data-protection class of a container: what is judged, what is set where, what waits for an unlock, and
// what happens to the container meanwhile.
#include "protection/ZORApplicationTerminationAssertion.h"
#include "protection/ZORDataProtectionChangeOperation.h"
#include "protection/ZORDataProtectionManager.h"
#include "store/DispatchFixture.h"

#include <algorithm>
#include <atomic>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <mutex>
#include <poll.h>
#include <sys/fanotify.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <thread>
#include <unistd.h>

namespace zor::test {
namespace {

using support::hasLine;
using Request = ZORDataProtectionManager::Request;

constexpr const char* function = "setDataProtectionOnDataContainerForUser";
constexpr const char* perform = "performChangeOperation";
constexpr const char* key = "com.veltra.Brevance.ContentProtectionClass";

/// What a completion was told, in the order of the calls.
class Answers {
public:
    ZORDataProtectionManager::Completion completion() {
        return [this](ErrorCode code) {
            const std::lock_guard held(mutex_);
            codes_.push_back(static_cast<std::uint64_t>(code));
        };
    }
    std::vector<std::uint64_t> codes() {
        const std::lock_guard held(mutex_);
        return codes_;
    }
    std::vector<std::uint64_t> wait() {
        for (int i = 0; i < 5000 && codes().empty(); ++i)
            std::this_thread::sleep_for(std::chrono::milliseconds(1));
        return codes();
    }

private:
    std::mutex mutex_;
    std::vector<std::uint64_t> codes_;
};

class Protection : public testing::Test {
protected:
    Protection() : world({.logLevel = logLevelDebug}) {
        world.load();
        container = make("com.example.app");
        path = container.path.substr(world.path().size() + 1);
        world.log.take();
    }
    ~Protection() override {
        if (suspended)
            world.linux().roles().lockStateQueue.resume();
    }
    FoundContainer make(const std::string& identifier, bool transient = false) {
        return world.daemonsClient()
            .createOrLookupContainerForUser(mobile, &identifier, ContainerClass::dataApplication,
                                            {.createIfNecessary = true, .transient = transient})
            .value();
    }
    ZORDataProtectionManager& manager() { return world.services().store().dataProtection; }
    static Request to(int protectionClass) {
        return {.userId = mobile,
                .identifier = "com.example.app",
                .containerClass = ContainerClass::dataApplication,
                .dataProtectionClass = protectionClass};
    }
    std::uint64_t change(const Request& request) {
        Answers answers;
        manager().setDataProtectionOnDataContainerForUser(request, answers.completion());
        const auto codes = answers.codes();
        EXPECT_EQ(codes.size(), 1U);
        return codes.empty() ? 0 : codes.front();
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
    int classOf(const std::string& relative) {
        const platform::FileDescriptor file(
            ::open(world.path(path + "/" + relative).c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
        return world.protection().classOf(file.get()).value_or(-1);
    }
    void put(const std::string& relative, int protectionClass) {
        world.write(path + "/" + relative, "x");
        const platform::FileDescriptor file(::open(world.path(path + "/" + relative).c_str(), O_RDONLY | O_CLOEXEC));
        ASSERT_EQ(world.protection().setClass(file.get(), protectionClass), 0);
    }
    void record(int protectionClass) {
        const plist::Value value(protectionClass);
        const std::string name = key;
        ASSERT_TRUE(world.daemonsClient().setInfoValue(&value, &name, address(), UseLocking::yes));
    }
    std::optional<std::int64_t> recorded() {
        const std::string name = key;
        const auto value = world.daemonsClient().infoValueForKey(&name, address(), UseLocking::yes);
        return value ? value->asSigned() : std::nullopt;
    }
    [[nodiscard]] ZORClientConnection::ContainerAddress address() const {
        return {.userId = mobile,
                .uuid = container.uuid,
                .identifier = "com.example.app",
                .containerClass = ContainerClass::dataApplication};
    }
    [[nodiscard]] std::string assertionFile() const { return "run/zorvane/assertions/com.example.app"; }

    World world;
    FoundContainer container;
    std::string path; // relative to the root
    bool suspended = false;
};

// Goal: every request is judged in its order, with its code and words, and one that is refused or has nothing to do
// touches nothing. Method: a table of requests.
TEST_F(Protection, Requests) {
    using Class = ContainerClass;
    struct Row {
        const char* name;
        Request request;
        std::uint64_t code;
        const char* message;
    };
    const auto with = [](Request request, auto&& edit) {
        edit(request);
        return request;
    };
    const Row rows[] = {
        {"no identifier", with(to(1), [](Request& r) { r.identifier.reset(); }), 11,
         "Can't act on an invalid object: userId: 501, ID: (null), class: 2"},
        {"a bundle", with(to(1), [](Request& r) { r.containerClass = Class::bundleApplication; }), 11,
         "Can't act on an invalid object: userId: 501, ID: com.example.app, class: 1"},
        {"system data", with(to(1), [](Request& r) { r.containerClass = Class::dataSystem; }), 11,
         "Can't act on an invalid object: userId: 501, ID: com.example.app, class: 12"},
        {"unknown", with(to(1), [](Request& r) { r.identifier = "nobody"; }), 21,
         "No Container with userId: 501, identifier: nobody, Class: 2 "},
        {"the class it has", to(3), 1, nullptr},
        {"never allowed", to(2), 38, "Data protection class 2 is not allowed"},
        {"never allowed to others", with(to(2), [](Request& r) { r.isSecondOrThirdPartyApp = true; }), 38,
         "Data protection class 2 is not allowed"},
        {"too high for others", with(to(5), [](Request& r) { r.isSecondOrThirdPartyApp = true; }), 38,
         "Data protection class 5 is invalid for 2nd and 3rd party apps"},
        {"negative for others", with(to(-1), [](Request& r) { r.isSecondOrThirdPartyApp = true; }), 38,
         "Data protection class -1 is invalid for 2nd and 3rd party apps"},
    };
    put("Documents/file", 1);
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        world.log.take();
        EXPECT_EQ(change(row.request), row.code);
        const auto said = world.log.take(3, function);
        ASSERT_EQ(said.size(), row.message ? 1U : 0U);
        EXPECT_TRUE(!row.message || support::withoutSourceLine(said[0]).starts_with(row.message)) << said[0];
        EXPECT_FALSE(recorded());
        EXPECT_EQ(classOf("Documents/file"), 1);
    }
    record(7);
    EXPECT_EQ(change(with(to(7), [](Request& r) { r.isSecondOrThirdPartyApp = true; })), 1U); // equality comes first
    EXPECT_EQ(change(to(5)), 1U);
    EXPECT_EQ(recorded(), 5);
}

// Goal: directories and files get exactly the classes that the change's kind says. Method: a table of recorded class,
// requested class and file, and what each has afterwards.
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
        EXPECT_EQ(change(to(row.requested)), 1U);
        for (const char* directory : {"Documents", "Library", "Library/Caches", "tmp"})
            EXPECT_EQ(classOf(directory), row.directory) << directory;
        for (std::size_t i = 0; i < row.files.size(); ++i)
            EXPECT_EQ(classOf("Library/Caches/" + std::to_string(i)), row.files[i].second) << i;
        EXPECT_EQ(classOf("outside the items"), 4);
        EXPECT_EQ(recorded(), row.requested);
        EXPECT_TRUE(manager().pending().empty());
    }
}

// Goal: a locked device answers 61, or is waited for; the assertion is there from the first retry to the end, and a
// second lock during the retry makes another. Method: lock, ask, unlock by hand, with a file that brings the lock back.
TEST_F(Protection, WaitsForTheUnlock) {
    put("Documents/file", 4);
    lock();
    Request request = to(1);
    EXPECT_EQ(change(request), 61U);
    EXPECT_FALSE(recorded());
    EXPECT_TRUE(hasLine(world.log.take(), 3, perform,
                        "Tried to update user: 501, id: com.example.app, containerClass: 2 to protection class 1, but "
                        "was locked and didn't retry"));
    request.retryIfLocked = true;
    Answers answers;
    manager().setDataProtectionOnDataContainerForUser(request, answers.completion());
    EXPECT_TRUE(answers.codes().empty());
    ASSERT_EQ(manager().pending().size(), 1U);
    EXPECT_EQ(manager().pending()[0].dataProtectionClass, 1);
    EXPECT_FALSE(world.exists(assertionFile()));
    EXPECT_EQ(world.services().platform().transactions.count(), 1U);
    // Unlocked and at once locked again: the queue runs and finds the device locked.
    world.linux().roles().lockStateQueue.resume();
    for (int i = 0; i < 2000 && !world.exists(assertionFile()); ++i)
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    std::this_thread::sleep_for(std::chrono::milliseconds(60)); // several retries
    EXPECT_TRUE(answers.codes().empty());
    EXPECT_EQ(world.read(assertionFile()), "0");
    const platform::FileDescriptor held(::open(world.path(assertionFile()).c_str(), O_RDONLY | O_CLOEXEC));
    EXPECT_NE(::flock(held.get(), LOCK_SH | LOCK_NB), 0);
    EXPECT_EQ(world.services().platform().assertions.held(), std::vector<std::string>{"com.example.app"});
    world.lockState.state = 0;
    suspended = false;
    EXPECT_EQ(answers.wait(), std::vector<std::uint64_t>{1});
    EXPECT_FALSE(world.exists(assertionFile()));
    EXPECT_EQ(::flock(held.get(), LOCK_SH | LOCK_NB), 0);
    EXPECT_EQ(classOf("Documents/file"), 1);
    EXPECT_EQ(recorded(), 1);
    EXPECT_TRUE(hasLine(world.log.take(), 5, perform,
                        "Retrying container protection update to 1 on next unlock for user: 501, id: com.example.app, "
                        "containerClass: 2"));
}

// Goal: a container that is moved, replaced or deleted while a change waits is not touched by it. Method: each of
// them between the request and the unlock.
TEST_F(Protection, TheContainerChangesMeanwhile) {
    struct Row {
        const char* name;
        std::function<void()> meanwhile;
        std::uint64_t code;
    };
    const std::string identifier = "com.example.app";
    const Row rows[] = {
        {"renamed", [&] { ASSERT_TRUE(world.daemonsClient().regenerateDirectoryUUIDForUser(address())); }, 10},
        {"replaced",
         [&] {
             const FoundContainer fresh = make(identifier, true);
             ASSERT_TRUE(world.daemonsClient().replaceContainer({.oldUuid = container.uuid,
                                                                 .newUuid = fresh.uuid,
                                                                 .userIdOld = mobile,
                                                                 .userIdNew = mobile,
                                                                 .identifierOld = identifier,
                                                                 .identifierNew = identifier,
                                                                 .classOld = ContainerClass::dataApplication,
                                                                 .classNew = ContainerClass::dataApplication},
                                                                StartDeletionThread::no));
         },
         10},
        {"deleted",
         [&] {
             ASSERT_TRUE(world.daemonsClient().deleteContainerForUser(mobile, &identifier,
                                                                      ContainerClass::dataApplication, false));
         },
         21},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        container = make(identifier);
        path = container.path.substr(world.path().size() + 1);
        lock();
        Request request = to(1);
        request.retryIfLocked = true;
        Answers answers;
        manager().setDataProtectionOnDataContainerForUser(request, answers.completion());
        row.meanwhile();
        unlock();
        EXPECT_EQ(answers.wait(), std::vector<std::uint64_t>{row.code});
        EXPECT_FALSE(recorded());
        EXPECT_FALSE(world.exists(assertionFile()));
    }
}

// Goal: nothing outside a container changes its class, whatever its owner puts in it or swaps while it is walked.
// Method: links, a FIFO, hard links in and out of the container; then an owner that swaps a directory and a link to a
// file outside for as long as changes run.
TEST_F(Protection, HostileOwner) {
    world.write("etc/outside/file", "x");
    const auto outside = [&] {
        const platform::FileDescriptor file(::open(world.path("etc/outside/file").c_str(), O_RDONLY | O_CLOEXEC));
        return world.protection().classOf(file.get()).value_or(-1);
    };
    const std::string documents = world.path(path + "/Documents");
    ASSERT_EQ(::symlink(world.path("etc/outside").c_str(), (documents + "/link").c_str()), 0);
    ASSERT_EQ(::mkfifo((documents + "/fifo").c_str(), 0666), 0);
    ASSERT_EQ(::link(world.path("etc/outside/file").c_str(), (documents + "/hard").c_str()), 0);
    put("Documents/one", 3);
    ASSERT_EQ(::link((documents + "/one").c_str(), world.path(path + "/Library/two").c_str()), 0);
    if (::geteuid() == 0) { // else all files are the owner's own
        ASSERT_EQ(::chown((documents + "/one").c_str(), mobile, mobile), 0);
        // Between the two directories the owner moves another's file on, so that its one name is met twice.
        world.disk().arm({.filter = [&](const auto&) {
            ::rename((documents + "/hard").c_str(), world.path(path + "/Library/hard").c_str());
            return false;
        }});
    }
    EXPECT_EQ(change(to(1)), 1U);
    world.disk().disarm();
    EXPECT_EQ(outside(), 3);
    EXPECT_EQ(classOf("Documents/one"), 1); // all its names are in the container
    ASSERT_EQ(::rename((documents + "/link").c_str(), (documents + "/other").c_str()), 0);
    ASSERT_EQ(::rmdir(world.path(path + "/tmp").c_str()), 0);
    std::atomic<bool> stop{false};
    put("Documents/swapped/file", 3);
    std::thread owner([&] {
        while (!stop)
            (void)::renameat2(AT_FDCWD, (documents + "/other").c_str(), AT_FDCWD, (documents + "/swapped").c_str(),
                              RENAME_EXCHANGE);
    });
    const int rounds = std::getenv("ZORVANE_TEST_LONG") ? 20'000 : 500;
    for (int i = 0; i < rounds; ++i)
        EXPECT_EQ(change(to(i % 2 == 0 ? 3 : 1)), 1U);
    stop = true;
    owner.join();
    EXPECT_EQ(outside(), 3);
    EXPECT_EQ(::access(world.path(path + "/tmp").c_str(), F_OK), -1); // an item that is missing is not made
}

// Goal: a set that the kernel refuses ends the change with its error and records nothing; one for a descriptor that
// went bad is passed over. Method: the platform's classes replaced by the disk's failures.
TEST_F(Protection, FailuresOfTheSystem) {
    put("Documents/file", 4);
    for (const auto& [error, code, line] :
         {std::tuple(ENOSPC, std::uint64_t{ENOSPC}, "failed with error"), std::tuple(EPERM, std::uint64_t{EACCES}, ""),
          std::tuple(EBADF, std::uint64_t{1}, "Ignoring failure")}) {
        world.disk().arm({.error = error, .span = support::FaultSpan::fromThenOn, .filter = [](const auto& call) {
                              return call.call == support::DiskCall::setAttribute;
                          }});
        EXPECT_EQ(change(to(1)), code);
        world.disk().disarm();
        EXPECT_EQ(recorded().has_value(), code == 1);
        bool said = *line == '\0';
        for (const auto& one : world.log.take())
            said = said || one.message.find(line) != std::string::npos;
        EXPECT_TRUE(said) << line;
    }
    // What is set and cannot be recorded is set.
    world.disk().arm({.error = ENOSPC, .span = support::FaultSpan::fromThenOn, .filter = [](const auto& call) {
                          return call.call == support::DiskCall::createFile;
                      }});
    EXPECT_EQ(change(to(3)), 1U);
    world.disk().disarm();
    const auto said = world.log.take();
    EXPECT_TRUE(std::ranges::any_of(
        said, [](const auto& one) { return one.message.starts_with("Failed to set protection class info for "); }));
}

/// Refuses every open of a file or directory, as one whom root lets watch it may.
class OpenRefusal {
public:
    explicit OpenRefusal(const std::string& path)
        : watch_(::fanotify_init(FAN_CLASS_CONTENT | FAN_CLOEXEC, O_RDONLY | O_CLOEXEC)) {
        works_ = watch_.valid() &&
                 ::fanotify_mark(watch_.get(), FAN_MARK_ADD, FAN_OPEN_PERM | FAN_ONDIR, AT_FDCWD, path.c_str()) == 0;
        if (works_)
            answering_ = std::jthread([this](const std::stop_token& stop) { answer(stop); });
    }
    [[nodiscard]] bool works() const { return works_; }

private:
    void answer(const std::stop_token& stop) {
        pollfd waiting{.fd = watch_.get(), .events = POLLIN, .revents = 0};
        fanotify_event_metadata event{};
        while (!stop.stop_requested())
            if (::poll(&waiting, 1, 1) == 1 && ::read(watch_.get(), &event, sizeof event) == sizeof event) {
                const platform::FileDescriptor asked(event.fd);
                const fanotify_response refused{.fd = event.fd, .response = FAN_DENY};
                (void)!::write(watch_.get(), &refused, sizeof refused);
            }
    }

    platform::FileDescriptor watch_;
    bool works_ = false;
    std::jthread answering_;
};

// Goal: an open that somebody forbids is the change's error; taken for a lock it would be tried again for ever. Method:
// a listener that refuses the opens of the container, then of a file in it.
TEST_F(Protection, AForbiddenOpenIsNoLock) {
    put("Documents/file", 4);
    Request request = to(1);
    request.retryIfLocked = true;
    const std::string root = world.path(path);
    for (const auto& [refused, line] :
         {std::pair(root, "fts_open failed for [\"" + root + "/Documents\", \"" + root + "/Library\", "),
          std::pair(root + "/Documents/file", "Failed to open " + root + "/Documents/file : Permission denied")}) {
        SCOPED_TRACE(refused);
        Answers answers;
        {
            const OpenRefusal refusal(refused);
            if (!refusal.works())
                GTEST_SKIP() << "skipped: needs root, and a kernel that lets an open be refused";
            manager().setDataProtectionOnDataContainerForUser(request, answers.completion());
            EXPECT_EQ(answers.wait(), std::vector<std::uint64_t>{EACCES});
        }
        (void)answers.wait();
        EXPECT_TRUE(std::ranges::any_of(world.log.take(), [&](const auto& one) {
            return one.function == perform && one.message.find(line) != std::string::npos;
        }));
    }
}

class QueueWithoutThread final : public platform::WorkQueue {
public:
    void async(std::function<void()>) override { throw std::system_error(EAGAIN, std::generic_category()); }
    void suspend() override {}
    void resume() override {}
};

// Goal: what is thrown around a pass ends the change with 40, as what is thrown in it does, and not the daemon. Method:
// a queue that gets no thread for the retry, and a retry whose start finds no memory.
TEST_F(Protection, ExceptionsAroundAPass) {
    put("Documents/file", 4);
    lock();
    Request request = to(1);
    request.retryIfLocked = true;
    QueueWithoutThread withoutThread;
    platform::WorkQueue* const usual = std::exchange(world.lockStateQueue.inner, &withoutThread);
    EXPECT_EQ(change(request), 40U);
    world.lockStateQueue.inner = usual;
    EXPECT_EQ(world.services().platform().transactions.count(), 0U);
    EXPECT_TRUE(manager().pending().empty());

    using Operation = ZORDataProtectionChangeOperation;
    const auto record =
        world.services().cache().containerForUser(mobile, ContainerClass::dataApplication, &*request.identifier, false);
    ASSERT_TRUE(record);
    const auto operation = std::make_shared<Operation>(world.services().store(), *record, 1,
                                                       Operation::RetryIfLocked::yes, protectionChange::directories);
    Answers answers;
    operation->setRetryStartBlock([] { throw std::bad_alloc(); });
    operation->setCompletionBlock([completion = answers.completion()](bool, const std::optional<ZORError>& error) {
        completion(error ? error->replyCode() : ErrorCode::success);
    });
    operation->performChangeOperation();
    unlock();
    EXPECT_EQ(answers.wait(), std::vector<std::uint64_t>{40});
}

// Goal: the reply of command 19 comes exactly once, at once for what is judged at once, and with the code of the
// change; only the low 32 bits of a class count. Method: messages through the dispatcher.
TEST_F(Dispatch, ProtectionReplies) {
    as(grant("com.example", everything));
    const std::string identifier = "com.example.app";
    ASSERT_TRUE(world.daemonsClient().createOrLookupContainerForUser(
        mobile, &identifier, ContainerClass::dataApplication, {.createIfNecessary = true}));
    const auto message = [&](std::int64_t protectionClass, std::uint64_t userId = mobile) {
        return plist::Dictionary{
            {"Command", std::uint64_t{19}}, {"ContainerClass", std::uint64_t{2}},     {"UserID", userId},
            {"Identifier", identifier},     {"DataProtectionClass", protectionClass}, {"IsThirdParty", true}};
    };
    EXPECT_EQ(errorOf(request(message(std::int64_t{1} << 32 | 1))), 1U);
}

/// A service that grants, refuses, or has nothing.
class FakeAssertions final : public platform::TerminationAssertionService {
public:
    class Handle final : public Assertion {
    public:
        explicit Handle(int& given) : given_(given) { ++given_; }
        ~Handle() override { --given_; }
        Handle(const Handle&) = delete;
        Handle& operator=(const Handle&) = delete;

    private:
        int& given_;
    };
    std::unique_ptr<Assertion> acquire(std::string_view, platform::TerminationReason,
                                       AcquisitionHandler done) override {
        if (nothing)
            return nullptr;
        answering = std::thread([done, refusal = refusal] { done(refusal); });
        return std::make_unique<Handle>(given);
    }
    [[nodiscard]] std::vector<std::string> held() const override { return {}; }
    bool nothing = false;
    std::optional<std::string> refusal;
    int given = 0;
    std::thread answering;
};

// Goal: an assertion is held from its granting to its invalidation, and none is left behind by a refusal; an unknown
// reason ends the process. Method: a service that answers from a thread of its own.
TEST(TerminationAssertion, GrantedRefusedOrNone) {
    support::RecordingLog sink(5);
    const Log log(sink);
    constexpr const char* init = "initWithBundleIdentifier";
    FakeAssertions service;
    auto assertion = ZORApplicationTerminationAssertion::initWithBundleIdentifier(log, service, "a", 0);
    service.answering.join();
    ASSERT_TRUE(assertion);
    EXPECT_EQ(service.given, 1);
    assertion->invalidate();
    EXPECT_EQ(service.given, 0);
    assertion->invalidate();
    service.refusal = "busy";
    EXPECT_FALSE(ZORApplicationTerminationAssertion::initWithBundleIdentifier(log, service, "a", 1));
    service.answering.join();
    EXPECT_EQ(service.given, 0);
    EXPECT_TRUE(hasLine(sink.take(), 3, init, "Failed to acquire termination assertion for a : busy"));
    service.nothing = true;
    EXPECT_FALSE(ZORApplicationTerminationAssertion::initWithBundleIdentifier(log, service, "a", 255));
    EXPECT_EQ(sink.take().size(), 1U);
    EXPECT_DEATH((void)ZORApplicationTerminationAssertion::initWithBundleIdentifier(log, service, "a", 2), "");
}

// Goal: assertions of one application share its file, and the last takes it away; what a killed daemon left is taken
// over. Method: the service on a root of its own.
TEST(TerminationAssertion, Files) {
    World world;
    world.write("run/zorvane/assertions/a%2Fb", "1"); // left unlocked
    auto& service = world.linux().roles().assertions;
    const auto ask = [&](std::string_view identifier) {
        return service.acquire(identifier, platform::TerminationReason::critical,
                               [](const auto& error) { EXPECT_FALSE(error); });
    };
    auto first = ask("a/b");
    auto second = ask("a/b");
    ASSERT_TRUE(first && second);
    EXPECT_EQ(world.read("run/zorvane/assertions/a%2Fb"), "255");
    EXPECT_EQ(world.item("run/zorvane/assertions/a%2Fb").substr(0, 9), "file 0600");
    first.reset();
    EXPECT_TRUE(world.exists("run/zorvane/assertions/a%2Fb"));
    second.reset();
    EXPECT_FALSE(world.exists("run/zorvane/assertions/a%2Fb"));
    EXPECT_FALSE(ask(std::string(256, 'a')));
}

} // namespace
} // namespace zor::test
