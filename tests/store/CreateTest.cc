// SPDX-License-Identifier: Apache-2.0
// Creating, finding and listing containers: what a container of each class looks like on disk, what is refused, what a
// failing disk leaves, and many clients at once.
#include "support/FewDescriptors.h"
#include "world/World.h"

#include <array>
#include <gtest/gtest.h>
#include <set>
#include <unistd.h>

namespace zor::test {
namespace {

using support::DiskCall;
using support::DiskCallInfo;
using support::FaultSpan;
using support::hasLine;

constexpr std::size_t uuidLength = 36;

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
    /// A container's move by its UUID name.
    static bool isMove(const DiskCallInfo& call) {
        return call.call == DiskCall::rename && call.subject.find(" -> ") == uuidLength;
    }
};

// Goal: every class gets its place, tree, modes and owners, a directory name that is not its internal UUID, and a
// metadata file of the daemon's own; a new daemon finds the same container. Method: all classes, live and transient.
TEST_F(Create, EveryClassGetsItsTree) {
    using Names = std::vector<std::string>;
    const Names data = {"Documents", "Library", "Library/Caches", "Library/Preferences", "tmp"};
    const Names group = {"Library", "Library/Caches"};
    for (const bool transient : {false, true})
        for (std::uint64_t number = 1; ipc::isContainerClass(number); ++number) {
            const auto containerClass = static_cast<ContainerClass>(number);
            SCOPED_TRACE(std::string(className(containerClass)) + (transient ? " transient" : ""));
            const bool bundle = isBundleClass(containerClass);
            const bool system = isSystemClass(containerClass);
            const auto found = world.create("com.example", containerClass, transient);
            ASSERT_TRUE(found) << found.error().text();
            EXPECT_FALSE(found->existed);
            EXPECT_EQ(found->record->transient(), transient);
            std::string place = bundle || system ? sharedPath : mobileContainers;
            if (transient)
                place = bundle   ? "private/var/brevad/Library/Caches/com.veltra.zorvaned"
                        : system ? std::string(cachesPath) + "/Temp"
                                 : std::string(mobileCaches) + "/Temp";
            const std::string path = world.relative(found->path);
            EXPECT_EQ(parentOf(path), place + "/" + className(containerClass));
            EXPECT_EQ(world.item(parentOf(path)), directoryOf(bundle ? 33 : system ? 0 : mobile));
            const auto name = UUID::parse(nameOf(path));
            ASSERT_TRUE(name) << path;
            EXPECT_EQ(name->string(), nameOf(path));
            EXPECT_NE(*name, found->uuid);

            EXPECT_EQ(world.item(path), directoryOf(bundle ? 33 : system ? 0 : mobile));
            EXPECT_EQ(world.services().defaultManager().dataProtectionClassOfItemAtURL(world.url(path)).value(), 0);
            const Names& expected = bundle ? Names() : number == 7 || number == 13 ? group : data;
            std::set<std::string> top = {names::metadataFile};
            for (const std::string& subdirectory : expected) {
                EXPECT_EQ(world.item(path + "/" + subdirectory),
                          directoryOf(system ? 0 : mobile, system ? 0777 : 0755));
                top.insert(subdirectory.substr(0, subdirectory.find('/')));
            }
            EXPECT_EQ(world.names(path), Names(top.begin(), top.end()));
            const std::string file = path + "/" + names::metadataFile;
            EXPECT_TRUE(world.item(file).starts_with("file 0644 " + std::to_string(::geteuid()))) << world.item(file);
            EXPECT_EQ(world.readDictionary(file),
                      metadataOf(number, ownerOf(containerClass), "com.example", found->uuid.string()));
            EXPECT_TRUE(world.names(staging).empty());
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
    EXPECT_EQ(world.item(mobileContainers), directoryOf(mobile));
    EXPECT_EQ(world.item(std::string(mobileCaches) + "/Temp"), directoryOf(mobile));
}

// Goal: a well-known container lives under its name, also when a transient one has taken its place. Method: each
// table's.
TEST_F(Create, WellKnownContainersHaveFixedNames) {
    for (const auto& [identifier, containerClass] :
         {std::pair("com.veltra.settingsd", ContainerClass::dataSystem),
          std::pair("systemgroup.com.veltra.fonts", ContainerClass::sharedSystemGroup)}) {
        const FoundContainer made = world.make(identifier, containerClass);
        EXPECT_EQ(world.relative(made.path),
                  std::string(sharedPath) + "/" + className(containerClass) + "/" + identifier);
        world.restart();
        EXPECT_EQ(world.make(identifier, containerClass).uuid, made.uuid);
        const FoundContainer fresh = world.make(identifier, containerClass, asTransient);
        EXPECT_TRUE(UUID::parse(nameOf(fresh.path)));
        EXPECT_EQ(complaintOf(world.daemonsClient().replaceContainer({.oldUuid = made.uuid,
                                                                      .newUuid = fresh.uuid,
                                                                      .userIdOld = ownerOf(containerClass),
                                                                      .userIdNew = ownerOf(containerClass),
                                                                      .identifierOld = identifier,
                                                                      .identifierNew = identifier,
                                                                      .classOld = containerClass,
                                                                      .classNew = containerClass},
                                                                     StartDeletionThread::no)),
                  "");
        const FoundContainer now = world.make(identifier, containerClass);
        EXPECT_EQ(now.uuid, fresh.uuid);
        EXPECT_EQ(now.path, made.path);
    }
    // In another class the same words are any identifier.
    EXPECT_TRUE(UUID::parse(nameOf(world.make("com.veltra.settingsd").path)));
}

// Goal: what cannot be acted on is refused in words and without a lock. Method: a table; a lock's lines would show.
TEST_F(Create, RefusesBeforeAnyLock) {
    world.load();
    world.log.setLevel(logLevelDebug);
    const std::string identifier = "com.example";
    const auto other = world.client({.bundleIdentifier = "com.other", .userId = mobile});
    const auto nameless = world.client({.userId = mobile});
    struct Row {
        ZORClientConnection& client;
        std::uint32_t userId;
        const std::string* identifier;
        std::uint64_t containerClass;
        std::string complaint;
    };
    const std::string invalid = "11 Can't act on an invalid object: userId: ";
    const Row rows[] = {
        {world.daemonsClient(), mobile, nullptr, 2, invalid + "501, ID: (null), class: 2"},
        {world.daemonsClient(), mobile, &identifier, 0, invalid + "501, ID: com.example, class: 0"},
        {world.daemonsClient(), 33, &identifier, 14, invalid + "33, ID: com.example, class: 14"},
        {world.daemonsClient(), mobile, &identifier, 1, "11 Invalid userId 501 for class 1, ID: com.example"},
        {*other, 500, &identifier, 12, "11 Invalid userId 500 for class 12, ID: com.example"},
        {*other, 499, &identifier, 12, "55 com.example not entitled for a system container, but com.other is trying"},
        {*nameless, 499, &identifier, 12, "55 com.example not entitled for a system container, but (null) is trying"},
    };
    const auto expectSaid = [&](const char* function, const std::string& complaint) {
        const auto said = world.log.take();
        ASSERT_EQ(said.size(), 1U) << complaint;
        EXPECT_TRUE(hasLine(said, 3, function, complaint.substr(3))) << said[0];
    };
    world.log.take();
    for (const Row& row : rows) {
        EXPECT_EQ(complaintOf(row.client.createOrLookupContainerForUser(row.userId, row.identifier,
                                                                        static_cast<ContainerClass>(row.containerClass),
                                                                        {.createIfNecessary = true})),
                  row.complaint);
        expectSaid("createOrLookupContainerForUser", row.complaint);
    }
    for (const std::uint64_t number : {0, 14}) {
        const std::string complaint =
            "11 Can't act on an invalid container-userId: 501, class: " + std::to_string(number);
        EXPECT_EQ(
            complaintOf(world.daemonsClient().containersForUser(mobile, static_cast<ContainerClass>(number), false)),
            complaint);
        expectSaid("containersForUser", complaint);
    }
    EXPECT_EQ(codeOf(world.daemonsClient().containersForUser(mobile, ContainerClass::bundleFramework, false)),
              ErrorCode::cacheNotRebuilt);
    EXPECT_FALSE(world.exists(staging));
    // The entitlement admits a client to its own system container.
    ASSERT_TRUE(world.services().entitlements()._setEntitlementDictionaryValues(
        {plist::Dictionary{{std::string(entitlementKeys::systemContainer), true}}}, {identifier}));
    EXPECT_TRUE(other->createOrLookupContainerForUser(499, &identifier, ContainerClass::dataSystem,
                                                      {.createIfNecessary = true}));
}

TEST_F(Create, NotFoundIsAnswered21AndNotSaid) {
    (void)world.make("com.other");
    world.log.take();
    for (const bool transient : {false, true})
        EXPECT_EQ(complaintOf(world.find("com.example", application, transient)),
                  "21 Container with identifier: \"com.example\" Not Found");
    EXPECT_TRUE(world.log.take().empty());
    EXPECT_TRUE(world.deathRow().empty());
}

// Goal: a container whose metadata is gone is an error, not a reason to make a second one. Method: remove the file.
TEST_F(Create, AnInconsistentContainerIsNotMadeAgain) {
    const FoundContainer made = world.make("com.example");
    ASSERT_EQ(::unlink((made.path + "/" + names::metadataFile).c_str()), 0);
    EXPECT_EQ(codeOf(world.create("com.example")), ErrorCode::cachedContainerWithoutMetadata);
    EXPECT_EQ(world.names(applications).size(), 1U);
    EXPECT_TRUE(listed().empty());
}

// Goal: want of descriptors gives no container a double, nor takes it by halves.
// Method: with each number of descriptors left, a fresh daemon is asked for it, then to delete it.
TEST_F(Create, AShortageOfDescriptorsHidesNoContainer) {
    const std::string identifier = "org.kept";
    const FoundContainer made = world.make(identifier);
    const std::string before = support::readTree(made.path).describe();
    bool refused = false;
    for (rlim_t left = 0; left < 12 && isThere(made.path); ++left) {
        SCOPED_TRACE(left);
        world.restart();
        {
            const support::FewDescriptors few(left);
            const auto found = world.create(identifier);
            refused = refused || !found;
            EXPECT_TRUE(!found || found->uuid == made.uuid);
        }
        for (int i = 0; i < 2; ++i)
            EXPECT_EQ(world.make(identifier).uuid, made.uuid);
        {
            world.disk().arm({.filter = [&](const DiskCallInfo& call) {
                EXPECT_FALSE(call.call == DiskCall::unlinkFile && call.subject == names::metadataFile);
                return false;
            }});
            const support::FewDescriptors few(left);
            (void)world.daemonsClient().deleteContainerForUser(mobile, &identifier, application, false);
        }
        world.disk().disarm();
        EXPECT_TRUE(!isThere(made.path) || support::readTree(made.path).describe() == before);
    }
    EXPECT_TRUE(refused);
    EXPECT_FALSE(isThere(made.path));
}

// Goal: a transient container is never found again, nor in the way of the next. Method: requests in a row.
TEST_F(Create, TransientContainersAreThrownAwayWhenAskedForAgain) {
    const auto create = [&] { return world.create("com.example", application, asTransient); };
    const auto find = [&] { return world.find("com.example", application, asTransient); };
    const FoundContainer first = create().value();
    world.disk().arm({.error = EIO, .filter = isMove});
    EXPECT_EQ(complaintOf(create()), "5 Failed to remove transient container at " + first.path);
    world.disk().disarm();
    EXPECT_TRUE(isThere(first.path));
    EXPECT_EQ(listed(application, asTransient), (std::set<std::string>{"com.example"}));

    const FoundContainer next = create().value();
    EXPECT_FALSE(next.existed);
    EXPECT_NE(next.uuid, first.uuid);
    EXPECT_NE(next.path, first.path);
    EXPECT_FALSE(isThere(first.path));
    for (int i = 0; i < 2; ++i)
        EXPECT_EQ(codeOf(find()), ErrorCode::notFound);
    EXPECT_FALSE(isThere(next.path));
    EXPECT_TRUE(listed(application, asTransient).empty());
    // One whose re-creation fails is gone as well: the next request finds nothing and makes it.
    ASSERT_TRUE(create());
    world.refuse(DiskCall::createFile, ENOSPC);
    EXPECT_EQ(codeOf(create()), ErrorCode::propertyListNotWritten);
    world.disk().disarm();
    EXPECT_EQ(codeOf(find()), ErrorCode::notFound);
    EXPECT_TRUE(create());
    world.drainDeathRow();
    EXPECT_TRUE(world.names(dead).empty());
}

// Goal: a step that fails has its words, leaves nothing, and can be done again. Method: one failing call a row.
TEST_F(Create, AFailedStepLeavesNothing) {
    (void)world.make("com.first");
    struct Row {
        const char* name;
        std::function<bool(const DiskCallInfo&)> filter;
        FaultSpan span;
        std::string complaint; // @: the container's UUID name
    };
    const auto makes = [](const std::string& subject) {
        return
            [=](const DiskCallInfo& call) { return call.call == DiskCall::makeDirectory && call.subject == subject; };
    };
    const auto makesTop = [](const DiskCallInfo& call) {
        return call.call == DiskCall::makeDirectory && call.subject.size() == uuidLength;
    };
    const auto is = [](DiskCall which) { return [=](const DiskCallInfo& call) { return call.call == which; }; };
    const std::string staged = world.path(staging) + "/@";
    const Row rows[] = {
        {"top level", makesTop, FaultSpan::once,
         "7 Failed to create staging dir at " + staged + " : POSIX 5 \"mkdir of " + staged +
             " failed: Input/output error\""},
        {"subdirectory", makes("Documents"), FaultSpan::once, "6 Failed to create sub-dir at " + staged + "Documents"},
        {"deeper subdirectory", makes("Caches"), FaultSpan::once,
         "6 Failed to create sub-dir at " + staged + "Library/Caches"},
        {"metadata file", is(DiskCall::createFile), FaultSpan::once,
         "34 Failed to write metadata dictionary to URL " + staged},
        {"metadata content", is(DiskCall::write), FaultSpan::once,
         "34 Failed to write metadata dictionary to URL " + staged},
        {"move", isMove, FaultSpan::once,
         "8 Failed to move staging dir: " + staged + " to live dir: " + world.path(applications) + "/@"},
        {"move and clean-up", isMove, FaultSpan::fromThenOn, "9 Failed to remove staging dir: " + staged},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        world.disk().arm({.error = EIO, .span = row.span, .filter = row.filter});
        std::string complaint = complaintOf(world.create("com.example"));
        EXPECT_TRUE(world.disk().met());
        world.disk().disarm();
        EXPECT_EQ(world.names(staging).size(), row.span == FaultSpan::once ? 0U : 1U);
        const std::size_t at = complaint.find(world.path(staging) + "/");
        ASSERT_NE(at, std::string::npos) << complaint;
        const std::string name = complaint.substr(at + world.path(staging).size() + 1, uuidLength);
        ASSERT_TRUE(UUID::parse(name)) << complaint;
        for (std::size_t i = complaint.find(name); i != std::string::npos; i = complaint.find(name))
            complaint.replace(i, uuidLength, "@");
        EXPECT_EQ(complaint, row.complaint);
        EXPECT_EQ(world.names(applications).size(), 1U);
        EXPECT_EQ(codeOf(world.find("com.example")), ErrorCode::notFound);
        EXPECT_EQ(world.services().locks().identifiersInUse(), 0U);
    }
    EXPECT_TRUE(world.create("com.example"));
    // A move of what is not there leaves an empty directory for the next pass, and starts none.
    EXPECT_EQ(world.pass(), ErrorCode::success);
    EXPECT_TRUE(world.names(dead).empty());
}

// Goal: an identifier is made once and listed whole. Method: threads that ask for the same ones, and a lister.
TEST_F(Create, ManyClientsAtOnce) {
    constexpr int clients = 6;
    constexpr int identifiers = 12;
    world.load();
    world.log.setLevel(logLevelError);
    std::array<std::array<FoundContainer, identifiers>, clients> found;
    std::atomic<int> working{clients};
    std::atomic<int> wrong{0};
    inParallel(clients + 1, [&](int thread) {
        if (thread == clients) {
            while (working > 0) {
                const auto all = world.daemonsClient().containersForUser(mobile, application, false);
                wrong += !all || all->size() > identifiers;
            }
            return;
        }
        for (std::size_t i = 0; i < identifiers; ++i) {
            const auto made = world.create("id" + std::to_string(i));
            wrong += !made;
            if (made)
                found[static_cast<std::size_t>(thread)][i] = *made;
            (void)world.create("transient" + std::to_string(thread), application, asTransient);
        }
        --working;
    });
    EXPECT_EQ(wrong, 0);
    for (std::size_t i = 0; i < identifiers; ++i) {
        int creators = 0;
        for (const auto& own : found) {
            creators += own[i].existed ? 0 : 1;
            EXPECT_EQ(own[i].uuid, found[0][i].uuid);
            EXPECT_EQ(own[i].path, found[0][i].path);
        }
        EXPECT_EQ(creators, 1);
    }
    EXPECT_EQ(listed().size(), static_cast<std::size_t>(identifiers));
    EXPECT_TRUE(world.names(staging).empty());
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
        EXPECT_TRUE(make("a", ContainerClass::bundleApplication, false, bundleOwnerUserId)); // another's share
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

} // namespace
} // namespace zor::test
