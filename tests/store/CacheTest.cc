// SPDX-License-Identifier: Apache-2.0
// The container cache: built once, in the directory's order, by one thread or two; what it answers when the disk is not
// as it remembers; readers and writers at once.
#include "world/World.h"

#include <atomic>
#include <gtest/gtest.h>
#include <map>
#include <random>
#include <thread>
#include <unistd.h>

namespace zor::test {
namespace {

using support::hasLine;
using support::LogLine;

constexpr ContainerClass application = ContainerClass::dataApplication;
const std::string applications = std::string(mobileContainers) + "/Data/Application";
const std::string transients = std::string(mobileCaches) + "/Temp/Data/Application";

std::string uuidNumber(int number) {
    char text[40];
    std::snprintf(text, sizeof text, "00000000-0000-4000-8000-%012d", number);
    return text;
}

bool probeThrows = false;
fs::Ordering throwingProbe(int) {
    if (std::exchange(probeThrows, false))
        throw std::bad_alloc();
    return fs::Ordering::journal;
}

class Cache : public testing::Test {
protected:
    World world{{.logLevel = logLevelDebug, .probe = throwingProbe}};
    ZORContainerCache& cache() { return world.services().cache(); }
    /// A container of the identifier, in a directory and with an internal UUID made of the numbers.
    void put(const std::string& directory, int name, const std::string& identifier, int uuid) const {
        world.putContainer(directory + "/" + uuidNumber(name), metadataOf(2, mobile, identifier, uuidNumber(uuid)));
    }
    Result<ZORContainerCache::Record> find(const std::string& identifier, bool transient = false) {
        return cache().containerForUser(mobile, application, &identifier, transient);
    }
    std::vector<FileURL> listing() {
        return world.services().defaultManager().urlsForItemsInDirectoryAtURL(world.url(applications)).value();
    }
    static std::vector<std::string> linesWith(const std::vector<LogLine>& lines, std::string_view part) {
        std::vector<std::string> found;
        for (const LogLine& line : lines)
            if (line.message.find(part) != std::string::npos)
                found.push_back(line.message);
        return found;
    }
};

TEST_F(Cache, IsBuiltOnceAndAsksOnlyForTheFileAfterwards) {
    put(applications, 1, "a", 11);
    ASSERT_TRUE(find("a"));
    put(applications, 2, "b", 12);
    const auto later = find("b");
    ASSERT_FALSE(later);
    EXPECT_TRUE(later.error().is(ErrorCode::notFound));
    EXPECT_EQ(later.error().description(), "Cache: Data/Application: Container Not Found with ID: b");
    EXPECT_FALSE(find("b", true));
    const auto said = world.log.take();
    EXPECT_EQ(linesWith(said, "Rebuilding"),
              (std::vector<std::string>{"Rebuilding container class cache: 501-Data/Application",
                                        "Rebuilding container class cache: 501-Data/Application(transient)"}));
    EXPECT_TRUE(hasLine(said, 7, "containerForUser", "Cache: Data/Application: Found Identifier: a"));
    EXPECT_TRUE(linesWith(said, "Not Found").empty());
    world.services().cache().dropAll();
    EXPECT_TRUE(find("b"));
}

// Goal: of two containers with one identifier the later listed counts, whoever reads them. Method: a small directory
// (one thread) and a large one (two), compared with the directory's own order.
TEST_F(Cache, TheLaterListedCounts) {
    for (const int count : {8, 1000}) {
        world.services().cache().dropAll();
        std::mt19937 random(7);
        std::map<std::string, std::string> identifierOf;
        for (int i = 0; i < count; ++i) {
            const std::string identifier = "id" + std::to_string(random() % static_cast<unsigned>(count / 2));
            put(applications, count * 10 + i, identifier, count * 10 + i);
            identifierOf[uuidNumber(count * 10 + i)] = identifier;
        }
        std::map<std::string, std::string> expected;
        for (const FileURL& item : listing())
            expected[identifierOf[std::string(item.lastPathComponent())]] = item.lastPathComponent();
        const auto all = cache().allContainersForUser(mobile, application, false);
        ASSERT_TRUE(all);
        std::map<std::string, std::string> found;
        for (const auto& record : *all) {
            found[record->identifier()] = record->uuid().string();
            EXPECT_EQ(record->url(), world.url(applications + "/" + record->uuid().string()));
        }
        EXPECT_EQ(found, expected) << count;
        ASSERT_TRUE(world.services().defaultManager().removeItemAtURL(world.url(applications)));
    }
}

// Goal: what is not valid stays out and is said, in the directory's order, however many threads read. Method: every
// tenth of many entries is bad.
TEST_F(Cache, InvalidEntriesStayOut) {
    constexpr int count = 400;
    for (int i = 0; i < count; ++i) {
        put(applications, i, "id" + std::to_string(i), i);
        if (i % 10 == 0)
            world.write(applications + "/" + uuidNumber(i) + "/" + names::metadataFile, "nonsense");
    }
    put(applications, count, "other-class", count);
    world.putContainer(applications + "/" + uuidNumber(count), metadataOf(4, mobile, "other-class"));
    world.write(applications + "/plain-file", "x");
    std::vector<std::string> expected;
    for (const FileURL& item : listing())
        if (!item.isDirectory() || world.read(applications + "/" + std::string(item.lastPathComponent()) + "/" +
                                              names::metadataFile) == "nonsense")
            expected.push_back("Failed to read metadata at URL " + item.path());
    world.log.take();
    EXPECT_EQ(cache().allContainersForUser(mobile, application, false)->size(), 360U);
    std::vector<std::string> said;
    for (const std::string& message : world.log.take(3, "readAndValidateMetadataAtUrl"))
        if (const std::string text = support::withoutSourceLine(message); text.starts_with("Failed to read"))
            said.push_back(text.substr(0, text.find(" (")));
    EXPECT_EQ(said, expected);
    EXPECT_TRUE(find("other-class").error().is(ErrorCode::notFound));
}

TEST_F(Cache, AContainerWithoutItsFileIsInconsistent) {
    put(applications, 1, "a", 11);
    put(applications, 2, "b", 12);
    ASSERT_TRUE(find("a"));
    const std::string file = applications + "/" + uuidNumber(1) + "/" + names::metadataFile;
    ASSERT_EQ(::rename(world.path(file).c_str(), world.path("aside").c_str()), 0);
    const std::string message = "Cache: Data/Application: INCONSISTENT-No Metadata at: " + world.path(file);
    for (const bool linked : {false, true}) {
        // A link in its place is none either.
        if (linked) {
            ASSERT_EQ(::symlink(world.path("aside").c_str(), world.path(file).c_str()), 0);
        }
        world.log.take();
        const auto gone = find("a");
        ASSERT_FALSE(gone);
        EXPECT_TRUE(gone.error().is(ErrorCode::cachedContainerWithoutMetadata));
        EXPECT_EQ(gone.error().description(), message);
        const auto all = cache().allContainersForUser(mobile, application, false);
        ASSERT_TRUE(all);
        ASSERT_EQ(all->size(), 1U);
        EXPECT_EQ((*all)[0]->identifier(), "b");
        const auto said = world.log.take();
        EXPECT_TRUE(hasLine(said, 3, "containerForUser", message));
        EXPECT_TRUE(hasLine(said, 3, "allContainersForUser", message));
        EXPECT_EQ(cache().counts().records, 2U);
    }
    ASSERT_EQ(::rename(world.path("aside").c_str(), world.path(file).c_str()), 0);
    EXPECT_TRUE(find("a"));
}

// Goal: each wrong input has its code and words, and touches no disk. Method: a table over the four operations.
TEST_F(Cache, WrongInputs) {
    const std::string identifier = "a";
    const auto record = [](std::uint64_t containerClass) {
        return std::make_shared<ZORMetadata>(mobile, UUID::random(), static_cast<ContainerClass>(containerClass), "a",
                                             nullptr, ContainerPlace());
    };
    const auto asClass = [](std::uint64_t number) { return static_cast<ContainerClass>(number); };
    const ContainerPlace place(world.url(applications + "/" + uuidNumber(1)));
    const auto errorOf = [](const auto& result) { return result ? std::optional<ZORError>() : result.error(); };
    struct Row {
        std::optional<ZORError> error;
        ErrorCode code;
        std::string message;
    };
    constexpr auto invalid = ErrorCode::cacheInputInvalid;
    constexpr auto notRebuilt = ErrorCode::cacheNotRebuilt;
    const Row rows[] = {
        {errorOf(cache().containerForUser(mobile, asClass(0), &identifier, false)), invalid,
         "Invalid Content Class: 0"},
        {errorOf(cache().containerForUser(mobile, asClass(14), nullptr, false)), invalid, "Invalid Content Class: 14"},
        {errorOf(cache().containerForUser(mobile, application, nullptr, false)), invalid, "Invalid identifier: (null)"},
        {errorOf(cache().allContainersForUser(mobile, asClass(14), false)), invalid, "Invalid Content Class: 14"},
        {errorOf(cache().removeContainerForUser(mobile, asClass(0), &identifier, false)), invalid,
         "Invalid Content Class: 0"},
        {errorOf(cache().removeContainerForUser(mobile, application, nullptr, false)), invalid,
         "Invalid Identifier: (null)"},
        {errorOf(cache().addContainerMetadata(record(0), mobile, place, false)), invalid,
         "Invalid Metadata Content Class: 0"},
        {errorOf(cache().addContainerMetadata(record(2), mobile, ContainerPlace(), false)), invalid,
         "Invalid input: URL: (null)"},
        {errorOf(cache().containerForUser(mobile, asClass(1), &identifier, false)), notRebuilt,
         "Cache: 501-Bundle/Application: Failed to rebuild"},
        {errorOf(cache().allContainersForUser(33, application, true)), notRebuilt,
         "Cache: 33-Data/Application(transient): Failed to rebuild"},
        {errorOf(cache().removeContainerForUser(0, asClass(12), &identifier, false)), notRebuilt,
         "Cache: 0-Data/System: Failed to rebuild"},
        {errorOf(cache().addContainerMetadata(record(2), 500, place, false)), notRebuilt,
         "Cache: 500-Data/Application: Failed to rebuild"},
    };
    for (const Row& row : rows) {
        ASSERT_TRUE(row.error) << row.message;
        EXPECT_TRUE(row.error->is(row.code)) << row.message;
        EXPECT_EQ(row.error->description(), row.message);
        if (row.code == notRebuilt) {
            ASSERT_NE(row.error->underlying(), nullptr);
            EXPECT_TRUE(row.error->underlying()->is(invalid));
        }
    }
    EXPECT_EQ(rows[8].error->underlying()->description(), "Invalid cache get-userId 501 for class 1");
    EXPECT_FALSE(world.exists(sharedPath));
    EXPECT_FALSE(world.exists(mobileContainers));
    EXPECT_EQ(cache().counts().classCaches, 0U);
    // A user without a home has no class directory.
    const auto homeless = cache().containerForUser(504, application, &identifier, false);
    ASSERT_FALSE(homeless);
    EXPECT_TRUE(homeless.error().is(notRebuilt));
}

TEST_F(Cache, FindsByUUIDLiveBeforeTransient) {
    put(applications, 1, "both", 11);
    put(transients, 2, "both", 11);
    put(transients, 3, "temp", 12);
    world.putContainer(applications + "/" + uuidNumber(4),
                       metadataOf(2, mobile, "hex", "ABCDEF00-0000-4000-8000-00000000000A"));
    const auto find = [&](const std::string& identifier, const std::string& uuid) {
        return cache().containerForUser(mobile, application, &identifier, std::string_view(uuid));
    };
    const auto both = find("both", uuidNumber(11));
    ASSERT_TRUE(both);
    EXPECT_FALSE(both->transient());
    EXPECT_EQ(both->url(), world.url(applications + "/" + uuidNumber(1)));
    const auto temp = find("temp", uuidNumber(12));
    ASSERT_TRUE(temp);
    EXPECT_TRUE(temp->transient());
    EXPECT_EQ(find("both", uuidNumber(12)), nullptr);
    EXPECT_EQ(find("missing", uuidNumber(11)), nullptr);
    EXPECT_NE(find("hex", "ABCDEF00-0000-4000-8000-00000000000A"), nullptr);
    EXPECT_EQ(find("hex", "abcdef00-0000-4000-8000-00000000000a"), nullptr);
}

TEST_F(Cache, AddingBuildsFirstAndReplaces) {
    put(applications, 1, "a", 11);
    put(applications, 2, "b", 12);
    const std::string identifier = "a";
    const auto record = std::make_shared<ZORMetadata>(mobile, *UUID::parse(uuidNumber(13)), application, identifier,
                                                      nullptr, ContainerPlace());
    put(applications, 3, "elsewhere", 13);
    ASSERT_TRUE(cache().addContainerMetadata(record, mobile,
                                             ContainerPlace(world.url(applications + "/" + uuidNumber(3))), false));
    EXPECT_EQ(find("a")->get(), record.get());
    EXPECT_EQ(record->url(), world.url(applications + "/" + uuidNumber(3)));
    EXPECT_TRUE(find("b"));
    ASSERT_TRUE(cache().removeContainerForUser(mobile, application, &identifier, false));
    ASSERT_TRUE(cache().removeContainerForUser(mobile, application, &identifier, false));
    EXPECT_TRUE(find("a").error().is(ErrorCode::notFound));
    const auto said = world.log.take();
    EXPECT_EQ(linesWith(said, "Added"), (std::vector<std::string>{"Cache: Data/Application: Added Identifier: a"}));
    EXPECT_EQ(linesWith(said, "Removed").size(), 2U);
    // A record that lost its place is said so: as an answer, and as one left out of a listing.
    (*find("b"))->setPlace({});
    const auto placeless = find("b");
    ASSERT_FALSE(placeless);
    EXPECT_TRUE(placeless.error().is(ErrorCode::cacheInputInvalid));
    EXPECT_EQ(placeless.error().description(), "Cache: Data/Application: Invalid URL path string: (null)");
    world.log.take();
    EXPECT_EQ(cache().allContainersForUser(mobile, application, false)->size(), 1U);
    EXPECT_TRUE(hasLine(world.log.take(), 3, "allContainersForUser", "Cache: Data/Application: nil URL from (null)"));
}

// Goal: a class directory that its owner swapped for a link leads nowhere, before the cache is built and after; nothing
// wrong is kept. Method: the link points to a directory with a good container in it.
TEST_F(Cache, AClassDirectorySwappedForALink) {
    put(applications, 1, "a", 11);
    const std::string bait = "private/var/second/Data/Application";
    put(bait, 2, "bait", 12);
    const auto swap = [&](bool in) {
        const std::string at = world.path(applications);
        const std::string aside = world.path("aside");
        if (in) {
            ASSERT_EQ(::rename(at.c_str(), aside.c_str()), 0);
            ASSERT_EQ(::symlink(world.path(bait).c_str(), at.c_str()), 0);
        } else {
            ASSERT_EQ(::unlink(at.c_str()), 0);
            ASSERT_EQ(::rename(aside.c_str(), at.c_str()), 0);
        }
    };
    swap(true);
    EXPECT_TRUE(find("bait").error().is(ErrorCode::cacheNotRebuilt));
    EXPECT_EQ(cache().counts().classCaches, 0U);
    swap(false);
    ASSERT_TRUE(find("a"));
    swap(true);
    EXPECT_TRUE(find("a").error().is(ErrorCode::cachedContainerWithoutMetadata));
    EXPECT_TRUE(find("bait").error().is(ErrorCode::notFound));
    swap(false);
    EXPECT_TRUE(find("a"));
}

TEST_F(Cache, AnExceptionEndsAtTheOperationAndReleasesTheLock) {
    put(applications, 1, "a", 11);
    probeThrows = true;
    const auto thrown = find("a");
    ASSERT_FALSE(thrown);
    EXPECT_TRUE(thrown.error().is(ErrorCode::exceptionCaught));
    EXPECT_TRUE(find("a"));
}

// Goal: lookups, listings, additions, removals and drops at once neither race nor lose each other's work. Method: each
// thread adds and removes its own identifiers and must see exactly them.
TEST_F(Cache, ManyThreads) {
    world.log.setLevel(logLevelError);
    for (int i = 0; i < 300; ++i)
        put(applications, i, "shared" + std::to_string(i), i);
    std::atomic<int> wrong{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t)
        threads.emplace_back([&, t] {
            const std::string own = "own" + std::to_string(t);
            for (int round = 0; round < 30; ++round) {
                const auto record =
                    std::make_shared<ZORMetadata>(mobile, UUID::random(), application, own, nullptr, ContainerPlace());
                wrong += !cache().addContainerMetadata(
                    record, mobile, ContainerPlace(world.url(applications + "/" + uuidNumber(t))), false);
                const auto found = find(own);
                wrong += !found || found->get() != record.get();
                wrong += !find("shared" + std::to_string(round));
                if (round % 10 == t)
                    wrong += cache().allContainersForUser(mobile, application, false)->size() < 301;
                wrong += !cache().removeContainerForUser(mobile, application, &own, false);
                wrong += find(own).has_value();
            }
        });
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_EQ(wrong, 0);
    EXPECT_EQ(cache().counts().records, 300U);
}

} // namespace
} // namespace zor::test
