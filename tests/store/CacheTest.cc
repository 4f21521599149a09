// SPDX-License-Identifier: Apache-2.0
// The container cache: built once, in the directory's order, by one thread or two; what it answers when the disk is not
// as it remembers; readers and writers at once.
#include "world/World.h"

#include <chrono>
#include <gtest/gtest.h>
#include <map>
#include <random>
#include <unistd.h>

namespace zor::test {
namespace {

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
    World world{{.probe = throwingProbe}};
    ZORContainerCache& cache() { return world.services().cache(); }
    /// A container of the identifier, in a directory and with an internal UUID made of the numbers.
    void put(const std::string& directory, int name, const std::string& identifier, int uuid) const {
        world.putContainer(directory + "/" + uuidNumber(name), metadataOf(2, mobile, identifier, uuidNumber(uuid)));
    }
    Result<ZORContainerCache::Record> find(const std::string& identifier, bool transient = false) {
        return cache().containerForUser(mobile, application, &identifier, transient);
    }
    std::vector<ZORContainerCache::Record> all() {
        return cache().allContainersForUser(mobile, application, false).value();
    }
    std::vector<FileURL> listing() {
        return world.services().defaultManager().urlsForItemsInDirectoryAtURL(world.url(applications)).value();
    }
};

// Goal: of two with one identifier the later listed counts. Method: few entries (one thread) and many (two).
TEST_F(Cache, TheLaterListedCounts) {
    for (const int count : {8, 1000}) {
        cache().dropAll();
        std::mt19937 random(7);
        std::map<std::string, std::string> identifierOf;
        for (int i = count * 10; i < count * 11; ++i) {
            const std::string identifier = "id" + std::to_string(random() % static_cast<unsigned>(count / 2));
            put(applications, i, identifier, i);
            identifierOf[uuidNumber(i)] = identifier;
        }
        std::map<std::string, std::string> expected;
        for (const FileURL& item : listing())
            expected[identifierOf[std::string(item.lastPathComponent())]] = item.lastPathComponent();
        std::map<std::string, std::string> found;
        for (const auto& record : all()) {
            found[record->identifier()] = record->uuid().string();
            EXPECT_EQ(record->url(), world.url(applications + "/" + record->uuid().string()));
        }
        EXPECT_EQ(found, expected) << count;
        ASSERT_TRUE(world.services().defaultManager().removeItemAtURL(world.url(applications)));
    }
}

// Goal: what is not valid stays out, and each is said. Method: every tenth of many is bad.
TEST_F(Cache, InvalidEntriesStayOut) {
    constexpr int count = 400;
    for (int i = 0; i < count; ++i) {
        put(applications, i, "id" + std::to_string(i), i);
        if (i % 10 == 0)
            world.write(applications + "/" + uuidNumber(i) + "/" + names::metadataFile, "nonsense");
    }
    world.putContainer(applications + "/" + uuidNumber(count), metadataOf(4, mobile, "other-class"));
    world.write(applications + "/plain-file", "x");
    EXPECT_EQ(all().size(), 360U);
    EXPECT_EQ(world.complaints("readAndValidateMetadataAtUrl").size(), 42U);
    EXPECT_EQ(codeOf(find("other-class")), ErrorCode::notFound);
}

// Goal: a record whose file is gone is an error, not forgotten, and no second one is made. Method: the file moved away,
// linked, put back.
TEST_F(Cache, AContainerWithoutItsFileIsInconsistent) {
    put(applications, 1, "a", 11);
    put(applications, 2, "b", 12);
    ASSERT_TRUE(find("a"));
    const std::string file = world.path(applications + "/" + uuidNumber(1) + "/" + names::metadataFile);
    const std::string aside = world.path("aside");
    ASSERT_EQ(::rename(file.c_str(), aside.c_str()), 0);
    for (const bool linked : {false, true}) {
        if (linked) {
            ASSERT_EQ(::symlink(aside.c_str(), file.c_str()), 0);
        }
        EXPECT_EQ(codeOf(find("a")), ErrorCode::cachedContainerWithoutMetadata);
        EXPECT_EQ(codeOf(world.create("a")), ErrorCode::cachedContainerWithoutMetadata);
        ASSERT_EQ(all().size(), 1U);
        EXPECT_EQ(all()[0]->identifier(), "b");
        EXPECT_EQ(cache().counts().records, 2U);
    }
    ASSERT_EQ(::rename(aside.c_str(), file.c_str()), 0);
    EXPECT_TRUE(find("a"));
}

// Goal: a container that was moved by hand is found at its new place, others' records stay as they are, and looking
// over is bounded. Method: two moves in a row, then one after the pause.
TEST_F(Cache, AContainerThatWasMovedByHandIsFoundAgain) {
    put(applications, 1, "a", 11);
    put(applications, 2, "b", 12);
    const auto other = find("b");
    ASSERT_TRUE(find("a") && other);
    const auto moveTo = [&](int from, int to) {
        ASSERT_EQ(::rename(world.path(applications + "/" + uuidNumber(from)).c_str(),
                           world.path(applications + "/" + uuidNumber(to)).c_str()),
                  0);
    };
    moveTo(1, 3);
    const auto found = find("a");
    ASSERT_TRUE(found);
    EXPECT_EQ((*found)->url(), world.url(applications + "/" + uuidNumber(3)));
    EXPECT_EQ(find("b")->get(), other->get());
    moveTo(3, 4);
    EXPECT_EQ(codeOf(find("a")), ErrorCode::cachedContainerWithoutMetadata);
    std::this_thread::sleep_for(std::chrono::milliseconds(1'100));
    EXPECT_TRUE(find("a"));
}

TEST_F(Cache, FindsByUUIDLiveBeforeTransient) {
    const std::string hex = "ABCDEF00-0000-4000-8000-00000000000A";
    put(applications, 1, "both", 11);
    put(transients, 2, "both", 11);
    put(transients, 3, "temp", 12);
    world.putContainer(applications + "/" + uuidNumber(4), metadataOf(2, mobile, "hex", hex));
    const auto find = [&](const std::string& identifier, const std::string& uuid) {
        return cache().containerForUser(mobile, application, &identifier, std::string_view(uuid)).value();
    };
    const auto both = find("both", uuidNumber(11));
    ASSERT_TRUE(both);
    EXPECT_FALSE(both->transient());
    EXPECT_EQ(both->url(), world.url(applications + "/" + uuidNumber(1)));
    const auto temp = find("temp", uuidNumber(12));
    EXPECT_TRUE(temp && temp->transient());
    EXPECT_EQ(find("both", uuidNumber(12)), nullptr);
    EXPECT_EQ(find("missing", uuidNumber(11)), nullptr);
    EXPECT_NE(find("hex", hex), nullptr);
    EXPECT_EQ(find("hex", "abcdef00-0000-4000-8000-00000000000a"), nullptr);
}

// Goal: a class directory swapped for a link leads nowhere. Method: swapped before the cache is built, and after.
TEST_F(Cache, AClassDirectorySwappedForALink) {
    put(applications, 1, "a", 11);
    const std::string bait = "private/var/second/Data/Application";
    put(bait, 2, "bait", 12);
    const std::string at = world.path(applications);
    const std::string aside = world.path("aside");
    const auto swapIn = [&] {
        ASSERT_EQ(::rename(at.c_str(), aside.c_str()), 0);
        ASSERT_EQ(::symlink(world.path(bait).c_str(), at.c_str()), 0);
    };
    const auto swapOut = [&] {
        ASSERT_EQ(::unlink(at.c_str()), 0);
        ASSERT_EQ(::rename(aside.c_str(), at.c_str()), 0);
    };
    swapIn();
    EXPECT_EQ(codeOf(find("bait")), ErrorCode::cacheNotRebuilt);
    EXPECT_EQ(cache().counts().classCaches, 0U);
    swapOut();
    ASSERT_TRUE(find("a"));
    swapIn();
    EXPECT_EQ(codeOf(find("a")), ErrorCode::cachedContainerWithoutMetadata);
    EXPECT_EQ(codeOf(find("bait")), ErrorCode::notFound);
    swapOut();
    EXPECT_TRUE(find("a"));
}

TEST_F(Cache, AnExceptionEndsAtTheOperationAndReleasesTheLock) {
    put(applications, 1, "a", 11);
    probeThrows = true;
    EXPECT_EQ(codeOf(find("a")), ErrorCode::exceptionCaught);
    EXPECT_TRUE(find("a"));
}

} // namespace
} // namespace zor::test
