// SPDX-License-Identifier: Apache-2.0
// What the daemon could not look at, for want of descriptors or because the disk refused: it deletes nothing for that,
// and keeps no answer that came of it.
#include "operations/ZOREntitlementMapping.h"
#include "store/ReplaceJournal.h"
#include "support/FewDescriptors.h"
#include "world/World.h"

#include <filesystem>
#include <gtest/gtest.h>
#include <new>

namespace zor::test {
namespace {

constexpr rlim_t descriptorsMax = 24;

class Shortage : public testing::Test {
protected:
    Shortage() { world.load(); }

    /// The daemon ended after the first of a replace's two moves.
    void stopAReplaceOf(const FoundContainer& old) {
        StoreServices& store = world.services().store();
        const UUID uuid = UUID::random();
        const FileURL oldUrl = FileURL::directory(old.path);
        const ReplaceJournal journal{.oldUrl = oldUrl,
                                     .newUrl = oldUrl,
                                     .stagingUrl =
                                         store.configuration.stagingDirectory().appendingDirectory(uuid.string()),
                                     .destUrl = oldUrl};
        ASSERT_TRUE(journal._writeToDiskReplaceAt(
            store.log, store.fileManager, ReplaceJournal::urlFor(store.configuration.replaceDirectory(), uuid)));
        ASSERT_TRUE(store.fileManager.moveItemAtURL(oldUrl, journal.stagingUrl));
    }
    void relaunch() {
        world.restart();
        world.launch();
    }

    World world;
};

// Goal: a launch that cannot read the journals deletes nothing that they name. Method: a stopped replace, a launch with
// few descriptors or something else in the journals' place; then a request for the old one, and a launch as it should
// be.
TEST_F(Shortage, JournalsThatCannotBeReadKeepWhatTheyName) {
    const FoundContainer old = world.make("old");
    const std::string content = world.relative(old.path) + "/content";
    world.write(content, "old");
    for (rlim_t left = 0; left <= descriptorsMax; ++left) {
        SCOPED_TRACE(left);
        stopAReplaceOf(old);
        if (left == descriptorsMax) {
            const std::string there = world.path(journals);
            std::filesystem::rename(there, there + ".aside");
            world.write(journals, "no directory");
            relaunch();
            EXPECT_EQ(codeOf(world.create("old")), ErrorCode::journalUnusable);
            EXPECT_TRUE(world.create("another"));
            std::filesystem::remove(there);
            std::filesystem::rename(there + ".aside", there);
        } else {
            world.restart();
            world.load();
            const support::FewDescriptors few(left);
            world.daemonsClient().containerManagerSetup();
        }
        const FoundContainer found = world.make("old");
        EXPECT_EQ(found.uuid, old.uuid);
        EXPECT_EQ(found.path, old.path);
        relaunch();
        ASSERT_EQ(world.read(content), "old");
    }
}

// Goal: a shortage of moments loses, doubles and keeps nothing of what it met. Method: a launch that finds a stopped
// replace, requests and a deletion, while the limit of descriptors comes and goes.
TEST_F(Shortage, ALimitThatComesAndGoes) {
    const FoundContainer old = world.make("old");
    const std::string content = world.relative(old.path) + "/content";
    world.write(content, "old");
    const std::string victim = "victim";
    for (int round = 0; round < 150; ++round) {
        SCOPED_TRACE(round);
        (void)world.make(victim);
        stopAReplaceOf(old);
        world.restart();
        world.load();
        {
            const support::DescriptorsThatComeAndGo limit;
            world.daemonsClient().containerManagerSetup();
            const auto found = world.create("old");
            EXPECT_TRUE(!found || found->uuid == old.uuid);
            (void)world.daemonsClient().deleteContainerForUser(mobile, &victim, application, false);
        }
        EXPECT_EQ(world.make("old").uuid, old.uuid);
        const FoundContainer either = world.make(victim); // gone, or whole
        EXPECT_TRUE(isThere(either.path + "/Library/Preferences"));
        relaunch();
        ASSERT_EQ(world.read(content), "old");
        ASSERT_EQ(world.names(applications).size(), 2U);
    }
}

// Goal: a size that was measured in part is not kept. Method: each number of descriptors left, then all.
TEST_F(Shortage, ASizeMeasuredInPartIsNotKept) {
    int inPart = 0;
    world.services().store().usageSettledTime = {};
    for (rlim_t left = 0; left < descriptorsMax; ++left) {
        SCOPED_TRACE(left);
        const FoundContainer bundle = world.make("size" + std::to_string(left), ContainerClass::bundleApplication);
        world.write(world.relative(bundle.path) + "/a/b/c/d/e/f/g/h/i/j/k/l/file", std::string(100'000, 'x'));
        const ZORClientConnection::ContainerAddress address{.userId = bundle.record->uid(),
                                                            .uuid = bundle.uuid,
                                                            .identifier = bundle.record->identifier(),
                                                            .containerClass = ContainerClass::bundleApplication};
        std::uint64_t measured = 0;
        {
            const support::FewDescriptors few(left);
            measured = world.daemonsClient().diskUsageForUserId(address).bytes;
        }
        const auto whole = world.daemonsClient().diskUsageForUserId(address);
        EXPECT_EQ(whole.error, ErrorCode::success);
        EXPECT_GE(whole.bytes, 100'000U);
        inPart += measured < whole.bytes ? 1 : 0;
    }
    EXPECT_GT(inPart, 1);
}

// Goal: what a client was told to have failed is saved when it asks again. Method: a want of memory, then a launch.
TEST_F(Shortage, AnEntitlementThatWasNotSavedIsSavedWhenAskedAgain) {
    const std::string identifier = "app";
    const plist::Dictionary entitlements{{"k", "v"}};
    world.disk().arm({.filter = [](const support::DiskCallInfo&) -> bool { throw std::bad_alloc(); }});
    const auto process = [&] {
        return world.services().entitlements().processEntitlements(&entitlements, &identifier, nullptr);
    };
    EXPECT_EQ(process(), ErrorCode::exceptionCaught);
    world.disk().disarm();
    EXPECT_EQ(process(), ErrorCode::success);
    world.restart();
    EXPECT_TRUE(world.services().entitlements().entitlementMappingDict().find(identifier));
}

} // namespace
} // namespace zor::test
