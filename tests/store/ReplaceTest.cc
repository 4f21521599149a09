// SPDX-License-Identifier: Apache-2.0
// Replace and wipe: what is swapped, what is refused, what each failing step leaves, and what a launch makes of each
// state that a stop can leave.
#include "plist/Binary.h"
#include "store/FewDescriptors.h"
#include "world/World.h"

#include <algorithm>
#include <gtest/gtest.h>
#include <stdexcept>
#include <unistd.h>

namespace zor::test {
namespace {

using support::DiskCall;
using support::DiskCallInfo;
using Preserve = ZORClientConnection::PreserveOldUUID;

constexpr ContainerClass application = ContainerClass::dataApplication;
constexpr ContainerClass bundle = ContainerClass::bundleApplication;
const std::string staging = std::string(cachesPath) + "/Staging";
const std::string dead = std::string(cachesPath) + "/Dead";
const std::string journals = std::string(libraryPath) + "/Replace";
const std::string applications = std::string(mobileContainers) + "/Data/Application";

std::uint32_t ownerOf(ContainerClass containerClass) {
    return isBundleClass(containerClass) ? 33 : isSystemClass(containerClass) ? 499 : mobile;
}

class Replace : public testing::Test {
protected:
    Replace() {
        world.log.setLevel(logLevelDebug);
        world.load();
    }
    World world;

    FoundContainer make(const std::string& identifier, bool transient, const std::string& content,
                        ContainerClass containerClass = application) {
        auto made = world.daemonsClient().createOrLookupContainerForUser(
            ownerOf(containerClass), &identifier, containerClass, {.createIfNecessary = true, .transient = transient});
        EXPECT_TRUE(made);
        world.write(relative(made->path) + "/content", content);
        return *made;
    }
    Result<FoundContainer> find(const std::string& identifier, ContainerClass containerClass = application) {
        return world.daemonsClient().createOrLookupContainerForUser(ownerOf(containerClass), &identifier,
                                                                    containerClass, {});
    }
    static ZORClientConnection::ReplaceRequest swap(const FoundContainer* old, const FoundContainer& fresh,
                                                    Preserve preserve = Preserve::no) {
        ZORClientConnection::ReplaceRequest request{.newUuid = fresh.uuid,
                                                    .userIdNew = fresh.record->uid(),
                                                    .identifierNew = fresh.record->identifier(),
                                                    .classNew = fresh.record->containerClass(),
                                                    .preserveOldUuid = preserve};
        if (old) {
            request.oldUuid = old->uuid;
            request.userIdOld = old->record->uid();
            request.identifierOld = old->record->identifier();
            request.classOld = old->record->containerClass();
        }
        return request;
    }
    Result<void> replace(const ZORClientConnection::ReplaceRequest& request) {
        return world.daemonsClient().replaceContainer(request, StartDeletionThread::no);
    }
    [[nodiscard]] std::string relative(const std::string& path) const { return path.substr(world.path().size() + 1); }
    [[nodiscard]] std::string contentOf(const FoundContainer& container) const {
        return world.read(relative(container.path) + "/content");
    }
    [[nodiscard]] std::string nameOf(const std::string& path) const { return path.substr(path.rfind('/') + 1); }
    bool nothingIsUnderWay() { return world.names(staging).empty() && world.names(journals).empty(); }

    /// A journal as a launch may find it; the four paths below the root, empty ones left out.
    void putJournal(const std::string& name, const std::array<std::string, 4>& paths) {
        const std::array<const char*, 4> keys = {"ZORReplaceOperationOldURL", "ZORReplaceOperationNewURL",
                                                 "ZORReplaceOperationStagingURL", "ZORReplaceOperationDestURL"};
        plist::Dictionary content;
        for (std::size_t i = 0; i < keys.size(); ++i)
            if (!paths[i].empty())
                content.set(keys[i], world.path(paths[i]));
        world.write(journals + "/" + name, binary(content));
    }
};

// Goal: the new content stands where it was promised, under the UUID that was promised, also for the next daemon; the
// old one waits on death row and no journal is left. Method: the three kinds of replace, for data and bundles.
TEST_F(Replace, PutsTheNewOneInPlace) {
    enum class Kind { noOld, old, preserving };
    for (const ContainerClass containerClass : {application, bundle})
        for (const Kind kind : {Kind::noOld, Kind::old, Kind::preserving}) {
            SCOPED_TRACE(std::string(className(containerClass)) + " " + std::to_string(static_cast<int>(kind)));
            const std::string identifier = "com.example." + std::to_string(static_cast<int>(kind));
            std::optional<FoundContainer> old;
            if (kind != Kind::noOld)
                old = make(identifier, false, "old", containerClass);
            const FoundContainer fresh = make(identifier, true, "new", containerClass);
            const auto replaced =
                replace(swap(old ? &*old : nullptr, fresh, kind == Kind::preserving ? Preserve::yes : Preserve::no));
            ASSERT_TRUE(replaced) << replaced.error().text();
            EXPECT_TRUE(nothingIsUnderWay());
            for (int launch = 0; launch < 2; ++launch) {
                const auto found = find(identifier, containerClass);
                ASSERT_TRUE(found) << found.error().text();
                EXPECT_EQ(contentOf(*found), "new");
                EXPECT_EQ(found->uuid, kind == Kind::preserving ? old->uuid : fresh.uuid);
                EXPECT_EQ(nameOf(found->path), nameOf(kind == Kind::preserving ? old->path : fresh.path));
                EXPECT_NE(::access(fresh.path.c_str(), F_OK), 0);
                world.restart();
            }
        }
    EXPECT_EQ(world.deathRow().size(), 8U); // an old container and a journal for each of four
}

TEST_F(Replace, RefusesBeforeAnythingMoves) {
    const FoundContainer old = make("a", false, "old");
    const FoundContainer fresh = make("a", true, "new");
    const FoundContainer other = make("b", false, "other");
    const FoundContainer freshOther = make("b", true, "new other");
    const std::string system = "com.veltra.settingsd";
    const auto wellKnown = world.daemonsClient().createOrLookupContainerForUser(
        499, &system, ContainerClass::dataSystem, {.createIfNecessary = true});
    ASSERT_TRUE(wellKnown);
    const auto with = [&](const FoundContainer* first, const FoundContainer& second, auto&& change) {
        auto request = swap(first, second);
        change(request);
        return request;
    };
    using Request = ZORClientConnection::ReplaceRequest;
    struct Row {
        Request request;
        ErrorCode code;
        std::string message;
    };
    const std::string newUuid = fresh.uuid.string();
    const std::vector<Row> rows = {
        {with(&old, fresh, [](Request& r) { r.newUuid.reset(); }), ErrorCode::invalidObject,
         "Can't act on an invalid object: new userId: 501, newUUID: (null), Class: 2"},
        {with(&old, fresh, [](Request& r) { r.classNew = ContainerClass::max; }), ErrorCode::invalidObject,
         "Can't act on an invalid object: new userId: 501, newUUID: " + newUuid + ", Class: 14"},
        {with(nullptr, fresh, [](Request& r) { r.preserveOldUuid = Preserve::yes; }), ErrorCode::invalidObject,
         "Can't have a nil oldContainerUUID when preserving the UUID"},
        {with(&old, fresh, [](Request& r) { r.classOld = ContainerClass::undefined; }), ErrorCode::invalidObject,
         "Can't act on an invalid object: old userId: 501, oldUUID: " + old.uuid.string() + ", Class: 0"},
        {with(&old, fresh, [](Request& r) { r.classOld = ContainerClass::dataTempDir; }), ErrorCode::classesDiffer,
         "Can't replace containers of different class types: 11 and 2"},
        {with(&old, fresh, [](Request& r) { r.userIdOld = second; }), ErrorCode::usersDiffer,
         "Can't replace containers of different userIds: 502 and 501"},
        {with(&old, fresh, [](Request& r) { r.identifierOld = "b"; }), ErrorCode::notFound,
         "No Container with userId: 501 UUID: " + old.uuid.string() + ", identifier: b, Class: 2"},
        {with(&old, fresh, [](Request& r) { r.identifierNew.reset(); }), ErrorCode::notFound,
         "No Container with userId: 501 UUID: " + newUuid + ", identifier: (null), Class: 2"},
        {swap(&old, old), ErrorCode::replacedByItself, "Can't replace the same container at " + old.path},
        {swap(nullptr, *wellKnown), ErrorCode::pathNotAsExpected,
         "Invalid URL (last path component not UUID): " + wellKnown->path},
        {swap(nullptr, old), ErrorCode::alreadyExists, "Container already exists at " + old.path},
        {swap(nullptr, fresh), ErrorCode::alreadyExists,
         "Container with identifier: a, class: 2, transient: 0 already exists"},
        // The new one's identifier has another live container: two of one identifier must not come to be.
        {swap(&old, freshOther), ErrorCode::alreadyExists,
         "Container with identifier: b, class: 2, transient: 0 already exists"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.message);
        const auto refused = replace(row.request);
        ASSERT_FALSE(refused);
        EXPECT_TRUE(refused.error().is(row.code)) << refused.error().text();
        EXPECT_EQ(refused.error().description(), row.message);
        EXPECT_TRUE(nothingIsUnderWay());
        EXPECT_EQ(contentOf(old), "old");
        EXPECT_EQ(contentOf(fresh), "new");
        EXPECT_EQ(world.services().locks().identifiersInUse(), 0U);
    }
    EXPECT_TRUE(replace(swap(&old, fresh))); // nothing of the above stands in the way
}

// Goal: each step that fails has its code and leaves what is promised; a preserving one that fails leaves the new
// container its own UUID. Method: one failing call a row.
TEST_F(Replace, AFailedStepLeavesWhatItMust) {
    const auto isMoveTo = [](std::string from) {
        return [=](const DiskCallInfo& call) {
            return call.call == DiskCall::rename && call.subject.starts_with(from + " -> ");
        };
    };
    enum class Left { both, newOnly };
    struct Row {
        const char* name;
        bool preserve;
        ErrorCode code;
        Left left;
    };
    const Row rows[] = {{"journal", false, ErrorCode::propertyListNotWritten, Left::both},
                        {"journal", true, ErrorCode::propertyListNotWritten, Left::both},
                        {"old", false, ErrorCode::oldNotMovedToStaging, Left::both},
                        {"old", true, ErrorCode::oldNotMovedToStaging, Left::both},
                        {"new", false, ErrorCode::newNotMovedIntoPlace, Left::newOnly},
                        {"new", true, ErrorCode::newNotMovedIntoPlace, Left::newOnly}};
    int count = 0;
    for (const Row& row : rows) {
        SCOPED_TRACE(std::string(row.name) + (row.preserve ? " preserving" : ""));
        const std::string identifier = "com.example." + std::to_string(count++);
        const FoundContainer old = make(identifier, false, "old");
        const FoundContainer fresh = make(identifier, true, "new");
        support::Fault fault{.error = EIO, .filter = {}};
        if (row.code == ErrorCode::propertyListNotWritten)
            fault.filter = [](const DiskCallInfo& call) {
                return call.call == DiskCall::rename && call.subject.ends_with(".plist") &&
                       !call.subject.ends_with(names::metadataFile);
            };
        else
            fault.filter = isMoveTo(nameOf(row.left == Left::both ? old.path : fresh.path));
        world.disk().arm(fault);
        const auto failed = replace(swap(&old, fresh, row.preserve ? Preserve::yes : Preserve::no));
        ASSERT_TRUE(world.disk().met());
        world.disk().disarm();
        ASSERT_FALSE(failed);
        EXPECT_TRUE(failed.error().is(row.code)) << failed.error().text();
        EXPECT_TRUE(nothingIsUnderWay());
        world.restart();
        const auto found = find(identifier);
        EXPECT_EQ(found.has_value(), row.left == Left::both);
        if (found) {
            EXPECT_EQ(contentOf(*found), "old");
            EXPECT_EQ(found->uuid, old.uuid);
        }
        const auto record = world.services().cache().containerForUser(mobile, application, &identifier, true);
        ASSERT_TRUE(record);
        EXPECT_EQ((*record)->uuid(), fresh.uuid);
        EXPECT_EQ(world.read(relative(fresh.path) + "/content"), "new");
    }
}

// Goal: what the library throws ends at the operation, wherever it is thrown: error 40, no lock left, and one whole
// container of the identifier. Method: a disk that throws at the N-th call until a replace meets none.
TEST_F(Replace, AnExceptionAnywhereIsAnError) {
    bool threw = true;
    for (int point = 1; threw; ++point) {
        SCOPED_TRACE(point);
        ASSERT_LT(point, 200);
        const std::string identifier = "com.example." + std::to_string(point);
        const FoundContainer old = make(identifier, false, "old");
        const FoundContainer fresh = make(identifier, true, "new");
        int calls = 0;
        world.disk().arm({.point = 10'000, .error = EIO, .filter = [&](const DiskCallInfo&) -> bool {
                              if (++calls == point)
                                  throw std::runtime_error("thrown by the test");
                              return false;
                          }});
        const auto replaced = replace(swap(&old, fresh));
        world.disk().disarm();
        threw = calls >= point;
        ASSERT_EQ(replaced.has_value(), !threw);
        if (threw) {
            EXPECT_TRUE(replaced.error().is(ErrorCode::exceptionCaught)) << replaced.error().text();
        }
        EXPECT_EQ(world.services().locks().identifiersInUse(), 0U);
        const bool wasThere = find(identifier).has_value();
        world.restart();
        world.daemonsClient().containerManagerSetup();
        world.drainDeathRow();
        const auto found = find(identifier);
        EXPECT_EQ(found.has_value(), wasThere);
        const bool freshWaits =
            world.services().cache().containerForUser(mobile, application, &identifier, true).has_value();
        EXPECT_TRUE(found || freshWaits);
        if (found) {
            EXPECT_FALSE(contentOf(*found).empty());
        }
        EXPECT_TRUE(nothingIsUnderWay());
    }
}

// Goal: want of descriptors loses no old container, and leaves nothing that a later launch would bring back. Method: a
// replace with each number of descriptors left, its outcome deleted, then a launch.
TEST_F(Replace, WantOfDescriptorsNeitherLosesNorBringsBack) {
    const std::string identifier = "short";
    int refused = 0;
    for (const Preserve preserve : {Preserve::no, Preserve::yes})
        for (rlim_t left = 0; left < 24; ++left) {
            SCOPED_TRACE(left);
            const auto old = make(identifier, false, "old");
            const auto fresh = make(identifier, true, "new");
            const auto replaced = [&] {
                const FewDescriptors few(left);
                return replace(swap(&old, fresh, preserve));
            }();
            refused += !replaced;
            const auto now = find(identifier);
            ASSERT_TRUE(now);
            EXPECT_TRUE(contentOf(*now) == "new" || (!replaced && contentOf(*now) == "old"));
            ASSERT_TRUE(world.daemonsClient().deleteContainerForUser(mobile, &identifier, application, false));
            world.restart();
            world.daemonsClient().containerManagerSetup();
            EXPECT_FALSE(find(identifier));
        }
    EXPECT_GT(refused, 2);
}

// Goal: each state that a stop can leave becomes one of the two whole ones; a journal that cannot be used harms
// nothing. Method: the states put on disk one by one, then a launch.
TEST_F(Replace, EveryStateOfTheTableIsRecovered) {
    const std::string journal = "11111111-1111-4111-8111-111111111111";
    const std::string waiting = staging + "/" + journal;
    const std::string fresh = std::string(mobileCaches) + "/Temp/Data/Application/33333333-3333-4333-8333-333333333333";
    const std::string old = applications + "/22222222-2222-4222-8222-222222222222";
    const std::string dest = applications + "/33333333-3333-4333-8333-333333333333";
    struct Row {
        const char* name;
        std::vector<std::string> there; // each holds a file that says where it was put
        std::array<std::string, 4> paths;
        std::map<std::string, std::string> after; // place to what it must hold
        const char* said;
    };
    const std::array<std::string, 4> paths = {old, fresh, waiting, dest};
    const std::array<std::string, 4> preserving = {old, fresh, waiting, old};
    const std::array<std::string, 4> behindLink = {applications + "/loop/x", fresh, waiting, dest};
    const Row rows[] = {
        {"not yet moved", {old, fresh}, paths, {{old, old}, {fresh, fresh}}, ": nothing had moved"},
        {"old moved", {waiting, fresh}, paths, {{old, waiting}, {fresh, fresh}}, ": the old one had moved"},
        {"old moved, preserving", {waiting, fresh}, preserving, {{old, waiting}, {fresh, fresh}}, ": the old one had"},
        {"both moved", {waiting, dest}, paths, {{dest, dest}}, ": both had moved"},
        {"both moved, preserving", {waiting, old}, preserving, {{old, old}}, ": both had moved"},
        {"staging gone", {dest}, paths, {{dest, dest}}, ": nothing was waiting any more"},
        {"staging gone, preserving", {old}, preserving, {{old, old}}, ": nothing was waiting any more"},
        {"both moved, old behind a link", {waiting, dest}, behindLink, {{dest, dest}}, ": both had moved"},
        {"nothing left", {}, paths, {}, ": nothing is left"},
        {"a path missing", {waiting, fresh}, {old, "", waiting, dest}, {{fresh, fresh}}, "Invalid replace data"},
    };
    world.makeDirectories(applications, mobile);
    ASSERT_EQ(::symlink("elsewhere", world.path(applications + "/loop").c_str()), 0);
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        for (const std::string& place : row.there)
            world.write(place + "/content", place);
        putJournal(journal + ".plist", row.paths);
        world.restart();
        world.log.take();
        world.daemonsClient().containerManagerSetup();
        world.drainDeathRow();
        for (const std::string& place : {old, fresh, dest}) {
            const auto expected = row.after.find(place);
            ASSERT_EQ(world.exists(place), expected != row.after.end()) << place;
            if (expected != row.after.end()) {
                EXPECT_EQ(world.read(place + "/content"), expected->second);
            }
        }
        EXPECT_TRUE(nothingIsUnderWay());
        bool said = false;
        for (const support::LogLine& line : world.log.take())
            said = said || (line.level <= 5 && line.message.find(row.said) != std::string::npos);
        EXPECT_TRUE(said);
        for (const std::string& place : {old, fresh, dest})
            (void)world.daemonsClient()._moveItemAtURLToDeathRow(world.url(place), StartDeletionThread::no);
    }
}

// Goal: a root that was moved as a whole between the stop and the launch keeps what its journals speak of. Method: a
// journal with the paths of another place.
TEST_F(Replace, AJournalOfAMovedRootIsRecovered) {
    const std::string journal = "11111111-1111-4111-8111-111111111111";
    const std::string waiting = staging + "/" + journal;
    const std::string old = applications + "/22222222-2222-4222-8222-222222222222";
    world.makeDirectories(applications, mobile);
    world.write(waiting + "/content", "old");
    const std::string before = "/elsewhere/";
    world.write(journals + "/" + journal + ".plist",
                binary(plist::Dictionary{{"ZORReplaceOperationOldURL", before + old},
                                         {"ZORReplaceOperationNewURL", before + old + "x"},
                                         {"ZORReplaceOperationStagingURL", before + waiting},
                                         {"ZORReplaceOperationDestURL", before + old}}));
    world.daemonsClient().containerManagerSetup();
    EXPECT_EQ(world.read(old + "/content"), "old");
    EXPECT_TRUE(nothingIsUnderWay());
}

// Goal: a recovery that cannot finish loses nothing: what its journal names stays in staging until a later launch
// succeeds. Method: a move that fails once.
TEST_F(Replace, ARecoveryThatStopsKeepsWhatItStillNeeds) {
    const std::string journal = "11111111-1111-4111-8111-111111111111";
    const std::string old = applications + "/22222222-2222-4222-8222-222222222222";
    world.makeDirectories(applications, mobile);
    world.write(staging + "/" + journal + "/content", "old");
    world.write(staging + "/rubbish/content", "half-made");
    putJournal(journal + ".plist", {old, old + "x", staging + "/" + journal, old});
    world.disk().arm({.error = EIO, .filter = [&](const DiskCallInfo& call) {
                          return call.call == DiskCall::rename && call.subject.starts_with(journal + " -> ");
                      }});
    world.daemonsClient().containerManagerSetup();
    world.drainDeathRow();
    ASSERT_TRUE(world.disk().met());
    world.disk().disarm();
    EXPECT_EQ(world.log.take(3, "containerManagerSetup"),
              (std::vector<std::string>{"Failed recovering from replace operations"}));
    EXPECT_EQ(world.names(staging), (std::vector<std::string>{journal}));
    EXPECT_EQ(world.names(journals), (std::vector<std::string>{journal + ".plist"}));
    world.restart();
    world.daemonsClient().containerManagerSetup();
    EXPECT_EQ(world.read(old + "/content"), "old");
    EXPECT_TRUE(nothingIsUnderWay());
    // A journal that cannot be read names nothing; while it cannot go either, it stays.
    world.write(journals + "/" + journal + ".plist", "rubbish");
    world.disk().arm({.error = EIO, .span = support::FaultSpan::fromThenOn});
    world.log.take();
    world.daemonsClient().containerManagerSetup();
    world.disk().disarm();
    const auto said = world.log.take(3, "_recoverFromReplaceOperationsWithError");
    EXPECT_TRUE(std::ranges::any_of(said, [](const std::string& line) {
        return line.find("Failed to remove replace file at ") != std::string::npos;
    }));
    EXPECT_EQ(world.names(journals), (std::vector<std::string>{journal + ".plist"}));
    world.daemonsClient().containerManagerSetup();
    EXPECT_TRUE(nothingIsUnderWay());
}

// Goal: a wipe keeps path and UUID and leaves what a new container holds; who may not wipe changes nothing. Method: a
// table of clients and classes, then a wipe and a restart.
TEST_F(Replace, WipesToWhatANewOneHolds) {
    const std::string identifier = "com.example";
    const FoundContainer data = make(identifier, false, "old");
    const FoundContainer plugin = make(identifier, false, "old", ContainerClass::dataKolvexPlugin);
    using Client = ZORClientConnection::Client;
    const Client all{.userId = 0, .allowOtherIdLookup = true};
    const Client nobody{.userId = 0};
    const Client entitled{.userId = 0, .entitledWipeIdentifiers = std::vector<std::string>{identifier}};
    const std::string other = "com.other";
    struct Row {
        const Client& client;
        const std::string* identifier;
        ContainerClass containerClass;
        std::optional<ErrorCode> refused;
    };
    const Row rows[] = {
        {all, nullptr, application, ErrorCode::identifierMissing},
        {all, &identifier, bundle, ErrorCode::invalidObject},
        {all, &identifier, ContainerClass::dataSystem, ErrorCode::invalidObject},
        {all, &other, application, ErrorCode::notFound},
        {nobody, &identifier, application, ErrorCode::invalidObject},
        {nobody, &identifier, ContainerClass::dataKolvexPlugin, ErrorCode::notEntitled},
        {entitled, &other, ContainerClass::dataKolvexPlugin, ErrorCode::notEntitled},
        {entitled, &identifier, application, ErrorCode::invalidObject},
        {entitled, &identifier, ContainerClass::dataKolvexPlugin, {}},
        {all, &identifier, application, {}},
    };
    for (const Row& row : rows) {
        const auto wiped =
            world.client(row.client)->deleteDataContainerContentForUser(mobile, row.identifier, row.containerClass);
        ASSERT_EQ(wiped.has_value(), !row.refused) << &row - rows;
        if (row.refused) {
            EXPECT_TRUE(wiped.error().is(*row.refused)) << wiped.error().text();
        }
    }
    world.restart();
    for (const FoundContainer& container : {data, plugin}) {
        const auto found = find(identifier, container.record->containerClass());
        ASSERT_TRUE(found);
        EXPECT_EQ(found->path, container.path);
        EXPECT_EQ(found->uuid, container.uuid);
        EXPECT_EQ(world.names(relative(found->path)),
                  (std::vector<std::string>{names::metadataFile, "Documents", "Library", "tmp"}));
    }
    EXPECT_TRUE(nothingIsUnderWay());
}

} // namespace
} // namespace zor::test
