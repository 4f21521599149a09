// SPDX-License-Identifier: Apache-2.0
// What is asked of one container by its UUID: info values, its record, its structure, its directory's name, its size.
#include "world/World.h"

#include <fcntl.h>
#include <filesystem>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

namespace zor::test {
namespace {

using support::DiskCall;
using support::DiskCallInfo;
using Address = ZORClientConnection::ContainerAddress;

constexpr ContainerClass application = ContainerClass::dataApplication;

class Known : public testing::Test {
protected:
    Known() { world.load(); }
    World world;

    FoundContainer make(const std::string& identifier, ContainerClass containerClass = application,
                        std::uint32_t userId = mobile) {
        return world.daemonsClient()
            .createOrLookupContainerForUser(userId, &identifier, containerClass, {.createIfNecessary = true})
            .value();
    }
    static Address addressOf(const FoundContainer& container) {
        return {.userId = container.record->uid(),
                .uuid = container.uuid,
                .identifier = container.record->identifier(),
                .containerClass = container.record->containerClass()};
    }
    Result<void> set(const Address& address, const std::string& key, const plist::Value& value) {
        return world.daemonsClient().setInfoValue(&value, &key, address, UseLocking::yes);
    }
    Result<plist::Value> get(const Address& address, const std::string& key) {
        return world.daemonsClient().infoValueForKey(&key, address, UseLocking::yes);
    }
    [[nodiscard]] std::string relative(const std::string& path) const { return path.substr(world.path().size() + 1); }
};

// Goal: a value that is set is there for the next daemon, one that is removed is not, and a value that the file could
// not hold, or a disk that fails, loses nothing. Method: set, refuse, fail, restart.
TEST_F(Known, InfoValuesLastOrAreRefused) {
    const Address address = addressOf(make("com.example"));
    EXPECT_TRUE(get(address, "k").error().is(ErrorCode::infoKeyNotFound));
    EXPECT_TRUE(world.log.take(3, "infoValueForKey").empty());
    ASSERT_TRUE(set(address, "k", plist::Dictionary{{"deep", plist::Array{1, "two"}}}));
    ASSERT_TRUE(set(address, "gone", "soon"));
    const std::string gone = "gone";
    ASSERT_TRUE(world.daemonsClient().setInfoValue(nullptr, &gone, address, UseLocking::yes));
    plist::Value deep(1);
    for (int level = 0; level < 80; ++level)
        deep = plist::Array{std::move(deep)};
    for (const plist::Value& value : {plist::Value(std::string(std::size_t{1} << 20, 'x')), deep}) {
        const auto refused = set(address, "k", value);
        ASSERT_FALSE(refused);
        EXPECT_TRUE(refused.error().is(ErrorCode::propertyListNotWritten)) << refused.error().text();
        EXPECT_EQ(*get(address, "k"), plist::Value(plist::Dictionary{{"deep", plist::Array{1, "two"}}}));
    }
    world.disk().arm(
        {.error = ENOSPC, .filter = [](const DiskCallInfo& call) { return call.call == DiskCall::write; }});
    EXPECT_TRUE(set(address, "k", "unwritten").error().is(ErrorCode::propertyListNotWritten));
    world.disk().disarm();
    EXPECT_EQ(*get(address, "k"), plist::Value("unwritten"));
    world.restart();
    EXPECT_EQ(*get(address, "k"), plist::Value(plist::Dictionary{{"deep", plist::Array{1, "two"}}}));
    EXPECT_FALSE(get(address, "gone"));
    const auto metadata = world.daemonsClient().metadataForUser(address);
    ASSERT_TRUE(metadata && metadata->info);
    EXPECT_EQ(metadata->info->size(), 1U);
    EXPECT_FALSE(metadata->transient);
}

// Goal: what a client broke of its standard structure is whole again; a link that it put there is not followed. Method:
// subdirectories removed, closed, and swapped for links.
TEST_F(Known, StructureIsMadeAgain) {
    const FoundContainer container = make("com.example");
    const std::string path = relative(container.path);
    std::filesystem::remove_all(world.path(path + "/Library"));
    ASSERT_EQ(::chmod(world.path(path + "/Documents").c_str(), 0), 0);
    ASSERT_TRUE(world.daemonsClient().recreateDefaultStructureForUser(addressOf(container)));
    for (const char* subdirectory : {"Documents", "Library", "Library/Caches", "Library/Preferences", "tmp"})
        EXPECT_EQ(world.item(path + "/" + subdirectory), directoryOf(mobile)) << subdirectory;
    world.makeDirectories("outside", 0, 0700);
    std::filesystem::remove_all(world.path(path + "/Library"));
    std::filesystem::create_directory_symlink(world.path("outside"), world.path(path + "/Library"));
    EXPECT_TRUE(world.daemonsClient()
                    .recreateDefaultStructureForUser(addressOf(container))
                    .error()
                    .is(ErrorCode::subdirectoryFailed));
    EXPECT_EQ(world.item("outside"), directoryOf(0, 0700));
    EXPECT_TRUE(world.names("outside").empty());
}

// Goal: the directory has another name, the container is the same, and nobody is left with half of it. Method: rename,
// a failing rename, a restart.
TEST_F(Known, DirectoryGetsANewName) {
    const FoundContainer container = make("com.example");
    const Address address = addressOf(container);
    world.disk().arm({.error = EIO, .filter = [](const DiskCallInfo& call) { return call.call == DiskCall::rename; }});
    EXPECT_TRUE(
        world.daemonsClient().regenerateDirectoryUUIDForUser(address).error().is(ErrorCode::directoryNotRenamed));
    world.disk().disarm();
    EXPECT_EQ(world.daemonsClient().metadataForUser(address)->path, container.path);
    ASSERT_TRUE(world.daemonsClient().regenerateDirectoryUUIDForUser(address));
    const std::string moved = world.daemonsClient().metadataForUser(address)->path;
    EXPECT_NE(moved, container.path);
    EXPECT_TRUE(UUID::parse(moved.substr(moved.rfind('/') + 1)));
    EXPECT_NE(::access(container.path.c_str(), F_OK), 0);
    world.restart();
    const auto found = world.daemonsClient().metadataForUser(address);
    ASSERT_TRUE(found);
    EXPECT_EQ(found->path, moved);
}

// Goal: what a bundle takes is measured once, also after a restart; a data container each time; rubbish in the info is
// measured over. Method: files added between queries.
TEST_F(Known, DiskUsageIsKeptForBundlesAlone) {
    const FoundContainer bundle = make("com.example", ContainerClass::bundleApplication, 33);
    const FoundContainer data = make("com.example");
    const auto usage = [&](const FoundContainer& container) {
        const auto answer = world.daemonsClient().diskUsageForUserId(addressOf(container));
        EXPECT_EQ(answer.error, ErrorCode::success);
        return answer.bytes;
    };
    for (const FoundContainer* container : {&bundle, &data})
        world.write(relative(container->path) + "/one", std::string(100'000, 'x'));
    const std::uint64_t bundleBytes = usage(bundle);
    const std::uint64_t dataBytes = usage(data);
    EXPECT_GE(bundleBytes, 100'000U);
    for (const FoundContainer* container : {&bundle, &data})
        world.write(relative(container->path) + "/two", std::string(100'000, 'x'));
    world.restart();
    EXPECT_EQ(usage(bundle), bundleBytes);
    EXPECT_GE(usage(data), dataBytes + 100'000);
    ASSERT_TRUE(set(addressOf(bundle), "com.veltra.Brevance.StaticDiskUsage", "rubbish"));
    EXPECT_GE(usage(bundle), bundleBytes + 100'000);
    // A disk on which it cannot be kept: it is said, and measured again the next time.
    ASSERT_TRUE(set(addressOf(bundle), "com.veltra.Brevance.StaticDiskUsage", "rubbish"));
    world.disk().arm({.error = ENOSPC, .span = support::FaultSpan::fromThenOn});
    EXPECT_GE(usage(bundle), bundleBytes + 100'000);
    world.disk().disarm();
    EXPECT_EQ(
        world.log.take(3, "diskUsageForUserId"),
        std::vector<std::string>{"Error setting info value for userId: 33, identifier: com.example, Class: 1: 34"});
}

// Goal: the retry test ends the daemon as often as it is told, the count outlives each end, and nothing is left when it
// has succeeded. Method: a child of its own for each call, on disks that fail at first.
TEST_F(Known, RetryTestCountsDown) {
    enum class End { crashed, succeeded, failed };
    const auto call = [&](std::uint64_t crashes) {
        const pid_t child = ::fork();
        if (child == 0)
            ::_exit(static_cast<int>(world.daemonsClient().retryTestForUser(mobile, crashes) ? End::succeeded
                                                                                             : End::failed));
        int status = -1;
        ::waitpid(child, &status, 0);
        return WIFEXITED(status) ? static_cast<End>(WEXITSTATUS(status)) : End::failed;
    };
    const std::string applications = std::string(mobileContainers) + "/Data/Application";
    world.disk().arm({.error = EIO, .span = support::FaultSpan::fromThenOn});
    EXPECT_EQ(call(2), End::failed);
    world.disk().disarm();
    for (const End end : {End::crashed, End::crashed, End::succeeded}) {
        EXPECT_EQ(call(2), end);
        EXPECT_EQ(world.names(applications).size(), end == End::crashed ? 1U : 0U);
    }
    // A deletion that may not last is no success; the next call begins anew.
    for (const End end : {End::crashed, End::failed, End::crashed, End::succeeded}) {
        bool staged = false;
        if (end == End::failed)
            world.disk().arm({.error = EIO, .span = support::FaultSpan::fromThenOn, .filter = [&](const auto& info) {
                                  staged = staged || (info.call == DiskCall::rename &&
                                                      info.subject.find("metadata") == std::string::npos);
                                  return staged && info.call != DiskCall::rename;
                              }});
        EXPECT_EQ(call(1), end);
        world.disk().disarm();
    }
    EXPECT_TRUE(world.names(applications).empty());
}

// Goal: the operations on one container may run beside lookups, listings and each other. Method: threads, for a short
// while; a sanitizer watches.
TEST_F(Known, OperationsRunTogether) {
    const FoundContainer container = make("com.example");
    const Address address = addressOf(container);
    std::atomic<bool> end{false};
    std::vector<std::thread> threads;
    const auto loop = [&](auto&& body) {
        threads.emplace_back([&end, body] {
            for (int i = 0; !end; ++i)
                body(i);
        });
    };
    ZORClientConnection& client = world.daemonsClient();
    loop([&](int i) { EXPECT_TRUE(set(address, "k", i)); });
    loop([&](int) { (void)get(address, "k"); });
    loop([&](int) { EXPECT_TRUE(client.regenerateDirectoryUUIDForUser(address)); });
    loop([&](int) { EXPECT_TRUE(client.metadataForUser(address)); });
    loop([&](int) { (void)client.diskUsageForUserId(address); });
    loop([&](int) { EXPECT_EQ(client.containersForUser(mobile, application, false)->size(), 1U); });
    loop([&](int) {
        EXPECT_TRUE(client.createOrLookupContainerForUser(mobile, &*address.identifier, application, {}));
    });
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    end = true;
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_EQ(world.services().locks().identifiersInUse(), 0U);
}

} // namespace
} // namespace zor::test
