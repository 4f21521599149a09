// SPDX-License-Identifier: Apache-2.0
// The container cache: built once, in the directory's order, by one thread or two; what it answers when the disk is not
// as it remembers; readers and writers at once.
#include "support/FewDescriptors.h"
#include "world/World.h"

#include <chrono>
#include <gtest/gtest.h>
#include <map>
#include <random>
#include <unistd.h>

namespace zor::test {
namespace {

using support::hasLine;
using support::LogLine;

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
    std::vector<ZORContainerCache::Record> all() {
        return cache().allContainersForUser(mobile, application, false).value();
    }
    Result<void> add(const ZORContainerCache::Record& record, int name) {
        return cache().addContainerMetadata(record, mobile,
                                            ContainerPlace(world.url(applications + "/" + uuidNumber(name))), false);
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
    EXPECT_EQ(complaintOf(find("b")), "21 Cache: Data/Application: Container Not Found with ID: b");
    EXPECT_FALSE(find("b", asTransient));
    const auto said = world.log.take();
    EXPECT_EQ(linesWith(said, "Rebuilding"),
              (std::vector<std::string>{"Rebuilding container class cache: 501-Data/Application",
                                        "Rebuilding container class cache: 501-Data/Application(transient)"}));
    EXPECT_TRUE(hasLine(said, 7, "containerForUser", "Cache: Data/Application: Found Identifier: a"));
    EXPECT_TRUE(linesWith(said, "Not Found").empty());
    cache().dropAll();
    EXPECT_TRUE(find("b"));
}

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

// Goal: what is not valid stays out and is said, in the directory's order. Method: every tenth of many is bad.
TEST_F(Cache, InvalidEntriesStayOut) {
    constexpr int count = 400;
    for (int i = 0; i < count; ++i) {
        put(applications, i, "id" + std::to_string(i), i);
        if (i % 10 == 0)
            world.write(applications + "/" + uuidNumber(i) + "/" + names::metadataFile, "nonsense");
    }
    world.putContainer(applications + "/" + uuidNumber(count), metadataOf(4, mobile, "other-class"));
    world.write(applications + "/plain-file", "x");
    std::vector<std::string> expected;
    for (const FileURL& item : listing())
        if (!item.isDirectory() || world.read(applications + "/" + std::string(item.lastPathComponent()) + "/" +
                                              names::metadataFile) == "nonsense")
            expected.push_back("Failed to read metadata at URL " + item.path());
    world.log.take();
    EXPECT_EQ(all().size(), 360U);
    std::vector<std::string> said;
    for (const std::string& message : world.complaints("readAndValidateMetadataAtUrl"))
        if (message.starts_with("Failed to read"))
            said.push_back(message.substr(0, message.find(" (")));
    EXPECT_EQ(said, expected);
    EXPECT_EQ(codeOf(find("other-class")), ErrorCode::notFound);
}

// Goal: a record whose file is gone is an error, not forgotten. Method: the file moved away, linked, put back.
TEST_F(Cache, AContainerWithoutItsFileIsInconsistent) {
    put(applications, 1, "a", 11);
    put(applications, 2, "b", 12);
    ASSERT_TRUE(find("a"));
    const std::string file = world.path(applications + "/" + uuidNumber(1) + "/" + names::metadataFile);
    const std::string aside = world.path("aside");
    ASSERT_EQ(::rename(file.c_str(), aside.c_str()), 0);
    const std::string message = "Cache: Data/Application: INCONSISTENT-No Metadata at: " + file;
    for (const bool linked : {false, true}) {
        if (linked) {
            ASSERT_EQ(::symlink(aside.c_str(), file.c_str()), 0);
        }
        world.log.take();
        EXPECT_EQ(complaintOf(find("a")), "44 " + message);
        ASSERT_EQ(all().size(), 1U);
        EXPECT_EQ(all()[0]->identifier(), "b");
        const auto said = world.log.take();
        EXPECT_TRUE(hasLine(said, 3, "containerForUser", message));
        EXPECT_TRUE(hasLine(said, 3, "allContainersForUser", message));
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

// Goal: a container that cannot be looked at for want of descriptors is not taken for absent. Method: a known one,
// asked for in each way while none is left.
TEST_F(Cache, AShortageOfDescriptorsIsNoAbsence) {
    put(applications, 1, "a", 11);
    ASSERT_EQ(all().size(), 1U);
    const std::string identifier = "a";
    const support::FewDescriptors few(0);
    EXPECT_FALSE(cache().allContainersForUser(mobile, application, false));
    EXPECT_FALSE(cache().containerForUser(mobile, application, &identifier, std::string_view(uuidNumber(11))));
}

// Goal: an addition builds the cache and replaces; a lost place is said. Method: one added over one on disk.
TEST_F(Cache, AddingBuildsFirstAndReplaces) {
    put(applications, 1, "a", 11);
    put(applications, 2, "b", 12);
    put(applications, 3, "elsewhere", 13);
    const std::string identifier = "a";
    const auto record = std::make_shared<ZORMetadata>(mobile, *UUID::parse(uuidNumber(13)), application, identifier,
                                                      nullptr, ContainerPlace());
    ASSERT_TRUE(add(record, 3));
    EXPECT_EQ(find("a")->get(), record.get());
    EXPECT_EQ(record->url(), world.url(applications + "/" + uuidNumber(3)));
    EXPECT_TRUE(find("b"));
    for (int i = 0; i < 2; ++i)
        EXPECT_TRUE(cache().removeContainerForUser(mobile, application, &identifier, false));
    EXPECT_EQ(codeOf(find("a")), ErrorCode::notFound);
    const auto said = world.log.take();
    EXPECT_EQ(linesWith(said, "Added"), (std::vector<std::string>{"Cache: Data/Application: Added Identifier: a"}));
    EXPECT_EQ(linesWith(said, "Removed").size(), 2U);
    (*find("b"))->setPlace({});
    EXPECT_EQ(complaintOf(find("b")), "47 Cache: Data/Application: Invalid URL path string: (null)");
    world.log.take();
    EXPECT_EQ(all().size(), 1U);
    EXPECT_TRUE(hasLine(world.log.take(), 3, "allContainersForUser", "Cache: Data/Application: nil URL from (null)"));
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
