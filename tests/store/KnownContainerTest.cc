// SPDX-License-Identifier: Apache-2.0
// What is asked of one container by its UUID: info values, its record, its structure, its directory's name, its size.
#include "operations/ZORGroupManager.h"
#include "store/ZOREntitlementMapping.h"
#include "support/OpenWatch.h"
#include "world/World.h"

#include <atomic>
#include <filesystem>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

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

// Goal: info values last, and what the file cannot hold or the disk refuses loses none. Method: set, fail, restart.
TEST_F(Known, InfoValuesLastOrAreRefused) {
    const Address address = addressOf(world.make("com.example"));
    EXPECT_EQ(codeOf(get(address, "k")), ErrorCode::infoKeyNotFound);
    EXPECT_TRUE(world.complaints("infoValueForKey").empty());
    const plist::Value kept = plist::Dictionary{{"deep", plist::Array{1, "two"}}};
    ASSERT_TRUE(set(address, "k", kept));
    const std::string gone = "gone";
    ASSERT_TRUE(set(address, gone, "soon"));
    ASSERT_TRUE(client().setInfoValue(nullptr, &gone, address, UseLocking::yes));
    plist::Value deep(1);
    for (int level = 0; level < 80; ++level)
        deep = plist::Array{std::move(deep)};
    for (const plist::Value& value : {plist::Value(std::string(std::size_t{1} << 20, 'x')), deep}) {
        EXPECT_EQ(codeOf(set(address, "k", value)), ErrorCode::propertyListNotWritten);
        EXPECT_EQ(*get(address, "k"), kept);
    }
    world.refuse(DiskCall::write, ENOSPC);
    EXPECT_EQ(codeOf(set(address, "k", "unwritten")), ErrorCode::propertyListNotWritten);
    world.disk().disarm();
    EXPECT_EQ(*get(address, "k"), plist::Value("unwritten"));
    world.restart();
    EXPECT_EQ(*get(address, "k"), kept);
    EXPECT_FALSE(get(address, gone));
    const auto metadata = client().metadataForUser(address);
    ASSERT_TRUE(metadata && metadata->info);
    EXPECT_EQ(metadata->info->size(), 1U);
    EXPECT_FALSE(metadata->transient);
}

// Goal: a broken structure is whole again, in the class that is recorded, and no link followed.
// Method: subdirectories removed, closed, swapped; a recorded class, and a lock that takes it away.
TEST_F(Known, StructureIsMadeAgain) {
    const FoundContainer container = world.make("com.example");
    std::filesystem::remove_all(container.path + "/Library");
    ASSERT_EQ(::chmod((container.path + "/Documents").c_str(), 0), 0);
    ASSERT_TRUE(client().recreateDefaultStructureForUser(addressOf(container)));
    for (const char* subdirectory : {"/Documents", "/Library", "/Library/Caches", "/Library/Preferences", "/tmp"})
        EXPECT_EQ(itemAt(container.path + subdirectory), directoryOf(mobile)) << subdirectory;
    ASSERT_TRUE(set(addressOf(container), "com.veltra.Brevance.ContentProtectionClass", 1));
    std::filesystem::remove_all(container.path + "/tmp");
    const auto classOf = [&](const char* subdirectory) {
        const auto found = world.services().defaultManager().dataProtectionClassOfItemAtURL(
            FileURL::directory(container.path + subdirectory));
        return found.value_or(-1);
    };
    world.lockState.state = 1;
    EXPECT_EQ(codeOf(client().recreateDefaultStructureForUser(addressOf(container))), ErrorCode::subdirectoryFailed);
    EXPECT_FALSE(isThere(container.path + "/tmp"));
    world.lockState.state = 0;
    ASSERT_TRUE(client().recreateDefaultStructureForUser(addressOf(container)));
    EXPECT_EQ(classOf("/tmp"), 1);
    EXPECT_EQ(classOf("/Documents"), 3);
    world.makeDirectories("outside", 0, 0700);
    std::filesystem::remove_all(container.path + "/Library");
    std::filesystem::create_directory_symlink(world.path("outside"), container.path + "/Library");
    EXPECT_EQ(codeOf(client().recreateDefaultStructureForUser(addressOf(container))), ErrorCode::subdirectoryFailed);
    EXPECT_EQ(world.item("outside"), directoryOf(0, 0700));
    EXPECT_TRUE(world.names("outside").empty());
}

// Goal: the directory gets another name, whole or not at all, and the mapping follows the live one.
// Method: a failing rename, a rename, a restart; before it the same of a transient one.
TEST_F(Known, DirectoryGetsANewName) {
    const FoundContainer container = world.make("com.example");
    const Address address = addressOf(container);
    ASSERT_TRUE(
        client().regenerateDirectoryUUIDForUser(addressOf(world.make("com.example", application, asTransient))));
    EXPECT_TRUE(world.names("run/zorvane/sandbox/501/1").empty());
    world.refuse(DiskCall::rename, EIO);
    EXPECT_EQ(codeOf(client().regenerateDirectoryUUIDForUser(address)), ErrorCode::directoryNotRenamed);
    world.disk().disarm();
    EXPECT_EQ(client().metadataForUser(address)->path, container.path);
    ASSERT_TRUE(client().regenerateDirectoryUUIDForUser(address));
    const std::string moved = client().metadataForUser(address)->path;
    EXPECT_NE(moved, container.path);
    EXPECT_TRUE(UUID::parse(nameOf(moved)));
    EXPECT_FALSE(isThere(container.path));
    EXPECT_EQ(std::filesystem::read_symlink(world.path("run/zorvane/sandbox/501/1/com.example")), moved);
    // A sync that fails says what happened.
    world.disk().arm({.filter = [](const auto& call) {
        return call.call == DiskCall::sync || call.call == DiskCall::syncFileSystem;
    }});
    const auto renamed = client().regenerateDirectoryUUIDForUser(address);
    world.disk().disarm();
    ASSERT_EQ(codeOf(renamed), ErrorCode::directoryNotRenamed);
    const std::string last = client().metadataForUser(address)->path;
    EXPECT_TRUE(renamed.error().description()->starts_with(last + " is in its place, but a power cut may undo that"));
    world.restart();
    EXPECT_EQ(client().metadataForUser(address)->path, last);
}

// Goal: a bundle is measured once, unless it is being filled; data each time, rubbish over. Method: files added between
// queries.
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
    world.services().store().diskUsage.settledTime = {};
    const std::uint64_t bundleBytes = usage(bundle);
    const std::uint64_t dataBytes = usage(data);
    const std::uint64_t transientBytes = usage(transient);
    EXPECT_GE(bundleBytes, 200'000U);
    grow("/two");
    world.restart();
    world.services().store().diskUsage.settledTime = {};
    EXPECT_EQ(usage(bundle), bundleBytes);
    EXPECT_GE(usage(data), dataBytes + 100'000);
    EXPECT_GE(usage(transient), transientBytes + 100'000); // it is being filled
    // On a disk where it cannot be kept it is said, and measured again the next time.
    for (const bool fails : {false, true}) {
        ASSERT_TRUE(set(addressOf(bundle), "com.veltra.Brevance.StaticDiskUsage", "rubbish"));
        if (fails)
            world.disk().arm({.error = ENOSPC, .span = FaultSpan::fromThenOn});
        EXPECT_GE(usage(bundle), bundleBytes + 100'000);
    }
    world.disk().disarm();
    EXPECT_EQ(
        world.complaints("diskUsageForUserId"),
        std::vector<std::string>{"Error setting info value for userId: 33, identifier: com.example, Class: 1: 34"});
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

// Goal: the retry test ends the daemon as often as told, and leaves nothing; a deletion that may not last is no
// success. Method: a child a call, one of them on a failing disk.
TEST_F(Known, RetryTestCountsDown) {
    enum class End { crashed, succeeded, failed };
    for (const End end : {End::crashed, End::failed, End::crashed, End::succeeded}) {
        bool staged = false;
        if (end == End::failed)
            world.disk().arm({.error = EIO, .span = FaultSpan::fromThenOn, .filter = [&](const auto& info) {
                                  staged = staged || (info.call == DiskCall::rename &&
                                                      info.subject.find("metadata") == std::string::npos);
                                  return staged && info.call != DiskCall::rename;
                              }});
        const pid_t child = ::fork();
        if (child == 0)
            ::_exit(static_cast<int>(client().retryTestForUser(mobile, 1) ? End::succeeded : End::failed));
        int status = -1;
        ::waitpid(child, &status, 0);
        EXPECT_EQ(WIFEXITED(status) ? static_cast<End>(WEXITSTATUS(status)) : End::failed, end);
        world.disk().disarm();
        if (end == End::crashed) {
            EXPECT_EQ(world.names(applications).size(), 1U);
        }
    }
    EXPECT_TRUE(world.names(applications).empty());
}

// Goal: nobody waits for the disk under the lock of all identifiers. Method: whether somebody holds it at each sync
// that an operation makes, on file systems that keep an order and on those that keep none.
TEST(Syncs, AreWaitedForWithoutTheLock) {
    using plist::Dictionary;
    const std::string id = "com.example";
    const Dictionary groups{{std::string(entitlementKeys::applicationGroups), plist::Array{"group"}},
                            {std::string(entitlementKeys::systemContainer), true}};
    const auto registers = [&](World& world, const Dictionary& entitlements) {
        return world.services().store().entitlementChange.processEntitlements(&entitlements, &id, nullptr) ==
               ErrorCode::success;
    };
    const std::pair<const char*, std::function<bool(World&)>> rows[] = {
        {"creation", [](World& world) { return world.create("new").has_value(); }},
        {"registration", [&](World& world) { return registers(world, Dictionary{{"k", 1}}); }},
        {"deletion of a bundle",
         [&](World& world) {
             return world.daemonsClient()
                 .deleteContainerForUser(33, &id, ContainerClass::bundleApplication, false)
                 .has_value();
         }},
        {"deletion",
         [&](World& world) {
             return world.daemonsClient().deleteContainerForUser(mobile, &id, application, false).has_value();
         }},
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
            for (const std::uint32_t user : {mobile, second})
                (void)world.services().cache().containerForUser(user, ContainerClass::sharedAppGroup, &id, false);
            int syncs = 0;
            int held = 0;
            world.disk().before = [&, mine = std::this_thread::get_id()](const support::DiskCallInfo& call) {
                const bool isSync = call.call == DiskCall::sync || call.call == DiskCall::syncFileSystem;
                if (!isSync || std::this_thread::get_id() != mine)
                    return;
                ++syncs;
                held += world.services().locks().quietGeneration() ? 0 : 1;
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

// Goal: operations on one container, and registrations beside them, may run together. Method: a thread for each while
// its directory is renamed.
TEST_F(Known, OperationsRunTogether) {
    const Address address = addressOf(world.make("com.example"));
    world.write(groupMarkerPath, "");
    // Held by one while another comes and goes.
    const plist::Dictionary groups{{std::string(entitlementKeys::applicationGroups), plist::Array{"group"}}};
    const std::string names[] = {"holder", "other"};
    ZOREntitlementMapping& mapping = world.services().entitlements();
    EntitlementChange& change = world.services().store().entitlementChange;
    ASSERT_EQ(change.processEntitlements(&groups, &names[0], nullptr), ErrorCode::success);
    const std::string group = world.make("group", ContainerClass::sharedAppGroup).path;
    std::atomic<bool> end{false};
    const std::function<void(int)> operations[] = {
        [&](int) { EXPECT_TRUE(client().regenerateDirectoryUUIDForUser(address)); },
        [&](int i) { EXPECT_TRUE(set(address, "k", i)); },
        [&](int) { (void)get(address, "k"); },
        [&](int) { EXPECT_TRUE(client().metadataForUser(address)); },
        [&](int) { (void)client().diskUsageForUserId(address); },
        [&](int) { EXPECT_EQ(client().containersForUser(mobile, application, false)->size(), 1U); },
        [&](int) { EXPECT_TRUE(world.find("com.example")); },
        [&](int i) {
            EXPECT_EQ(change.processEntitlements(i % 2 == 0 ? &groups : nullptr, &names[1], nullptr),
                      ErrorCode::success);
            EXPECT_EQ(mapping.entitlementsExistForIdentifier(names[1]), i % 2 == 0);
        },
        [&](int) {
            EXPECT_EQ(
                world.services().groups().groupContainerPathsForUser(mobile, client().caller(), &names[0]).value(),
                (ZORGroupManager::Paths{{"group", group}}));
        },
    };
    inParallel(static_cast<int>(std::size(operations)), [&](int thread) {
        for (int i = 0; thread == 0 ? i < 80 : !end; ++i)
            operations[thread](i);
        end = end || thread == 0;
    });
    EXPECT_EQ(world.services().locks().identifiersInUse(), 0U);
    ASSERT_EQ(change.processEntitlements(nullptr, &names[1], nullptr), ErrorCode::success);
    ASSERT_EQ(change.processEntitlements(nullptr, &names[0], nullptr), ErrorCode::success);
    EXPECT_FALSE(isThere(group));
}

} // namespace
} // namespace zor::test
