// SPDX-License-Identifier: Apache-2.0
// Creating, finding and listing containers: what a container of each class looks like on disk, what is refused, what a
// failing disk leaves, and many clients at once.
#include "plist/Read.h"
#include "store/FewDescriptors.h"
#include "world/World.h"

#include <atomic>
#include <gtest/gtest.h>
#include <set>
#include <thread>
#include <unistd.h>

namespace zor::test {
namespace {

using support::DiskCall;
using support::DiskCallInfo;
using support::hasLine;

constexpr ContainerClass application = ContainerClass::dataApplication;
const std::string staging = std::string(cachesPath) + "/Staging";
const std::string dead = std::string(cachesPath) + "/Dead";
constexpr std::size_t uuidLength = 36;

std::uint32_t ownerOf(ContainerClass containerClass) {
    return isBundleClass(containerClass) ? 33 : isSystemClass(containerClass) ? 499 : mobile;
}

class Create : public testing::Test {
protected:
    World world;

    Result<FoundContainer> ask(const std::string& identifier, ContainerClass containerClass = application,
                               ZORClientConnection::CreateOrLookupOptions options = {.createIfNecessary = true}) {
        return world.daemonsClient().createOrLookupContainerForUser(ownerOf(containerClass), &identifier,
                                                                    containerClass, options);
    }
    [[nodiscard]] std::string relative(const std::string& path) const { return path.substr(world.path().size() + 1); }
    std::set<std::string> listed(ContainerClass containerClass = application, bool transient = false) {
        std::set<std::string> identifiers;
        const auto containers =
            world.daemonsClient().containersForUser(ownerOf(containerClass), containerClass, transient);
        EXPECT_TRUE(containers);
        if (!containers)
            return identifiers;
        for (const auto& container : *containers)
            EXPECT_TRUE(identifiers.insert(container.identifier).second);
        return identifiers;
    }
    static bool isMoveOf(const DiskCallInfo& call, std::size_t nameLength) {
        return call.call == DiskCall::rename && call.subject.find(" -> ") == nameLength;
    }
};

// Goal: every class gets its tree, modes and owners, a directory name that is not its internal UUID, and a metadata
// file of the daemon's own; a new daemon finds the same container. Method: all classes, live and transient, against a
// table.
TEST_F(Create, EveryClassGetsItsTree) {
    using Names = std::vector<std::string>;
    const Names data = {"Documents", "Library", "Library/Caches", "Library/Preferences", "tmp"};
    const Names group = {"Library", "Library/Caches"};
    for (const bool transient : {false, true})
        for (std::uint64_t number = 1; ipc::isContainerClass(number); ++number) {
            const auto containerClass = static_cast<ContainerClass>(number);
            SCOPED_TRACE(std::string(className(containerClass)) + (transient ? " transient" : ""));
            const auto found = ask("com.example", containerClass, {.createIfNecessary = true, .transient = transient});
            ASSERT_TRUE(found) << found.error().text();
            EXPECT_FALSE(found->existed);
            const std::string path = relative(found->path);
            const auto classDirectory = world.services().configuration().containerDirectoryURLForUser(
                ownerOf(containerClass), containerClass, transient);
            EXPECT_EQ(found->path.substr(0, found->path.rfind('/')), classDirectory->path());
            const std::string name = path.substr(path.rfind('/') + 1);
            ASSERT_TRUE(UUID::parse(name)) << name;
            EXPECT_EQ(UUID::parse(name)->string(), name);
            EXPECT_NE(name, found->uuid.string());
            EXPECT_EQ(found->record->transient(), transient);

            const bool bundle = isBundleClass(containerClass);
            const bool system = isSystemClass(containerClass);
            EXPECT_EQ(world.item(path), directoryOf(bundle ? 33 : system ? 0 : mobile));
            EXPECT_EQ(world.services().defaultManager().dataProtectionClassOfItemAtURL(world.url(path)).value(), 0);
            const Names& expected = bundle ? Names() : number == 7 || number == 13 ? group : data;
            std::set<std::string> top = {names::metadataFile};
            for (const std::string& subdirectory : expected) {
                EXPECT_EQ(world.item(path + "/" + subdirectory),
                          directoryOf(system ? 0 : mobile, system ? 0777 : 0755));
                top.insert(subdirectory.substr(0, subdirectory.find('/')));
            }
            const auto there = world.names(path);
            EXPECT_EQ(std::set<std::string>(there.begin(), there.end()), top);
            const std::string file = path + "/" + names::metadataFile;
            EXPECT_TRUE(world.item(file).starts_with("file 0644 " + std::to_string(::geteuid()))) << world.item(file);
            const std::string bytes = world.read(file);
            const auto content =
                plist::readPropertyList({reinterpret_cast<const std::uint8_t*>(bytes.data()), bytes.size()});
            ASSERT_TRUE(content);
            EXPECT_EQ(*content,
                      plist::Value(metadataOf(number, ownerOf(containerClass), "com.example", found->uuid.string())));
            EXPECT_TRUE(world.names(staging).empty());
            EXPECT_EQ(listed(containerClass, transient), (std::set<std::string>{"com.example"}));
            if (transient)
                continue;
            EXPECT_TRUE(listed(containerClass, true).empty());
            for (int launch = 0; launch < 2; ++launch) {
                const auto again = ask("com.example", containerClass, {});
                ASSERT_TRUE(again);
                EXPECT_TRUE(again->existed);
                EXPECT_EQ(again->uuid, found->uuid);
                EXPECT_EQ(again->path, found->path);
                world.restart();
            }
        }
}

TEST_F(Create, WellKnownContainersHaveFixedNames) {
    for (const auto& [identifier, containerClass] :
         {std::pair("com.veltra.settingsd", ContainerClass::dataSystem),
          std::pair("systemgroup.com.veltra.fonts", ContainerClass::sharedSystemGroup)}) {
        const auto found = ask(identifier, containerClass);
        ASSERT_TRUE(found);
        EXPECT_EQ(relative(found->path), std::string(sharedPath) + "/" + className(containerClass) + "/" + identifier);
        world.restart();
        EXPECT_EQ(ask(identifier, containerClass)->uuid, found->uuid);
    }
    // In another class the same words are any identifier.
    EXPECT_TRUE(UUID::parse(FileURL::directory(ask("com.veltra.settingsd")->path).lastPathComponent()));
}

// Goal: what cannot be acted on is refused with its words, before any lock is taken. Method: a table; the lock's own
// lines would show.
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
        ErrorCode code;
        std::string message;
    };
    const Row rows[] = {
        {world.daemonsClient(), mobile, nullptr, 2, ErrorCode::invalidObject,
         "Can't act on an invalid object: userId: 501, ID: (null), class: 2"},
        {world.daemonsClient(), mobile, &identifier, 0, ErrorCode::invalidObject,
         "Can't act on an invalid object: userId: 501, ID: com.example, class: 0"},
        {world.daemonsClient(), 33, &identifier, 14, ErrorCode::invalidObject,
         "Can't act on an invalid object: userId: 33, ID: com.example, class: 14"},
        {world.daemonsClient(), mobile, &identifier, 1, ErrorCode::invalidObject,
         "Invalid userId 501 for class 1, ID: com.example"},
        {*other, 500, &identifier, 12, ErrorCode::invalidObject, "Invalid userId 500 for class 12, ID: com.example"},
        {*other, 499, &identifier, 12, ErrorCode::notEntitled,
         "com.example not entitled for a system container, but com.other is trying"},
        {*nameless, 499, &identifier, 12, ErrorCode::notEntitled,
         "com.example not entitled for a system container, but (null) is trying"},
    };
    for (const Row& row : rows) {
        world.log.take();
        const auto refused = row.client.createOrLookupContainerForUser(
            row.userId, row.identifier, static_cast<ContainerClass>(row.containerClass), {.createIfNecessary = true});
        ASSERT_FALSE(refused) << row.message;
        EXPECT_TRUE(refused.error().is(row.code)) << row.message;
        const auto said = world.log.take();
        ASSERT_EQ(said.size(), 1U) << row.message;
        EXPECT_TRUE(hasLine(said, 3, "createOrLookupContainerForUser", row.message)) << said[0];
    }
    for (const std::uint64_t number : {0, 14}) {
        world.log.take();
        const auto refused =
            world.daemonsClient().containersForUser(mobile, static_cast<ContainerClass>(number), false);
        EXPECT_TRUE(refused.error().is(ErrorCode::invalidObject));
        const auto said = world.log.take();
        ASSERT_EQ(said.size(), 1U);
        EXPECT_TRUE(hasLine(said, 3, "containersForUser",
                            "Can't act on an invalid container-userId: 501, class: " + std::to_string(number)));
    }
    EXPECT_TRUE(world.daemonsClient()
                    .containersForUser(mobile, ContainerClass::bundleFramework, false)
                    .error()
                    .is(ErrorCode::cacheNotRebuilt));
    EXPECT_FALSE(world.exists(staging));
    // The entitlement admits a client to its own system container.
    ASSERT_TRUE(world.services().entitlements()._setEntitlementDictionaryValues(
        {plist::Dictionary{{std::string(entitlementKeys::systemContainer), true}}}, {identifier}));
    EXPECT_TRUE(other->createOrLookupContainerForUser(499, &identifier, ContainerClass::dataSystem,
                                                      {.createIfNecessary = true}));
}

TEST_F(Create, NotFoundIsAnswered21AndNotSaid) {
    ASSERT_TRUE(ask("com.other"));
    world.log.take();
    for (const bool transient : {false, true}) {
        const auto missing = ask("com.example", application, {.transient = transient});
        ASSERT_FALSE(missing);
        EXPECT_TRUE(missing.error().is(ErrorCode::notFound));
        EXPECT_EQ(missing.error().description(), "Container with identifier: \"com.example\" Not Found");
    }
    EXPECT_TRUE(world.log.take().empty());
    EXPECT_TRUE(world.deathRow().empty());
}

// Goal: a container whose metadata is gone is an error, not a reason to make a second one. Method: remove the file.
TEST_F(Create, AnInconsistentContainerIsNotMadeAgain) {
    const auto found = ask("com.example");
    ASSERT_EQ(::unlink((found->path + "/" + names::metadataFile).c_str()), 0);
    EXPECT_TRUE(ask("com.example").error().is(ErrorCode::cachedContainerWithoutMetadata));
    EXPECT_EQ(world.names(relative(found->path.substr(0, found->path.rfind('/')))).size(), 1U);
    EXPECT_TRUE(listed().empty());
}

// Goal: a container that cannot be looked at for want of descriptors is not taken for none, which would give it a
// double, nor is it taken away by halves. Method: with each number of descriptors left, it is asked for by a daemon
// that knows nothing yet, and deleted.
TEST_F(Create, AShortageOfDescriptorsHidesNoContainer) {
    const auto made = ask("org.kept");
    ASSERT_TRUE(made);
    const support::FileTree before = support::readTree(made->path);
    const std::string identifier = "org.kept";
    bool refused = false;
    for (rlim_t left = 0; left < 12; ++left) {
        SCOPED_TRACE(left);
        world.restart();
        Result<FoundContainer> found = [&] {
            const FewDescriptors few(left);
            return ask("org.kept");
        }();
        refused = refused || !found;
        if (found) {
            EXPECT_EQ(found->uuid, made->uuid);
        }
        const auto again = ask("org.kept");
        ASSERT_TRUE(again) << again.error().text();
        EXPECT_EQ(ask("org.kept")->uuid, made->uuid);
        {
            const FewDescriptors few(left);
            (void)world.daemonsClient().deleteContainerForUser(mobile, &identifier, application, false);
        }
        if (!world.exists(relative(made->path)))
            break; // there were enough
        EXPECT_EQ(support::readTree(made->path).describe(), before.describe());
    }
    EXPECT_TRUE(refused);
    EXPECT_FALSE(world.exists(relative(made->path)));
}

// Goal: a transient container is never found again, and none stands in the way of the next. Method: create, create
// again, ask without creation, ask once more; a removal that fails is error 5 and changes nothing.
TEST_F(Create, TransientContainersAreThrownAwayWhenAskedForAgain) {
    constexpr ZORClientConnection::CreateOrLookupOptions make{.createIfNecessary = true, .transient = true};
    constexpr ZORClientConnection::CreateOrLookupOptions look{.transient = true};
    const auto first = ask("com.example", application, make);
    ASSERT_TRUE(first);
    world.disk().arm({.error = EIO, .filter = [](const DiskCallInfo& call) { return isMoveOf(call, uuidLength); }});
    const auto kept = ask("com.example", application, make);
    world.disk().disarm();
    ASSERT_FALSE(kept);
    EXPECT_TRUE(kept.error().is(ErrorCode::transientRemovalFailed));
    EXPECT_EQ(kept.error().description(), "Failed to remove transient container at " + first->path);
    EXPECT_TRUE(world.exists(relative(first->path)));
    EXPECT_EQ(listed(application, true), (std::set<std::string>{"com.example"}));

    const auto next = ask("com.example", application, make);
    ASSERT_TRUE(next);
    EXPECT_FALSE(next->existed);
    EXPECT_NE(next->uuid, first->uuid);
    EXPECT_NE(next->path, first->path);
    EXPECT_FALSE(world.exists(relative(first->path)));
    for (int i = 0; i < 2; ++i)
        EXPECT_TRUE(ask("com.example", application, look).error().is(ErrorCode::notFound));
    EXPECT_FALSE(world.exists(relative(next->path)));
    EXPECT_TRUE(listed(application, true).empty());
    // One whose re-creation fails is gone as well: the next request finds nothing and makes it.
    ASSERT_TRUE(ask("com.example", application, make));
    world.disk().arm(
        {.error = ENOSPC, .filter = [](const DiskCallInfo& call) { return call.call == DiskCall::createFile; }});
    EXPECT_TRUE(ask("com.example", application, make).error().is(ErrorCode::propertyListNotWritten));
    world.disk().disarm();
    EXPECT_TRUE(ask("com.example", application, look).error().is(ErrorCode::notFound));
    EXPECT_TRUE(ask("com.example", application, make));
    world.drainDeathRow();
    EXPECT_TRUE(world.names(dead).empty());
}

// Goal: each step that fails has its code and words, leaves nothing in staging and nothing under a final name, and the
// next request succeeds. Method: one failing call a row.
TEST_F(Create, AFailedStepLeavesNothing) {
    world.load();
    ASSERT_TRUE(listed().empty()); // the caches and directories are there
    ASSERT_TRUE(ask("com.first"));
    struct Row {
        const char* name;
        std::function<bool(const DiskCallInfo&)> filter;
        support::FaultSpan span;
        ErrorCode code;
        std::string message; // @: the container's UUID name
    };
    const auto makes = [](std::string subject) {
        return [=](const DiskCallInfo& call) {
            return call.call == DiskCall::makeDirectory &&
                   (subject.empty() ? call.subject.size() == uuidLength : call.subject == subject);
        };
    };
    const auto is = [](DiskCall which) { return [=](const DiskCallInfo& call) { return call.call == which; }; };
    const std::string stagingPath = world.path(staging) + "/";
    const std::string livePath = world.path(mobileContainers) + "/Data/Application/";
    const auto once = support::FaultSpan::once;
    const Row rows[] = {
        {"top level", makes(""), once, ErrorCode::stagingDirectoryFailed,
         "Failed to create staging dir at " + stagingPath + "@ : POSIX 5 \"mkdir of " + stagingPath +
             "@ failed: Input/output error\""},
        {"subdirectory", makes("Documents"), once, ErrorCode::subdirectoryFailed,
         "Failed to create sub-dir at " + stagingPath + "@Documents"},
        {"deeper subdirectory", makes("Caches"), once, ErrorCode::subdirectoryFailed,
         "Failed to create sub-dir at " + stagingPath + "@Library/Caches"},
        {"metadata file", is(DiskCall::createFile), once, ErrorCode::propertyListNotWritten,
         "Failed to write metadata dictionary to URL " + stagingPath + "@"},
        {"metadata content", is(DiskCall::write), once, ErrorCode::propertyListNotWritten,
         "Failed to write metadata dictionary to URL " + stagingPath + "@"},
        {"move", [](const DiskCallInfo& call) { return isMoveOf(call, uuidLength); }, once, ErrorCode::moveToLiveFailed,
         "Failed to move staging dir: " + stagingPath + "@ to live dir: " + livePath + "@"},
        {"move and clean-up", [](const DiskCallInfo& call) { return isMoveOf(call, uuidLength); },
         support::FaultSpan::fromThenOn, ErrorCode::stagingRemovalFailed,
         "Failed to remove staging dir: " + stagingPath + "@"},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        world.log.take();
        world.disk().arm({.error = EIO, .span = row.span, .filter = row.filter});
        const auto failed = ask("com.example");
        EXPECT_TRUE(world.disk().met());
        world.disk().disarm();
        ASSERT_FALSE(failed);
        EXPECT_TRUE(failed.error().is(row.code)) << failed.error().text();
        const bool cleanUpFailed = row.code == ErrorCode::stagingRemovalFailed;
        EXPECT_EQ(world.names(staging).size(), cleanUpFailed ? 1U : 0U);
        std::string description = failed.error().description().value_or("");
        const std::size_t at = description.find(stagingPath);
        ASSERT_NE(at, std::string::npos) << description;
        const std::string name = description.substr(at + stagingPath.size(), uuidLength);
        ASSERT_TRUE(UUID::parse(name)) << description;
        for (std::size_t i = description.find(name); i != std::string::npos; i = description.find(name))
            description.replace(i, uuidLength, "@");
        EXPECT_EQ(description, row.message);
        EXPECT_EQ(world.names(std::string(mobileContainers) + "/Data/Application").size(), 1U);
        EXPECT_TRUE(ask("com.example", application, {}).error().is(ErrorCode::notFound));
        EXPECT_EQ(world.services().locks().identifiersInUse(), 0U);
    }
    EXPECT_TRUE(ask("com.example"));
    // A move of what is not there leaves an empty directory for the next pass, and starts none.
    world.daemonsClient().deleteContainersOnDeathRowWithCompletion(nullptr);
    world.drainDeathRow();
    EXPECT_TRUE(world.names(dead).empty());
}

// Goal: an exception in the middle is error 40 and cleans up; what is no exception cleans up and goes on. Method: the
// disk throws at the last step before the move.
TEST_F(Create, ExceptionsCleanUp) {
    struct NoException {};
    ASSERT_TRUE(ask("com.first"));
    const auto throwAtMove = [&](auto thrower) {
        world.disk().arm({.filter = [=, done = std::make_shared<bool>(false)](const DiskCallInfo& call) {
            if (isMoveOf(call, uuidLength) && !std::exchange(*done, true))
                thrower();
            return false;
        }});
    };
    throwAtMove([] { throw std::bad_alloc(); });
    const auto caught = ask("com.example");
    ASSERT_FALSE(caught);
    EXPECT_TRUE(caught.error().is(ErrorCode::exceptionCaught));
    EXPECT_TRUE(world.names(staging).empty());
    throwAtMove([] { throw NoException(); });
    EXPECT_THROW((void)ask("com.example"), NoException);
    world.disk().disarm();
    EXPECT_TRUE(world.names(staging).empty());
    EXPECT_TRUE(ask("com.example")); // the lock is free, and nothing of the container was there
}

// Goal: one identifier is made once, every client sees the same container and one of them that it did not exist;
// listings show only whole containers. Method: many threads, a few identifiers, a lister beside them.
TEST_F(Create, ManyClientsAtOnce) {
    constexpr int threadCount = 6;
    constexpr int identifiers = 12;
    world.load();
    world.log.setLevel(logLevelError);
    std::array<std::array<FoundContainer, identifiers>, threadCount> found;
    std::atomic<bool> done{false};
    std::atomic<int> wrong{0};
    std::thread lister([&] {
        while (!done) {
            const auto all = world.daemonsClient().containersForUser(mobile, application, false);
            wrong += !all || all->size() > identifiers;
        }
    });
    std::vector<std::thread> threads;
    for (std::size_t t = 0; t < threadCount; ++t)
        threads.emplace_back([&, t] {
            for (int i = 0; i < identifiers; ++i) {
                auto made = ask("id" + std::to_string(i));
                if (made)
                    found[t][static_cast<std::size_t>(i)] = *made;
                else
                    ++wrong;
                (void)ask("transient" + std::to_string(t), application, {.createIfNecessary = true, .transient = true});
            }
        });
    for (std::thread& thread : threads)
        thread.join();
    done = true;
    lister.join();
    EXPECT_EQ(wrong, 0);
    for (std::size_t i = 0; i < identifiers; ++i) {
        int creators = 0;
        for (std::size_t t = 0; t < threadCount; ++t) {
            creators += found[t][i].existed ? 0 : 1;
            EXPECT_EQ(found[t][i].uuid, found[0][i].uuid);
            EXPECT_EQ(found[t][i].path, found[0][i].path);
        }
        EXPECT_EQ(creators, 1);
    }
    EXPECT_EQ(listed().size(), static_cast<std::size_t>(identifiers));
    EXPECT_TRUE(world.names(staging).empty());
}

} // namespace
} // namespace zor::test
