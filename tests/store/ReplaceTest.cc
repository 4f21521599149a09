// SPDX-License-Identifier: Apache-2.0
// Replace and wipe: what is swapped, what is refused, what each failing step leaves, and what a launch makes of each
// state that a stop can leave.
#include "fs/Names.h"
#include "operations/ZORDataProtectionManager.h"
#include "world/World.h"

#include <atomic>
#include <future>
#include <gtest/gtest.h>
#include <thread>
#include <tuple>

namespace zor::test {
namespace {

using support::DiskCall;
using support::DiskCallInfo;
using support::FaultSpan;
using Preserve = ZORClientConnection::PreserveOldUUID;

constexpr ContainerClass bundle = ContainerClass::bundleApplication;
// The names and places in the journals that a test puts.
const std::string journal = "11111111-1111-4111-8111-111111111111";
const std::string waiting = staging + "/" + journal;
const std::string oldPlace = applications + "/22222222-2222-4222-8222-222222222222";
const std::string newPlace = transients + "/33333333-3333-4333-8333-333333333333";
const std::string destination = applications + "/33333333-3333-4333-8333-333333333333";

class Replace : public testing::Test {
protected:
    explicit Replace(const World::Options& options = {}) : world(options) {
        world.log.setLevel(logLevelDebug);
        world.load();
    }
    World world;

    FoundContainer make(const std::string& identifier, bool transient, ContainerClass containerClass = application) {
        FoundContainer made = world.make(identifier, containerClass, transient);
        world.write(world.relative(made.path) + "/content", transient ? "new" : "old");
        return made;
    }
    [[nodiscard]] std::string contentOf(const FoundContainer& container) const {
        return world.read(world.relative(container.path) + "/content");
    }
    /// Nothing is under way, and no lock held.
    bool isQuiet() {
        return world.names(staging).empty() && world.names(journals).empty() &&
               world.services().locks().identifiersInUse() == 0;
    }
};

class ReplaceWithoutOrder : public Replace {
protected:
    ReplaceWithoutOrder() : Replace({.probe = [](int) { return fs::Ordering::none; }}) {}
    static bool isSync(const DiskCallInfo& call) {
        return call.call == DiskCall::sync || call.call == DiskCall::syncFileSystem;
    }
};

// Goal: the new content stands under the promised name and UUID, also for the next daemon, and no journal is left.
// Method: the three kinds of replace, for data and bundles.
TEST_F(Replace, PutsTheNewOneInPlace) {
    enum class Kind { noOld, old, preserving };
    for (const ContainerClass containerClass : {application, bundle, ContainerClass::dataSystem})
        for (const Kind kind : {Kind::noOld, Kind::old, Kind::preserving}) {
            SCOPED_TRACE(std::string(className(containerClass)) + " " + std::to_string(static_cast<int>(kind)));
            // A well-known one lives under its name, whichever takes its place.
            const bool wellKnown = containerClass == ContainerClass::dataSystem;
            if (wellKnown && kind == Kind::noOld)
                continue;
            const std::string identifier =
                wellKnown ? "com.veltra.settingsd" : "com.example." + std::to_string(static_cast<int>(kind));
            std::optional<FoundContainer> old;
            if (kind != Kind::noOld)
                old = make(identifier, false, containerClass);
            const FoundContainer fresh = make(identifier, asTransient, containerClass);
            const FoundContainer& named = kind == Kind::preserving ? *old : fresh;
            EXPECT_EQ(complaintOf(world.replace(old ? &*old : nullptr, fresh,
                                                kind == Kind::preserving ? Preserve::yes : Preserve::no)),
                      "");
            EXPECT_TRUE(isQuiet());
            for (int launch = 0; launch < 2; ++launch) {
                const auto found = world.find(identifier, containerClass);
                ASSERT_TRUE(found) << found.error().text();
                EXPECT_EQ(contentOf(*found), "new");
                EXPECT_EQ(found->uuid, named.uuid);
                EXPECT_EQ(nameOf(found->path), wellKnown ? identifier : nameOf(named.path));
                EXPECT_FALSE(isThere(fresh.path));
                world.restart();
            }
        }
}

// Goal: each reason against a replace has its code, and nothing moves. Method: requests that a good one differs from.
TEST_F(Replace, RefusesBeforeAnythingMoves) {
    const FoundContainer old = make("a", false);
    const FoundContainer fresh = make("a", asTransient);
    (void)make("b", false);
    const FoundContainer freshOther = make("b", asTransient);
    const FoundContainer wellKnown = world.make("com.veltra.settingsd", ContainerClass::dataSystem);
    // Something has the name that the third would get.
    const FoundContainer third = make("c", false);
    const FoundContainer taken = make("c", asTransient);
    world.makeDirectories(applications + "/" + nameOf(taken.path), mobile);
    using enum ErrorCode;
    const std::pair<Result<void>, ErrorCode> rows[] = {
        {world.replace(nullptr, fresh, Preserve::yes), invalidObject},
        {world.replace(&old, old), replacedByItself},
        {world.replace(nullptr, wellKnown), pathNotAsExpected},
        {world.replace(nullptr, old), alreadyExists},
        {world.replace(nullptr, fresh), alreadyExists},
        // The new one's identifier has another live container: two of one identifier must not come to be.
        {world.replace(&old, freshOther), alreadyExists},
        {world.replace(&third, taken), alreadyExists},
    };
    for (const auto& [answer, code] : rows)
        EXPECT_EQ(codeOf(answer), code) << &code - &rows[0].second;
    EXPECT_TRUE(isQuiet());
    EXPECT_EQ(contentOf(old) + contentOf(fresh), "oldnew");
    EXPECT_TRUE(world.replace(&old, fresh));
}

// Goal: each state that a stop can leave becomes a whole one. Method: the states put on disk one by one, a launch.
TEST_F(Replace, EveryStateOfTheTableIsRecovered) {
    const std::string& old = oldPlace;
    const std::string& fresh = newPlace;
    const std::string& dest = destination;
    struct Row {
        const char* said;
        std::vector<std::string> there; // each holds a file that says where it was put
        std::array<std::string, 5> paths;
        std::map<std::string, std::string> after; // place to what it must hold
        bool waits = false;
    };
    const std::array<std::string, 5> paths = {old, fresh, waiting, dest};
    const std::array<std::string, 5> preserving = {old, fresh, waiting, old};
    const std::array<std::string, 5> behindLink = {applications + "/loop/x", fresh, waiting, dest};
    const std::array<std::string, 5> movedRoot = {"/elsewhere/" + old, "/elsewhere/" + old + "x",
                                                  "/elsewhere/" + waiting, "/elsewhere/" + old};
    const Row rows[] = {
        {": nothing had moved", {old, fresh}, paths, {{old, old}, {fresh, fresh}}},
        {": the old one had moved", {waiting, fresh}, paths, {{old, waiting}, {fresh, fresh}}},
        {": the old one had moved", {waiting, fresh}, preserving, {{old, waiting}, {fresh, fresh}}},
        {": the old one had moved", {waiting}, movedRoot, {{old, waiting}}},
        {": both had moved", {waiting, dest}, paths, {{dest, dest}}},
        {": both had moved", {waiting, old}, preserving, {{old, old}}},
        {": both had moved", {waiting, dest}, behindLink, {{dest, dest}}},
        {": nothing was waiting any more", {dest}, paths, {{dest, dest}}},
        {": nothing was waiting any more", {old}, preserving, {{old, old}}},
        {": nothing is left", {}, paths, {}},
        {"Invalid replace data", {waiting, fresh}, {old, "", waiting, dest}, {{fresh, fresh}}},
        {"Failed to recover", {waiting}, {old, fresh, waiting, behindLink[0]}, {}, true},
    };
    world.makeDirectories(applications, mobile);
    world.link("elsewhere", applications + "/loop");
    for (const Row& row : rows) {
        SCOPED_TRACE(&row - rows);
        for (const std::string& place : row.there)
            world.write(place + "/content", place);
        world.putJournal(journal, row.paths);
        world.log.take();
        world.relaunch();
        std::map<std::string, std::string> after;
        for (const std::string& place : {old, fresh, dest})
            if (world.exists(place))
                after[place] = world.read(place + "/content");
        EXPECT_EQ(after, row.after);
        EXPECT_EQ(isQuiet(), !row.waits);
        EXPECT_TRUE(std::ranges::any_of(world.log.take(), [&](const support::LogLine& line) {
            return line.level <= 5 && line.message.find(row.said) != std::string::npos;
        }));
        for (const std::string& place : {old, fresh, dest, staging, journals})
            std::filesystem::remove_all(world.path(place));
    }
}

// Goal: a recovery that cannot finish loses nothing; until it can, nothing is made beside what it may bring back,
// others are served, and the next request or launch finishes it. Method: a move that fails, requests meanwhile, then
// either.
TEST_F(Replace, ARecoveryThatStopsKeepsWhatItStillNeeds) {
    const std::vector<std::string> journalFile = {journal + ".plist"};
    for (const bool byLaunch : {false, true}) {
        SCOPED_TRACE(byLaunch);
        world.makeDirectories(applications, mobile);
        world.putContainer(waiting, metadataOf(2, mobile, "kept"));
        world.write(waiting + "/content", "old");
        world.write(staging + "/rubbish/content", "half-made");
        world.putJournal(journal, {oldPlace, oldPlace + "x", waiting, oldPlace});
        world.log.take();
        world.disk().arm({.error = EIO, .span = FaultSpan::fromThenOn, .filter = [&](const DiskCallInfo& call) {
                              return call.call == DiskCall::rename && call.subject.starts_with(journal + " -> ");
                          }});
        world.launch();
        EXPECT_TRUE(world.disk().met());
        for (const bool transient : {false, true}) {
            EXPECT_EQ(codeOf(world.create("kept", application, transient)), ErrorCode::journalUnusable);
            EXPECT_EQ(codeOf(world.find("kept", application, transient)), ErrorCode::journalUnusable);
            EXPECT_TRUE(world.create("other", application, transient));
        }
        EXPECT_TRUE(world.create("kept", ContainerClass::dataTempDir));
        EXPECT_EQ(world.names(staging), (std::vector<std::string>{journal}));
        EXPECT_EQ(world.names(journals), journalFile);
        world.disk().disarm();
        if (byLaunch)
            world.relaunch();
        const auto found = world.create("kept");
        ASSERT_TRUE(found);
        EXPECT_TRUE(found->existed);
        EXPECT_EQ(world.read(oldPlace + "/content"), "old");
        EXPECT_TRUE(isQuiet());
        EXPECT_EQ(world.names(applications).size(), 2U);
        std::filesystem::remove_all(world.path(oldPlace));
        world.relaunch();
    }
    // A journal that cannot be read names nothing; while it cannot go either, it stays.
    world.write(journals + "/" + journalFile[0], "rubbish");
    world.disk().arm({.error = EIO, .span = FaultSpan::fromThenOn});
    world.launch();
    world.disk().disarm();
    EXPECT_EQ(world.names(journals), journalFile);
    world.launch();
    EXPECT_TRUE(isQuiet());
}

// Goal: old ones that wait in a home are not forgotten while the home is away, and come back with it, also below a root
// that has another name. Method: two journals; launches without the home, with it, or requests then.
TEST_F(Replace, AHomeThatIsAwayHasNotGone) {
    const std::string home = "private/var/mobile";
    const std::string outer = home + "/" + fs::deathRowOuter;
    const std::string inner = outer + "/" + fs::asideInner;
    const std::map<std::string, std::string> places = {{journal, oldPlace}, {nameOf(oldPlace), destination}};
    for (const bool byLaunch : {false, true}) {
        SCOPED_TRACE(byLaunch);
        world.makeDirectories(applications, mobile);
        world.makeDirectories(outer, ::geteuid(), 0700);
        world.makeDirectories(inner, ::geteuid(), 0700);
        for (const auto& [uuid, place] : places) {
            const std::string there = inner + "/" + uuid;
            world.putContainer(there, metadataOf(2, mobile, uuid, uuid));
            const std::string was = "/elsewhere/";
            world.putJournal(uuid,
                             {was + place, was + newPlace, was + staging + "/" + uuid, was + place + "x", was + there});
        }
        world.move(home, "away");
        world.relaunch();
        world.relaunch();
        EXPECT_EQ(world.names(journals).size(), 2U);
        world.move("away", home);
        if (byLaunch)
            world.relaunch();
        for (const auto& [uuid, place] : places) {
            const auto found = world.create(uuid);
            ASSERT_TRUE(found);
            EXPECT_TRUE(found->existed && found->path == world.path(place)) << found->path;
            EXPECT_EQ(world.stage(*found), ErrorCode::success);
        }
        EXPECT_TRUE(isQuiet());
        world.drainDeathRow();
    }
}

// Goal: a change of either container while a replace is prepared is not lost, and the journal names what moves. Method:
// when the journal is made, the old one's directory gets another name, or the new one a value; then a launch.
TEST_F(Replace, PreparesAnewWhatHasChanged) {
    const std::string key = "k";
    const plist::Value value(true);
    for (const bool oldChanges : {true, false}) {
        const std::string id = oldChanges ? "old.changes" : "new.changes";
        const FoundContainer old = make(id, false);
        const FoundContainer fresh = make(id, asTransient);
        enum class Step { before, changes, after } step = Step::before;
        world.disk().before = [&](const DiskCallInfo& call) {
            const std::string moved = old.record->url().path();
            const bool isJournals =
                std::filesystem::exists(world.path(journals)) &&
                std::filesystem::equivalent("/proc/self/fd/" + std::to_string(call.fd), world.path(journals));
            ZORClientConnection& client = world.daemonsClient();
            if (call.call == DiskCall::createFile && isJournals && step == Step::before) {
                step = Step::changes;
                if (oldChanges)
                    EXPECT_TRUE(client.regenerateDirectoryUUIDForUser(addressOf(old)));
                else
                    EXPECT_TRUE(client.setInfoValue(&value, &key, addressOf(fresh), UseLocking::yes));
                step = Step::after;
            } else if (call.call == DiskCall::rename && call.subject.starts_with(nameOf(moved) + " -> ") &&
                       step == Step::after) {
                const auto names = world.names(journals);
                EXPECT_TRUE(names.size() == 1 &&
                            world.read(journals + "/" + names[0]).find(moved) != std::string::npos);
            }
        };
        EXPECT_EQ(complaintOf(world.replace(&old, fresh, Preserve::yes)), "");
        EXPECT_TRUE(step == Step::after && isQuiet());
        world.disk().before = nullptr;
        world.relaunch();
        const auto found = world.find(id);
        ASSERT_TRUE(found);
        EXPECT_EQ(found->uuid, old.uuid);
        EXPECT_EQ(contentOf(*found), "new");
        EXPECT_EQ(world.daemonsClient().infoValueForKey(&key, addressOf(*found), UseLocking::yes).has_value(),
                  !oldChanges);
    }
}

// Goal: a sync that fails loses no container and brings none back; what is answered is so. Method: a file system
// without order, on which the n-th sync of a replace fails, or all from there on, or memory runs out there; then a
// deletion and a launch.
TEST_F(ReplaceWithoutOrder, ASyncThatFailsLosesNothing) {
    const std::string identifier = "synced";
    int undone = 0;
    int waited = 0;
    enum class Way { once, fromThenOn, thrown };
    for (const Way way : {Way::once, Way::fromThenOn, Way::thrown})
        for (const Preserve preserve : {Preserve::no, Preserve::yes}) {
            bool met = true;
            for (std::size_t point = 1; met; ++point) {
                SCOPED_TRACE(point);
                const FoundContainer old = make(identifier, false);
                const FoundContainer fresh = make(identifier, asTransient);
                bool thrown = false;
                world.disk().arm({.point = point,
                                  .span = way == Way::fromThenOn ? FaultSpan::fromThenOn : FaultSpan::once,
                                  .filter = [&, self = std::this_thread::get_id(),
                                             syncs = std::size_t{0}](const DiskCallInfo& call) mutable {
                                      // A pass over death row may sync meanwhile.
                                      const bool counts = isSync(call) && std::this_thread::get_id() == self;
                                      if (!counts || way != Way::thrown)
                                          return counts;
                                      if (++syncs != point)
                                          return false;
                                      thrown = true;
                                      throw std::bad_alloc();
                                  }});
                const auto replaced = world.replace(&old, fresh, preserve);
                met = world.disk().met() || thrown;
                EXPECT_EQ(replaced.has_value(), !met);
                if (way == Way::thrown)
                    (void)world.find(identifier); // what waits is settled
                const auto live = world.services().cache().containerForUser(mobile, application, &identifier, false);
                ASSERT_TRUE(live);
                const std::string content = world.read(world.relative((*live)->url().path()) + "/content");
                EXPECT_TRUE(content == "new" || (!replaced && content == "old")) << content;
                undone += content == "old" ? 1 : 0;
                const auto deletion = [&] {
                    return codeOf(world.daemonsClient().stageForDeleteContainersWithUsers(
                        ZORClientConnection::DeletionBatch::of(mobile, (*live)->uuid(), identifier, application),
                        UseLocking::yes));
                };
                const ErrorCode deleted = deletion();
                EXPECT_EQ(isThere((*live)->url().path()), deleted == ErrorCode::journalUnusable);
                world.disk().disarm();
                if (deleted == ErrorCode::journalUnusable) {
                    ++waited;
                    EXPECT_EQ(deletion(), ErrorCode::success);
                }
                world.relaunch();
                EXPECT_FALSE(world.find(identifier));
                EXPECT_TRUE(isQuiet());
            }
        }
    EXPECT_GT(undone, 2);
    EXPECT_GT(waited, 0);
}

// Goal: a request that has to do with a container whose replace waits for the disk waits for that one, and nobody else
// does; a group or bundle that is released meanwhile goes afterwards. Method: on a file system without order, the sync
// between the two moves is held up; requests meanwhile.
TEST_F(ReplaceWithoutOrder, OnlyWhoHasToDoWithItWaits) {
    constexpr ContainerClass group = ContainerClass::sharedAppGroup;
    const std::string key = "k";
    world.write(groupMarkerPath, ""); // without it nothing goes for want of a reference
    using Requests = std::vector<std::function<ErrorCode(const FoundContainer& fresh, const FoundContainer& holder)>>;
    const Requests rounds[] = {
        {[&](auto&, auto&) { return codeOf(world.create("id", group)); },
         [&](auto& fresh, auto&) { return world.stage(fresh); },
         [&](auto& fresh, auto&) {
             return codeOf(world.daemonsClient().regenerateDirectoryUUIDForUser(addressOf(fresh)));
         }},
        {[&](auto&, auto&) { return world.entitle("holder", std::nullopt); }},
        {[&](auto&, auto& holder) { return world.stage(holder); }}, // holder's child has the group
        {[&](auto& fresh, auto&) {
             const plist::Value value(true);
             return codeOf(world.daemonsClient().setInfoValue(&value, &key, addressOf(fresh), UseLocking::yes));
         },
         [&](auto& fresh, auto&) { return codeOf(world.daemonsClient().metadataForUser(addressOf(fresh))); },
         [&](auto& fresh, auto&) {
             return codeOf(world.daemonsClient().recreateDefaultStructureForUser(addressOf(fresh)));
         },
         [&](auto& fresh, auto&) { return world.daemonsClient().diskUsageForUserId(addressOf(fresh)).error; },
         [&](auto&, auto&) {
             const auto listed = world.daemonsClient().containersForUser(mobile, group, false);
             return listed && listed->size() == 1 ? ErrorCode::success : ErrorCode::notFound;
         },
         [&](auto&, auto&) { // to the class that it has
             std::promise<ErrorCode> told;
             world.services().store().dataProtection.setDataProtectionOnDataContainerForUser(
                 {.userId = mobile,
                  .identifier = "id",
                  .containerClass = group,
                  .dataProtectionClass = platform::defaultProtectionClass},
                 [&](ErrorCode code) { told.set_value(code); });
             return told.get_future().get();
         }},
    };
    for (const Requests& round : rounds) {
        SCOPED_TRACE(&round - rounds);
        const bool isChilds = &round == &rounds[2];
        const plist::Dictionary groups{{std::string(entitlementKeys::applicationGroups), plist::Array{"id"}}};
        ASSERT_EQ(isChilds ? world.entitle("child", groups, {{std::string(ipc::keys::parentBundleIdOption), "holder"}})
                           : world.entitle("holder", groups),
                  ErrorCode::success);
        const FoundContainer holder = make("holder", false, bundle);
        const FoundContainer old = make("id", false, group);
        const FoundContainer fresh = make("id", asTransient, group);
        std::promise<void> reached;
        std::promise<void> goOn;
        std::atomic<int> step = 0;
        world.disk().before = [&, held = goOn.get_future().share()](const DiskCallInfo& call) {
            if (call.call == DiskCall::rename && call.subject.starts_with(nameOf(old.path) + " -> "))
                step = 1;
            else if (int one = 1; isSync(call) && step.compare_exchange_strong(one, 2)) {
                reached.set_value();
                held.wait();
            }
        };
        auto replaced = std::async(std::launch::async, [&] { return world.replace(&old, fresh); });
        reached.get_future().wait();
        std::vector<std::future<ErrorCode>> requests;
        for (const auto& request : round)
            requests.push_back(std::async(std::launch::async, [&] { return request(fresh, holder); }));
        EXPECT_TRUE(world.create("another"));
        for (auto& one : requests)
            EXPECT_EQ(one.wait_for(std::chrono::milliseconds(50)), std::future_status::timeout);
        goOn.set_value();
        EXPECT_EQ(complaintOf(replaced.get()), "");
        for (auto& one : requests)
            EXPECT_TRUE(one.get() == ErrorCode::success || &one - requests.data() == 2); // renamed, or deleted before
        world.drainDeathRow();                                                           // a pass calls the disk, too
        world.disk().before = nullptr;
        EXPECT_TRUE(round.size() > 1 || !world.find("id", group));
        world.relaunch();
        EXPECT_TRUE(isQuiet());
    }
}

// Goal: a wipe keeps path and UUID and leaves a new one's content. Method: a table of clients and classes, a restart.
TEST_F(Replace, WipesToWhatANewOneHolds) {
    const std::string identifier = "com.example";
    const std::string other = "com.other";
    constexpr ContainerClass plugin = ContainerClass::dataKolvexPlugin;
    const FoundContainer wiped[] = {make(identifier, false), make(identifier, false, plugin)};
    using Client = ZORClientConnection::Client;
    const Client all{.userId = 0, .allowOtherIdLookup = true};
    const Client nobody{.userId = 0};
    const Client entitled{.userId = 0, .entitledWipeIdentifiers = std::vector<std::string>{identifier}};
    using enum ErrorCode;
    const std::tuple<Client, const std::string*, ContainerClass, ErrorCode> rows[] = {
        {all, nullptr, application, identifierMissing}, {all, &identifier, bundle, invalidObject},
        {all, &other, application, notFound},           {nobody, &identifier, plugin, notEntitled},
        {entitled, &other, plugin, notEntitled},        {entitled, &identifier, application, invalidObject},
        {entitled, &identifier, plugin, success},       {all, &identifier, application, success},
    };
    for (const auto& [client, whose, containerClass, code] : rows)
        EXPECT_EQ(codeOf(world.client(client)->deleteDataContainerContentForUser(mobile, whose, containerClass)), code);
    world.restart();
    for (const FoundContainer& container : wiped) {
        const auto found = world.find(identifier, container.record->containerClass());
        ASSERT_TRUE(found);
        EXPECT_EQ(found->path + found->uuid.string(), container.path + container.uuid.string());
        EXPECT_EQ(world.names(world.relative(found->path)),
                  (std::vector<std::string>{names::metadataFile, "Documents", "Library", "tmp"}));
    }
    EXPECT_TRUE(isQuiet());
}

} // namespace
} // namespace zor::test
