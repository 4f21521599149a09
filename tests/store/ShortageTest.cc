// SPDX-License-Identifier: Apache-2.0
// Items that the daemon could not look at, for want of descriptors or because the disk refused: it deletes nothing for
// that, and keeps no answer that came of it.
#include "fs/Names.h"
#include "support/FewDescriptors.h"
#include "world/World.h"

#include <gtest/gtest.h>
#include <new>

namespace zor::test {
namespace {

constexpr rlim_t descriptorsMax = 24;

class Shortage : public testing::Test {
protected:
    Shortage() { world.load(); }

    /// The daemon ended after the first of a replace's two moves.
    /// The old one waits in staging or, as one of another file system, aside.
    void stopAReplaceOf(const FoundContainer& old, bool aside = false) {
        const std::string name = UUID::random().string();
        const std::string outer = fs::deathRowOuter;
        const std::string place = aside ? outer + "/" + fs::asideInner : staging;
        if (aside)
            world.makeDirectories(outer, ::geteuid(), 0700);
        world.makeDirectories(place, ::geteuid(), 0700);
        const std::string waiting = place + "/" + name;
        world.putJournal(name, {old.path, old.path, staging + "/" + name, old.path, aside ? waiting : ""});
        world.move(old.path, waiting);
    }

    World world;
};

// Goal: a launch that cannot read the journals deletes nothing that they name, and nothing is made in its place.
// Method: a stopped replace, something else in the journals' place or reads that fail, then requests, and a launch as
// it should be.
TEST_F(Shortage, JournalsThatCannotBeReadKeepWhatTheyName) {
    const FoundContainer old = world.make("old");
    const std::string there = world.path(journals);
    constexpr int noMemory = -1; // thrown
    constexpr int noDirectory = 0;
    const std::pair<int, bool> rows[] = {{noDirectory, false}, {EIO, false},        {ENOMEM, false},
                                         {noMemory, false},    {noDirectory, true}, {EIO, true}};
    for (const auto& row : rows) {
        const int trouble = row.first;
        const bool aside = row.second;
        SCOPED_TRACE(std::to_string(trouble) + (aside ? " aside" : ""));
        stopAReplaceOf(old, aside);
        if (trouble == noDirectory) {
            world.move(there, there + ".aside");
            world.write(journals, "no directory");
        }
        world.disk().unreadable = [&](int fd) {
            const auto path = std::filesystem::read_symlink("/proc/self/fd/" + std::to_string(fd)).string();
            const bool fails = trouble != noDirectory && path.starts_with(there);
            return fails && trouble == noMemory ? throw std::bad_alloc() : fails ? trouble : 0;
        };
        world.relaunch();
        EXPECT_EQ(codeOf(world.create("old")),
                  trouble == noMemory ? ErrorCode::exceptionCaught : ErrorCode::journalUnusable);
        EXPECT_TRUE(trouble == noMemory || world.create("another"));
        world.disk().unreadable = nullptr;
        if (trouble == noDirectory) {
            std::filesystem::remove(there);
            world.move(there + ".aside", there);
        }
        for (int launch = 0; launch < 2; ++launch) {
            EXPECT_EQ(world.make("old").path, old.path);
            world.relaunch();
        }
    }
}

// Goal: want of descriptors loses, doubles, brings back and keeps nothing. Method: each operation with each number of
// descriptors left, then while the limit comes and goes; what it left is looked at without a limit, and launched over.
TEST_F(Shortage, EachOperationWithFewDescriptors) {
    constexpr rlim_t comings = 30;
    rlim_t round = 0;
    constexpr std::size_t others = 300; // two threads read a class directory with so many
    for (std::size_t i = 0; i < others; ++i)
        (void)world.make("other" + std::to_string(i));
    const FoundContainer kept = world.make("kept");
    world.write(world.relative(kept.path) + "/content", "kept");
    FoundContainer old;
    FoundContainer fresh;
    std::string before;
    std::uint64_t bytes = 0;
    bool done = false;
    int failed = 0;
    const auto contentOf = [&](const FoundContainer& one) { return world.read(world.relative(one.path) + "/content"); };
    const auto remember = [&] { EXPECT_EQ(world.make("kept").uuid, kept.uuid); };
    const auto askForKept = [&] {
        const auto found = world.create("kept");
        EXPECT_TRUE(!found || found->uuid == kept.uuid);
        done = found.has_value();
    };
    const auto makeOld = [&](ContainerClass containerClass = application) {
        old = world.make("old" + std::to_string(round), containerClass);
        world.write(world.relative(old.path) + "/content", "old");
        world.write(world.relative(old.path) + "/a/b/c/d/e/f/g/h/i/j/k/l/file", std::string(100'000, 'x'));
        before = support::readTree(old.path).describe();
    };
    const auto deleteOld = [&] {
        return world.daemonsClient()
            .deleteContainerForUser(old.record->uid(), &old.record->identifier(), old.record->containerClass(), false)
            .has_value();
    };
    const auto size = [&] {
        const auto usage = world.daemonsClient().diskUsageForUserId(addressOf(old));
        bytes = usage.bytes;
        done = usage.error == ErrorCode::success && bytes >= 100'000;
    };
    struct Operation {
        const char* name;
        std::function<void()> prepare;
        std::function<void()> run;
        std::function<void()> judge;
    };
    const Operation operations[] = {
        {"lookup", [&] { world.restart(); }, askForKept, remember},
        {"list", [&] { world.restart(); },
         [&] {
             const auto all = world.daemonsClient().containersForUser(mobile, application, false);
             EXPECT_TRUE(!all || all->size() == others + 1);
             done = all.has_value();
         },
         remember},
        {"record", remember,
         [&] {
             const auto code = codeOf(world.daemonsClient().metadataForUser(addressOf(kept)));
             EXPECT_NE(code, ErrorCode::notFound);
             done = code == ErrorCode::success;
         },
         remember},
        {"size",
         [&] {
             world.services().store().diskUsage.settledTime = {};
             makeOld(ContainerClass::bundleApplication);
         },
         size,
         [&] {
             size();
             EXPECT_TRUE(done) << bytes;
         }},
        {"deletion", [&] { makeOld(); }, [&] { done = deleteOld(); },
         [&] {
             const bool stays = isThere(old.path);
             EXPECT_TRUE(!stays || support::readTree(old.path).describe() == before);
             EXPECT_EQ(deleteOld(), stays);
         }},
        {"replace",
         [&] {
             makeOld();
             fresh = world.make(old.record->identifier(), application, asTransient);
             world.write(world.relative(fresh.path) + "/content", "new");
         },
         [&] {
             using enum ZORClientConnection::PreserveOldUUID;
             done = world.replace(&old, fresh, round % 2 == 0 ? no : yes).has_value();
         },
         [&] {
             const auto now = world.find(old.record->identifier());
             ASSERT_TRUE(now);
             EXPECT_TRUE(contentOf(*now) == "new" || (!done && contentOf(*now) == "old"));
             ASSERT_TRUE(deleteOld());
             world.relaunch();
             EXPECT_FALSE(world.find(old.record->identifier()));
         }},
        {"launch over a stopped replace",
         [&] {
             stopAReplaceOf(kept);
             world.restart();
             world.load();
         },
         [&] {
             world.daemonsClient().containerManagerSetup();
             askForKept();
         },
         [&] {
             EXPECT_EQ(world.make("kept").path, kept.path);
             world.relaunch();
         }},
    };
    for (const Operation& operation : operations) {
        SCOPED_TRACE(operation.name);
        failed = 0;
        for (round = 0; round < descriptorsMax + comings; ++round) {
            SCOPED_TRACE(round);
            operation.prepare();
            {
                std::optional<support::FewDescriptors> few;
                std::optional<support::DescriptorsThatComeAndGo> limit;
                if (round < descriptorsMax)
                    few.emplace(round);
                else
                    limit.emplace();
                operation.run();
            }
            failed += done ? 0 : 1;
            operation.judge();
        }
        EXPECT_GT(failed, 0);
        EXPECT_EQ(contentOf(kept), "kept");
        EXPECT_EQ(world.names(applications).size(), others + 1);
    }
}

} // namespace
} // namespace zor::test
