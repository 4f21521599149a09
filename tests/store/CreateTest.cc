// SPDX-License-Identifier: Apache-2.0
// Homes that are links; creating, finding and listing containers: what a container of each class looks like on disk,
// transient ones, many clients at once, and what users may leave behind.
#include "support/StoreJudge.h"
#include "world/World.h"

#include <gtest/gtest.h>

namespace zor::test {
namespace {

using support::DiskCall;
using support::DiskCallInfo;

class Create : public testing::Test {
protected:
    World world;

    std::set<std::string> listed(ContainerClass containerClass = application, bool transient = false) {
        std::set<std::string> identifiers;
        const auto all = world.daemonsClient().containersForUser(ownerOf(containerClass), containerClass, transient);
        for (const auto& container : all.value())
            EXPECT_TRUE(identifiers.insert(container.identifier).second);
        return identifiers;
    }
};

// Goal: every class gets its place, tree, modes and owners, and a directory name that is not its internal UUID; a new
// daemon finds the same container. Method: all classes, live and transient, these with a umask that takes what it can,
// judged by a reader of its own.
TEST_F(Create, EveryClassGetsItsTree) {
    for (const bool transient : {false, true})
        for (std::uint64_t number = 1; ipc::isContainerClass(number); ++number) {
            const auto containerClass = static_cast<ContainerClass>(number);
            SCOPED_TRACE(std::string(className(containerClass)) + (transient ? " transient" : ""));
            const mode_t mask = ::umask(transient ? 077 : 022);
            const auto found = world.create("com.example", containerClass, transient);
            ::umask(mask);
            ASSERT_TRUE(found) << found.error().text();
            EXPECT_FALSE(found->existed);
            EXPECT_EQ(found->record->transient(), transient);
            const std::string path = world.relative(found->path);
            const auto findings = support::judgeStore(support::readTree(world.path()), support::Transients::judged);
            EXPECT_EQ(findings.complaint + findings.doubled, "");
            EXPECT_TRUE(findings.staging.empty());
            const auto* const there = findings.find(number, transient, "com.example");
            ASSERT_TRUE(there);
            EXPECT_EQ(there->path + there->uuid, path + found->uuid.string());
            EXPECT_NE(UUID::parse(nameOf(path)).value(), found->uuid);
            EXPECT_EQ(world.item(parentOf(path)), directoryOf(isBundleClass(containerClass)   ? 33
                                                              : isSystemClass(containerClass) ? 0
                                                                                              : mobile));
            EXPECT_EQ(world.services().defaultManager().dataProtectionClassOfItemAtURL(world.url(path)).value(), 0);
            EXPECT_EQ(listed(containerClass, transient), (std::set<std::string>{"com.example"}));
            if (transient)
                continue;
            EXPECT_TRUE(listed(containerClass, asTransient).empty());
            for (int launch = 0; launch < 2; ++launch) {
                const auto again = world.find("com.example", containerClass);
                ASSERT_TRUE(again);
                EXPECT_TRUE(again->existed);
                EXPECT_EQ(again->uuid, found->uuid);
                EXPECT_EQ(again->path, found->path);
                world.restart();
            }
        }
}

// Goal: a transient container is never found again, nor in the way of the next. Method: requests in a row, one whose
// removal is refused and one whose re-creation is.
TEST_F(Create, TransientContainersAreThrownAwayWhenAskedForAgain) {
    const auto create = [&] { return world.create("com.example", application, asTransient); };
    const auto find = [&] { return codeOf(world.find("com.example", application, asTransient)); };
    const FoundContainer first = create().value();
    world.refuse(DiskCall::rename, EIO);
    EXPECT_EQ(codeOf(create()), ErrorCode::transientRemovalFailed);
    world.disk().disarm();
    EXPECT_TRUE(isThere(first.path));
    EXPECT_EQ(listed(application, asTransient), (std::set<std::string>{"com.example"}));
    const FoundContainer next = create().value();
    EXPECT_FALSE(next.existed || next.uuid == first.uuid || isThere(first.path));
    for (int i = 0; i < 2; ++i)
        EXPECT_EQ(find(), ErrorCode::notFound);
    EXPECT_FALSE(isThere(next.path));
    ASSERT_TRUE(create());
    world.refuse(DiskCall::createFile, ENOSPC);
    EXPECT_EQ(codeOf(create()), ErrorCode::propertyListNotWritten);
    world.disk().disarm();
    EXPECT_EQ(find(), ErrorCode::notFound);
    EXPECT_TRUE(create());
    world.drainDeathRow();
    EXPECT_TRUE(world.names(dead).empty());
}

// Goal: a lookup, which takes no lock while nobody writes, never answers from the middle of a writer. Method: one
// thread does every kind of change in turn and notes what is true afterwards; each answer to the others is something
// noted.
TEST_F(Create, LookupsBesideEveryWriter) {
    using Answer = std::pair<std::string, std::string>;
    constexpr unsigned readers = 3;
    const std::string id = "com.example";
    std::set<Answer> noted;
    std::array<std::set<Answer>, readers> answers;
    std::atomic<bool> done{false};
    std::atomic<int> wrong{0};
    const auto answerOf = [](const FoundContainer& found) { return Answer{found.uuid.string(), found.path}; };
    auto now = world.make(id);
    world.log.setLevel(logLevelError);
    ZORClientConnection& client = world.daemonsClient();
    const plist::Value value(1);
    const std::function<bool()> changes[] = {
        [&] { return client.setInfoValue(&value, &id, addressOf(now), UseLocking::yes).has_value(); },
        [&] { return client.regenerateDirectoryUUIDForUser(addressOf(now)).has_value(); },
        [&] { return client.recreateDefaultStructureForUser(addressOf(now)).has_value(); },
        [&] { return world.replace(&now, world.make(id, application, asTransient)).has_value(); },
        [&] { return client.deleteDataContainerContentForUser(mobile, &id, application).has_value(); },
        [&] { return world.stage(now) == ErrorCode::success && world.create(id).has_value(); },
    };
    noted.insert(answerOf(now));
    inThreads(readers + 1, [&](unsigned thread) {
        if (thread == readers) {
            for (int round = 0; round < 60; ++round) {
                wrong += !changes[static_cast<std::size_t>(round) % std::size(changes)]();
                now = world.find(id).value();
                noted.insert(answerOf(now));
            }
            done = true;
            return;
        }
        while (!done) {
            const auto found = world.find(id);
            wrong += !found && !found.error().is(ErrorCode::notFound);
            if (found)
                answers[static_cast<std::size_t>(thread)].insert(answerOf(*found));
        }
    });
    EXPECT_EQ(wrong, 0);
    for (const auto& own : answers)
        EXPECT_TRUE(std::ranges::includes(noted, own));
}

// Goal: nobody waits for the disk that another's creation waits for, and of two that make the same one the later
// finds the earlier's. Method: while one is being built, others look, make another, and make the same.
TEST_F(Create, IsBuiltBesideOthers) {
    const FoundContainer there = world.make("there");
    FoundContainer first;
    std::atomic<bool> entered{false};
    world.disk().before = [&](const DiskCallInfo& call) {
        if (call.call != DiskCall::changeMode || entered.exchange(true))
            return;
        auto others = std::async(std::launch::async, [&] {
            EXPECT_EQ(world.find("there").value().uuid, there.uuid);
            EXPECT_TRUE(world.create("another"));
            first = world.make("same");
        });
        ASSERT_EQ(others.wait_for(std::chrono::seconds(20)), std::future_status::ready);
    };
    const FoundContainer second = world.make("same");
    world.drainDeathRow(); // its thread asks the disk, too
    world.disk().before = nullptr;
    ASSERT_TRUE(entered);
    EXPECT_FALSE(first.existed);
    EXPECT_TRUE(second.existed);
    EXPECT_EQ(second.uuid, first.uuid);
    EXPECT_EQ(listed(), (std::set<std::string>{"another", "same", "there"}));
    EXPECT_TRUE(world.names(staging).empty());
    EXPECT_TRUE(world.names(dead).empty());
}

// Goal: users can leave only so much behind in memory, whatever class it is of and over restarts; owners of the root,
// and what takes another's place, are not kept out. Method: small limits.
TEST_F(Create, UsersHaveShares) {
    constexpr auto group = ContainerClass::sharedAppGroup;
    const auto asUser = [&] {
        return world.client({.bundleIdentifier = "x", .userId = mobile, .allowOtherIdLookup = true});
    };
    const auto make = [&](const std::string& identifier, ContainerClass containerClass, bool transient = false,
                          std::uint32_t userId = mobile) {
        return asUser()->createOrLookupContainerForUser(userId, &identifier, containerClass,
                                                        {.createIfNecessary = true, .transient = transient});
    };
    const std::string key = "a";
    const auto set = [&](ZORClientConnection& client, ContainerClass containerClass, std::size_t bytes) {
        const plist::Value value(std::string(bytes, 'x'));
        const auto uuid = make(key, containerClass).value().uuid;
        return codeOf(client.setInfoValue(&value, &key, {mobile, uuid, key, containerClass}, UseLocking::yes));
    };
    for (const bool again : {false, true}) {
        world.services().store().limits = {.containersMaxPerUser = 3, .infoBytesMaxPerUser = 1000};
        EXPECT_TRUE(make("a", application));
        EXPECT_TRUE(make("a", application, asTransient));
        EXPECT_TRUE(make("a", group));
        for (const auto containerClass : {application, ContainerClass::dataTempDir, group})
            EXPECT_EQ(complaintOf(make("d", containerClass)),
                      "38 User 501 has 3 containers, and no more may be made: d. Delete some, or start zorvaned with a "
                      "larger --containers-per-user");
        EXPECT_TRUE(make("a", application, asTransient)); // in the place of the one that was
        EXPECT_TRUE(asUser()->deleteDataContainerContentForUser(mobile, &key, application));
        EXPECT_TRUE(make("a", application, asTransient));
        EXPECT_TRUE(make("a", ContainerClass::bundleApplication, false, UserNumbers().installer)); // another's share
        constexpr auto refused = ErrorCode::propertyListNotWritten;
        EXPECT_EQ(set(*asUser(), application, 700), again ? refused : ErrorCode::success);
        EXPECT_EQ(set(*asUser(), application, 100), again ? refused : ErrorCode::success);
        EXPECT_EQ(set(*asUser(), application, 1000), refused);
        EXPECT_EQ(set(*asUser(), group, again ? 800 : 900), again ? ErrorCode::success : refused); // less always fits
        EXPECT_EQ(set(world.daemonsClient(), group, 900), ErrorCode::success);
        world.restart();
    }
    EXPECT_TRUE(world.create("d"));
}

// Goal: a home may be the administrator's link; below it a user's leads nowhere. Method: both kinds.
TEST(Layout, LinksToAndBelowAHome) {
    World world;
    world.write("etc/passwd", "mobile:x:501:501::/private/var/alias:/bin/sh\n");
    world.link("mobile", "private/var/alias");
    ZORGlobalConfiguration& configuration = world.services().configuration();
    EXPECT_EQ(configuration.getPerUserConfigurationForUserId(mobile)->userHomeDirectory(),
              world.url("private/var/mobile"));
    world.link("../second", mobileContainers);
    EXPECT_EQ(configuration.containerDirectoryURLForUser(mobile, application, false), world.url(applications));
    EXPECT_TRUE(world.names("private/var/second").empty());
}

// Goal: who first asks for a home while another does is given that home. Method: threads, all at once, many times.
TEST(Layout, FirstLooksThatMeetSeeOneHome) {
    World world;
    Composition& services = world.services();
    for (int round = 0; round < 200; ++round) {
        UserHome home(mobile, services.log(), services.defaultManager().resolver(), services.platform().passwords);
        std::atomic<int> wrong{0};
        inThreads(4, [&](unsigned) {
            const auto seen = home.look();
            wrong += !seen.directory || *seen.directory != world.url("private/var/mobile");
        });
        ASSERT_EQ(wrong, 0) << "in round " << round;
    }
}

} // namespace
} // namespace zor::test
