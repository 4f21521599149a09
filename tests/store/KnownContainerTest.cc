// SPDX-License-Identifier: Apache-2.0
// Requests about one container by its UUID: info values, its record, its structure, its directory's name, its size.
#include "operations/ZORGroupManager.h"
#include "support/OpenWatch.h"
#include "world/World.h"

#include <gtest/gtest.h>
#include <sys/wait.h>

namespace zor::test {
namespace {

using support::DiskCall;
using support::FaultSpan;
using Address = ZORClientConnection::ContainerAddress;

class Known : public testing::Test {
protected:
    Known() { world.load(); }
    World world;

    ZORClientConnection& client() { return world.daemonsClient(); }
    Result<void> set(const Address& address, const std::string& key, const plist::Value& value) {
        return client().setInfoValue(&value, &key, address, UseLocking::yes);
    }
    Result<plist::Value> get(const Address& address, const std::string& key) {
        return client().infoValueForKey(&key, address, UseLocking::yes);
    }
};

// Goal: a directory that is made again gets the class that is recorded, or is not made, and no link is followed.
// Method: a recorded class, and a lock that takes it away; a link in a directory's place.
TEST_F(Known, StructureIsMadeAgain) {
    const FoundContainer container = world.make("com.example");
    const auto mend = [&] { return codeOf(client().recreateDefaultStructureForUser(addressOf(container))); };
    std::filesystem::remove_all(container.path + "/tmp");
    ASSERT_TRUE(set(addressOf(container), "com.veltra.Brevance.ContentProtectionClass", 1));
    world.lockState.state = 1;
    EXPECT_EQ(mend(), ErrorCode::subdirectoryFailed);
    EXPECT_FALSE(isThere(container.path + "/tmp"));
    world.lockState.state = 0;
    ASSERT_EQ(mend(), ErrorCode::success);
    for (const auto& [subdirectory, itsClass] : {std::pair("/tmp", 1), std::pair("/Documents", 3)})
        EXPECT_EQ(world.services()
                      .defaultManager()
                      .dataProtectionClassOfItemAtURL(FileURL::directory(container.path + subdirectory))
                      .value(),
                  itsClass);
    world.makeDirectories("outside", 0, 0700);
    std::filesystem::remove_all(container.path + "/Library");
    world.link(world.path("outside"), container.path + "/Library");
    EXPECT_EQ(mend(), ErrorCode::subdirectoryFailed);
    EXPECT_TRUE(world.names("outside").empty());
}

// Goal: the directory gets another name, whole or not at all, and the mapping follows the live one. Method: a
// rename, one whose sync fails, a restart; before it the same of a transient one.
TEST_F(Known, DirectoryGetsANewName) {
    const FoundContainer container = world.make("com.example");
    const Address address = addressOf(container);
    ASSERT_TRUE(
        client().regenerateDirectoryUUIDForUser(addressOf(world.make("com.example", application, asTransient))));
    EXPECT_TRUE(world.names("run/zorvane/sandbox/501/1").empty());
    ASSERT_TRUE(client().regenerateDirectoryUUIDForUser(address));
    const std::string moved = client().metadataForUser(address)->path;
    EXPECT_TRUE(moved != container.path && UUID::parse(nameOf(moved)) && !isThere(container.path));
    EXPECT_EQ(std::filesystem::read_symlink(world.path("run/zorvane/sandbox/501/1/com.example")), moved);
    world.disk().arm({.filter = [](const auto& call) {
        return call.call == DiskCall::sync || call.call == DiskCall::syncFileSystem;
    }});
    const auto renamed = client().regenerateDirectoryUUIDForUser(address);
    world.disk().disarm();
    world.restart();
    const std::string last = client().metadataForUser(address)->path;
    EXPECT_TRUE(complaintOf(renamed).find(" " + last + " is in its place, but a power cut may undo that") !=
                std::string::npos);
}

// Goal: a bundle is measured once, unless it is being filled; data each time. Method: files added between queries; a
// disk on which the size cannot be kept.
TEST_F(Known, DiskUsageIsKeptForBundlesAlone) {
    const FoundContainer bundle = world.make("com.example", ContainerClass::bundleApplication);
    const FoundContainer data = world.make("com.example");
    const FoundContainer transient = world.make("com.example", ContainerClass::bundleApplication, asTransient);
    const auto usage = [&](const FoundContainer& container) {
        const auto answer = client().diskUsageForUserId(addressOf(container));
        EXPECT_EQ(answer.error, ErrorCode::success);
        return answer.bytes;
    };
    const auto grow = [&](const char* file) {
        for (const FoundContainer* container : {&bundle, &data, &transient})
            world.write(world.relative(container->path) + file, std::string(100'000, 'x'));
    };
    grow("/zero");
    (void)usage(bundle);
    grow("/one");
    std::uint64_t bytes[3] = {100'000, 0, 0};
    for (const bool again : {false, true}) {
        world.services().store().diskUsage.settledTime = {};
        std::uint64_t* kept = bytes;
        for (const FoundContainer& container : {bundle, data, transient}) {
            const std::uint64_t now = usage(container);
            EXPECT_EQ(now >= *kept + 100'000, !again || container.path != bundle.path);
            *kept++ = now;
        }
        grow("/two");
        world.restart();
    }
    ASSERT_TRUE(set(addressOf(bundle), "com.veltra.Brevance.StaticDiskUsage", "rubbish"));
    world.disk().arm({.error = ENOSPC, .span = FaultSpan::fromThenOn});
    EXPECT_GE(usage(bundle), bytes[0] + 100'000);
    world.disk().disarm();
}

// Goal: a size is not kept for a container that moved while it was measured. Method: a renaming in the moment in which
// the walk opens a directory.
TEST_F(Known, ASizeIsNotKeptForWhatMovedMeanwhile) {
    world.services().store().diskUsage.settledTime = {};
    const FoundContainer bundle = world.make("com.example", ContainerClass::bundleApplication);
    const Address address = addressOf(bundle);
    world.write(world.relative(bundle.path) + "/a/file", "x");
    std::atomic<bool> moved{false};
    const support::OpenWatch watch(bundle.path + "/a", [&] {
        const bool first = !moved.exchange(true);
        EXPECT_TRUE(!first || client().regenerateDirectoryUUIDForUser(address));
        return true;
    });
    if (!watch.works())
        GTEST_SKIP() << "skipped: needs root, and a kernel that lets an open be watched";
    EXPECT_EQ(client().diskUsageForUserId(address).error, ErrorCode::success);
    EXPECT_TRUE(moved);
    EXPECT_EQ(codeOf(get(address, "com.veltra.Brevance.StaticDiskUsage")), ErrorCode::infoKeyNotFound);
    (void)client().diskUsageForUserId(address);
    EXPECT_TRUE(get(address, "com.veltra.Brevance.StaticDiskUsage"));
}

// Goal: the retry test ends the daemon as often as told, and leaves nothing. Method: a child a call.
TEST_F(Known, RetryTestCountsDown) {
    for (const bool crashes : {true, false}) {
        const pid_t child = ::fork();
        if (child == 0)
            ::_exit(client().retryTestForUser(mobile, 1) ? 7 : 8);
        int status = -1;
        ::waitpid(child, &status, 0);
        EXPECT_EQ(WIFEXITED(status) ? WEXITSTATUS(status) : 0, crashes ? 0 : 7);
        EXPECT_EQ(world.names(applications).size(), crashes ? 1U : 0U);
    }
}

// Goal: nobody waits for the disk under the lock of all identifiers, and lookups of others not even for what is done
// under it. Method: whether somebody holds it at each sync that an operation makes, on file systems that keep an order
// and on those that keep none; whose lookups are told to wait at each move under it.
TEST(Syncs, AreWaitedForWithoutTheLock) {
    using plist::Dictionary;
    const std::string id = "com.example";
    const Dictionary groups{{std::string(entitlementKeys::applicationGroups), plist::Array{"group"}},
                            {std::string(entitlementKeys::systemContainer), true}};
    const auto registers = [&](World& world, const Dictionary& entitlements) {
        return world.entitle(id, entitlements) == ErrorCode::success;
    };
    const auto deletes = [&](World& world, ContainerClass containerClass) {
        return world.stage(*world.find(id, containerClass)) == ErrorCode::success;
    };
    const std::pair<const char*, std::function<bool(World&)>> rows[] = {
        {"creation", [](World& world) { return world.create("new").has_value(); }},
        {"registration", [&](World& world) { return registers(world, Dictionary{{"k", 1}}); }},
        {"deletion of a bundle", [&](World& world) { return deletes(world, ContainerClass::bundleApplication); }},
        {"deletion", [&](World& world) { return deletes(world, application); }},
    };
    for (const auto& [name, operation] : rows)
        for (const auto ordering : {fs::Ordering::journal, fs::Ordering::none}) {
            SCOPED_TRACE(name);
            World world({.probe = ordering == fs::Ordering::journal ? [](int) { return fs::Ordering::journal; }
                                                                    : [](int) { return fs::Ordering::none; }});
            world.write(groupMarkerPath, "");
            world.load();
            ASSERT_TRUE(registers(world, groups));
            const std::string gone[] = {world.make("group", ContainerClass::sharedAppGroup).path,
                                        world.make(id, ContainerClass::dataSystem).path};
            for (const ContainerClass containerClass : {ContainerClass::bundleApplication, application})
                (void)world.make(id, containerClass);
            world.services().cache().dropAll(); // as after a start: class directories are read, and synced
            int syncs = 0;
            int held = 0;
            const ZORLocks& locks = world.services().locks();
            world.disk().before = [&, mine = std::this_thread::get_id()](const support::DiskCallInfo& call) {
                const bool isSync = call.call == DiskCall::sync || call.call == DiskCall::syncFileSystem;
                if ((!isSync && call.call != DiskCall::rename) || std::this_thread::get_id() != mine)
                    return;
                syncs += isSync ? 1 : 0;
                if (!locks.allAreHeldForWriting())
                    return;
                held += isSync ? 1 : 0;
                EXPECT_TRUE(locks.quietGeneration("other")) << call.describe();
                EXPECT_FALSE(locks.quietGeneration(id) && locks.quietGeneration("group") &&
                             locks.quietGeneration("new"))
                    << call.describe();
            };
            EXPECT_TRUE(operation(world));
            world.drainDeathRow(); // its thread asks the disk, too
            world.disk().before = nullptr;
            EXPECT_GT(syncs, 0);
            EXPECT_EQ(held, 0);
            const bool releases = &operation == &rows[1].second || &operation == &rows[2].second;
            for (const std::string& path : gone)
                EXPECT_EQ(isThere(path), !releases);
        }
}

// Goal: a class directory that is slow keeps nobody else, and what was read counts only as far as nothing has changed.
// Method: while one is read for the first time, and while one is looked over, what others do.
TEST_F(Known, ASlowDirectoryKeepsNobodyElse) {
    const FoundContainer mine = world.make("mine");
    const FoundContainer slow = world.create("slow", application, false, second).value();
    ZORContainerCache& cache = world.services().cache();
    const auto whileReading = [&](const std::function<void()>& others, const std::function<void()>& read) {
        std::atomic<bool> entered{false};
        world.disk().unreadable = [&](int) {
            if (!entered.exchange(true)) {
                auto done = std::async(std::launch::async, others);
                EXPECT_EQ(done.wait_for(std::chrono::seconds(20)), std::future_status::ready);
            }
            return 0;
        };
        read();
        world.disk().unreadable = nullptr;
        EXPECT_TRUE(entered);
    };
    cache.dropAll();
    whileReading(
        [&] {
            EXPECT_EQ(world.make("mine").uuid, mine.uuid);
            EXPECT_TRUE(world.create("another"));
            EXPECT_EQ(cache.counts().classCaches, 1U);
        },
        [&] { EXPECT_EQ(world.create("slow", application, false, second).value().uuid, slow.uuid); });
    EXPECT_EQ(cache.heldByUser(second).containers, 1U);
    cache.dropAll();
    whileReading(
        [&] {
            world.putContainer(applications + "/" + slow.uuid.string(), metadataOf(2, mobile, "back"));
            cache.dropAll(); // as whoever brings a container back does
        },
        [&] { EXPECT_TRUE(world.find("back")); });
    // Its owner has moved it; a deletion and a creation beside it come to pass meanwhile.
    const FoundContainer another = world.make("another");
    ASSERT_EQ(::rename(mine.path.c_str(), (parentOf(mine.path) + "/" + UUID::random().string()).c_str()), 0);
    whileReading(
        [&] {
            EXPECT_TRUE(world.services().store().removal.stage(
                {.userId = mobile, .uuid = another.uuid, .identifier = "another", .containerClass = application}));
            EXPECT_TRUE(world.create("newest"));
        },
        [&] {
            EXPECT_EQ(cache.containerForUser(mobile, application, &mine.record->identifier(), false).value()->uuid(),
                      mine.uuid);
        });
    EXPECT_EQ(codeOf(world.find("another")), ErrorCode::notFound);
    EXPECT_TRUE(world.make("newest").existed);
}

// Goal: operations on one container, and registrations beside them, may run together. Method: a thread for each while
// its directory is renamed.
TEST_F(Known, OperationsRunTogether) {
    const Address address = addressOf(world.make("com.example"));
    world.write(groupMarkerPath, "");
    // Held by one while another comes and goes.
    const plist::Dictionary groups{{std::string(entitlementKeys::applicationGroups), plist::Array{"group"}}};
    const std::string holder = "holder";
    ASSERT_EQ(world.entitle(holder, groups), ErrorCode::success);
    const std::string group = world.make("group", ContainerClass::sharedAppGroup).path;
    std::atomic<bool> end{false};
    // Asked for by two at once, each container is made once.
    constexpr int made = 12;
    std::atomic<int> makers[made] = {};
    const auto makeEach = [&](int i) {
        if (i < made)
            makers[i] += world.make("id" + std::to_string(i), ContainerClass::dataTempDir).existed ? 0 : 1;
        (void)world.make("transient", ContainerClass::dataTempDir, asTransient);
    };
    const std::function<void(int)> operations[] = {
        [&](int) { EXPECT_TRUE(client().regenerateDirectoryUUIDForUser(address)); },
        [&](int i) { EXPECT_TRUE(set(address, "k", i)); },
        [&](int) { (void)get(address, "k"); },
        [&](int) { EXPECT_TRUE(client().metadataForUser(address)); },
        [&](int) { (void)client().diskUsageForUserId(address); },
        [&](int) { EXPECT_EQ(client().containersForUser(mobile, application, false)->size(), 1U); },
        [&](int) { EXPECT_TRUE(world.find("com.example")); },
        [&](int i) {
            EXPECT_EQ(world.entitle("other", i % 2 == 0 ? std::optional(groups) : std::nullopt), ErrorCode::success);
        },
        [&](int) {
            EXPECT_EQ(world.services().groups().groupContainerPathsForUser(mobile, client().caller(), &holder).value(),
                      (ZORGroupManager::Paths{{"group", group}}));
        },
        makeEach,
        makeEach,
    };
    inThreads(std::size(operations), [&](unsigned thread) {
        for (int i = 0; thread == 0 ? i < 80 : !end || i < made; ++i)
            operations[thread](i);
        end = end || thread == 0;
    });
    EXPECT_EQ(world.services().locks().identifiersInUse(), 0U);
    for (const std::atomic<int>& count : makers)
        EXPECT_EQ(count, 1);
    for (const char* identifier : {"other", "holder"})
        ASSERT_EQ(world.entitle(identifier, {}), ErrorCode::success);
    EXPECT_FALSE(isThere(group));
}

} // namespace
} // namespace zor::test
