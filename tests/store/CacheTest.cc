// SPDX-License-Identifier: Apache-2.0
// The container cache: built once, in the directory's order, by one thread or two; what it answers when the disk is not
// as it remembers.
#include "world/World.h"

#include <gtest/gtest.h>
#include <random>

namespace zor::test {
namespace {

std::string uuidNumber(int number) {
    char text[40];
    std::snprintf(text, sizeof text, "00000000-0000-4000-8000-%012d", number);
    return text;
}

class Cache : public testing::Test {
protected:
    World world;
    ZORContainerCache& cache() { return world.services().cache(); }
    [[nodiscard]] std::string place(int name) const { return applications + "/" + uuidNumber(name); }
    /// A container of the identifier, in a directory and with an internal UUID of that number.
    void put(int name, const std::string& identifier) const {
        world.putContainer(place(name), metadataOf(2, mobile, identifier, uuidNumber(name)));
    }
    Result<ZORContainerCache::Record> find(const std::string& identifier) {
        return cache().containerForUser(mobile, application, &identifier, false);
    }
    std::vector<ZORContainerCache::Record> all() {
        return cache().allContainersForUser(mobile, application, false).value();
    }
};

// Goal: of two with one identifier the later listed counts, invalid ones stay out, and each of those is said. Method:
// few entries (one thread) and many (two), every tenth of them nonsense.
TEST_F(Cache, TheLaterListedCounts) {
    for (const int count : {10, 1000}) {
        std::mt19937 random(7);
        std::map<std::string, std::string> identifierOf;
        for (int i = count * 10; i < count * 11; ++i) {
            put(i, identifierOf[uuidNumber(i)] = "id" + std::to_string(random() % static_cast<unsigned>(count / 2)));
            if (i % 10 == 0)
                world.write(place(i) + "/" + names::metadataFile, identifierOf[uuidNumber(i)] = "");
        }
        world.putContainer(applications + "/other-class", metadataOf(4, mobile, "other-class"));
        world.write(applications + "/plain-file", "x");
        std::map<std::string, std::string> expected;
        const auto listing = world.services().defaultManager().urlsForItemsInDirectoryAtURL(world.url(applications));
        for (const FileURL& item : listing.value())
            expected[identifierOf[std::string(item.lastPathComponent())]] = item.lastPathComponent();
        expected.erase("");
        std::map<std::string, std::string> found;
        const auto records = all();
        for (const auto& record : records)
            found[record->identifier()] = record->url().lastPathComponent();
        EXPECT_EQ(found, expected) << count;
        EXPECT_EQ(world.complaints("readAndValidateMetadataAtUrl").size(), static_cast<std::size_t>(count / 10 + 2));
        ASSERT_TRUE(world.services().defaultManager().removeItemAtURL(world.url(applications)));
        cache().dropAll();
    }
}

// Goal: a record whose file is gone is an error, not forgotten, and no second one is made. Method: the file moved away,
// linked, put back.
TEST_F(Cache, AContainerWithoutItsFileIsInconsistent) {
    put(1, "a");
    put(2, "b");
    ASSERT_TRUE(find("a"));
    const std::string file = place(1) + "/" + names::metadataFile;
    world.move(file, "aside");
    for (const bool linked : {false, true}) {
        if (linked)
            world.link(world.path("aside"), file);
        EXPECT_EQ(codeOf(world.find("a")), ErrorCode::cachedContainerWithoutMetadata);
        EXPECT_EQ(codeOf(world.create("a")), ErrorCode::cachedContainerWithoutMetadata);
        EXPECT_EQ(all().size(), 1U);
        EXPECT_EQ(cache().counts().records, 2U);
    }
    world.move("aside", file);
    EXPECT_TRUE(find("a"));
}

// Goal: a container that was moved by hand is found at its new place, others' records stay as they are, and looking
// over is bounded. Method: two moves in a row, the first to a name in other letters, then a look after the pause.
TEST_F(Cache, AContainerThatWasMovedByHandIsFoundAgain) {
    put(1, "a");
    put(2, "b");
    const auto other = find("b");
    ASSERT_TRUE(find("a") && other);
    const std::string moved = applications + "/abcdef00-0000-4000-8000-00000000000a";
    world.move(place(1), moved);
    const auto found = find("a");
    ASSERT_TRUE(found);
    EXPECT_EQ((*found)->url(), world.url(moved));
    EXPECT_EQ(find("b")->get(), other->get());
    world.move(moved, place(4));
    EXPECT_EQ(codeOf(find("a")), ErrorCode::cachedContainerWithoutMetadata);
    std::this_thread::sleep_for(std::chrono::milliseconds(1'100));
    EXPECT_TRUE(find("a"));
}

// Goal: a class directory swapped for a link leads nowhere. Method: swapped before the cache is built, and after.
TEST_F(Cache, AClassDirectorySwappedForALink) {
    put(1, "a");
    const std::string bait = "private/var/second/Data/Application";
    world.putContainer(bait + "/" + uuidNumber(2), metadataOf(2, mobile, "bait", uuidNumber(2)));
    for (const bool built : {false, true}) {
        world.move(applications, "aside");
        world.link(world.path(bait), applications);
        EXPECT_EQ(codeOf(world.find("a")),
                  built ? ErrorCode::cachedContainerWithoutMetadata : ErrorCode::cacheNotRebuilt);
        EXPECT_EQ(codeOf(world.find("bait")), built ? ErrorCode::notFound : ErrorCode::cacheNotRebuilt);
        std::filesystem::remove(world.path(applications));
        world.move("aside", applications);
        EXPECT_TRUE(world.find("a"));
    }
}

} // namespace
} // namespace zor::test
