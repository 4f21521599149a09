// SPDX-License-Identifier: Apache-2.0
// The metadata file: every way in which one is refused, what is accepted all the same, and what is written.
#include "plist/Read.h"
#include "store/ZORMetadata.h"
#include "world/World.h"

#include <functional>
#include <gtest/gtest.h>
#include <sys/sysmacros.h>
#include <unistd.h>

namespace zor::test {
namespace {

using plist::Array;
using plist::Dictionary;
using plist::Value;

const std::string container = std::string(mobileContainers) + "/Data/Application/X";
const std::string metadataPath = container + "/" + names::metadataFile;

class Metadata : public testing::Test {
protected:
    Result<std::shared_ptr<ZORMetadata>> read(std::uint32_t userId = mobile,
                                              CheckClassPath checkClassPath = CheckClassPath::yes) {
        return readAndValidateMetadataAtUrl(world.services().log(), world.services().defaultManager(),
                                            world.url(container), userId, checkClassPath);
    }
    [[nodiscard]] Dictionary onDisk() const {
        const std::string bytes = world.read(metadataPath);
        const auto value = plist::readPropertyList({reinterpret_cast<const std::uint8_t*>(bytes.data()), bytes.size()});
        return value && value->asDictionary() ? *value->asDictionary() : Dictionary();
    }
    static Dictionary good() { return metadataOf(2, mobile, "com.example.app"); }
    World world;
};

// Goal: the first failing step decides, with its own words. Method: one change to a good file for each row; the last
// row fails every step at once.
TEST_F(Metadata, RefusesByTheFirstFailingStep) {
    struct Row {
        std::string name;
        std::function<void(Dictionary&)> change;
        ErrorCode code;
        std::string message; // @ stands for the container's path
    };
    const auto set = [](const char* key, Value value) { return [=](Dictionary& content) { content.set(key, value); }; };
    const auto drop = [](const char* key) { return [=](Dictionary& content) { content.erase(key); }; };
    constexpr auto invalid = ErrorCode::metadataInvalid;
    const std::string applications = world.path(mobileContainers);
    const Row rows[] = {
        {"persona", set("ZORMetadataPersona", 502), invalid, "Incorrect UserId: 502, expecting: 501 at @"},
        {"persona -1", set("ZORMetadataPersona", -1), invalid, "Incorrect UserId: -1, expecting: 501 at @"},
        {"no identifier", drop("ZORMetadataIdentifier"), invalid, "Invalid metadata Identifier: (null) at @"},
        {"identifier 5", set("ZORMetadataIdentifier", 5), invalid, "Invalid metadata Identifier: 5 at @"},
        {"no UUID", drop("ZORMetadataUUID"), invalid, "Invalid metadata UUID String: (null) at @"},
        {"UUID 5", set("ZORMetadataUUID", 5), invalid, "Invalid metadata UUID String: 5 at @"},
        {"bad UUID", set("ZORMetadataUUID", "nonsense"), invalid, "Invalid metadata UUID: nonsense at @"},
        {"UUID in braces", set("ZORMetadataUUID", "{0000000-0000-4000-8000-000000000001}"), invalid,
         "Invalid metadata UUID: {0000000-0000-4000-8000-000000000001} at @"},
        {"no class", drop("ZORMetadataContentClass"), invalid, "Invalid metadata Class: (null) at @"},
        {"class 0", set("ZORMetadataContentClass", 0), invalid, "Invalid metadata Content Class: 0 at @"},
        {"class 14", set("ZORMetadataContentClass", 14), invalid, "Invalid metadata Content Class: 14 at @"},
        {"class 2^32+2", set("ZORMetadataContentClass", std::int64_t{4294967298}), invalid,
         "Invalid metadata Content Class: 4294967298 at @"},
        {"class -1", set("ZORMetadataContentClass", -1), invalid, "Invalid metadata Content Class: -1 at @"},
        {"info true", set("ZORMetadataInfo", true), invalid,
         "Invalid metadata Info: " + plist::describe(std::make_unique<Value>(true).get()) + " at @"},
        {"info array", set("ZORMetadataInfo", Array{}), invalid,
         "Invalid metadata Info: " + plist::describe(std::make_unique<Value>(Array{}).get()) + " at @"},
        {"other class", set("ZORMetadataContentClass", 4), invalid,
         "Invalid metadata-URLs should match: @ : " + applications + "/Data/KolvexPlugin"},
        {"all wrong", [](Dictionary& content) { content = {{"ZORMetadataPersona", 33}, {"ZORMetadataInfo", 1}}; },
         invalid, "Incorrect UserId: 33, expecting: 501 at @"},
    };
    for (const Row& row : rows) {
        Dictionary content = good();
        row.change(content);
        world.putContainer(container, content);
        const auto refused = read();
        ASSERT_FALSE(refused) << row.name;
        EXPECT_TRUE(refused.error().is(row.code)) << row.name;
        std::string expected = row.message;
        expected.replace(expected.find('@'), 1, world.path(container));
        EXPECT_EQ(refused.error().description(), expected) << row.name;
        const auto said = world.log.take();
        ASSERT_EQ(said.size(), 1U) << row.name;
        EXPECT_TRUE(support::hasLine(said, 3, "readAndValidateMetadataAtUrl", expected)) << said[0];
    }
}

// Goal: only a file that the daemon itself can have written counts. Method: what a container's owner can put in its
// place, with good content where it has content; each must be answered at once with 12.
TEST_F(Metadata, HostileFilesReadAsUnreadable) {
    const std::string bytes = binary(good());
    const std::string file = world.path(metadataPath);
    world.makeDirectories(container);
    world.write("elsewhere", bytes);
    struct Row {
        const char* name;
        std::function<void()> make;
        bool needsRoot = false;
    };
    const Row rows[] = {
        {"missing", [] {}},
        {"symbolic link", [&] { ASSERT_EQ(::symlink(world.path("elsewhere").c_str(), file.c_str()), 0); }},
        {"FIFO", [&] { ASSERT_EQ(::mkfifo(file.c_str(), 0644), 0); }},
        {"directory", [&] { ASSERT_EQ(::mkdir(file.c_str(), 0755), 0); }},
        {"two links", [&] { ASSERT_EQ(::link(world.path("elsewhere").c_str(), file.c_str()), 0); }},
        {"group-writable", [&] { world.write(metadataPath, bytes, 0664); }},
        {"writable by others", [&] { world.write(metadataPath, bytes, 0646); }},
        {"over 1 MiB", [&] { world.write(metadataPath, bytes + std::string(1 << 20, '\0')); }},
        {"no property list", [&] { world.write(metadataPath, "nonsense"); }},
        {"array", [&] { world.write(metadataPath, binary(Array{1})); }},
        {"device", [&] { ASSERT_EQ(::mknod(file.c_str(), S_IFCHR | 0644, makedev(1, 5)), 0); }, true},
        {"owner's own file",
         [&] {
             world.write(metadataPath, bytes);
             ASSERT_EQ(::chown(file.c_str(), mobile, mobile), 0);
         },
         true},
    };
    for (const Row& row : rows) {
        if (row.needsRoot && ::geteuid() != 0)
            continue;
        row.make();
        const auto refused = read();
        ASSERT_FALSE(refused) << row.name;
        EXPECT_TRUE(refused.error().is(ErrorCode::metadataUnreadable)) << row.name;
        EXPECT_EQ(refused.error().description(), "Failed to read metadata at URL " + world.path(container));
        EXPECT_EQ(world.log.take().size(), 1U) << row.name;
        ASSERT_EQ(::remove(file.c_str()) == 0 || errno == ENOENT, true);
    }
    world.write(metadataPath, bytes);
    EXPECT_TRUE(read());
    // The whole container behind a link.
    ASSERT_EQ(::rename(world.path(container).c_str(), world.path("moved").c_str()), 0);
    ASSERT_EQ(::symlink(world.path("moved").c_str(), world.path(container).c_str()), 0);
    EXPECT_FALSE(read());
}

TEST_F(Metadata, AFileWithoutAPersonaBelongsToWhoeverAsks) {
    Dictionary content = good();
    content.erase("ZORMetadataPersona");
    world.putContainer(container, content);
    for (const std::uint32_t userId : {mobile, second}) {
        const auto record = read(userId);
        ASSERT_TRUE(record);
        EXPECT_EQ((*record)->uid(), userId);
        EXPECT_EQ((*record)->info(), nullptr);
        EXPECT_FALSE((*record)->transient() || (*record)->existed());
        EXPECT_EQ((*record)->url(), world.url(container));
    }
}

TEST_F(Metadata, TheClassPathIsCheckedOnlyWhereAsked) {
    Dictionary content = good();
    content.set("ZORMetadataContentClass", 4);
    world.putContainer(container, content);
    const auto record = read(mobile, CheckClassPath::no);
    ASSERT_TRUE(record);
    EXPECT_EQ((*record)->containerClass(), ContainerClass::dataKolvexPlugin);
}

// Goal: any form is read, one form is written: binary, upper-case UUID, info only when there is some, 0644. Method: an
// XML file with a lower-case UUID, read and written back.
TEST_F(Metadata, IsWrittenInOneForm) {
    world.makeDirectories(container);
    world.write(metadataPath, "<?xml version=\"1.0\"?><plist version=\"1.0\"><dict>"
                              "<key>ZORMetadataContentClass</key><integer>2</integer>"
                              "<key>ZORMetadataPersona</key><integer>501</integer>"
                              "<key>ZORMetadataIdentifier</key><string>com.example.app</string>"
                              "<key>ZORMetadataUUID</key><string>abcdef00-0000-4000-8000-00000000000a</string>"
                              "<key>Unknown</key><string>dropped</string></dict></plist>");
    const auto record = read();
    ASSERT_TRUE(record) << record.error().text();
    const auto write = [&] {
        return (*record)->writeMetadataToDiskWithError(world.services().log(), world.services().defaultManager());
    };
    ASSERT_TRUE(write());
    EXPECT_TRUE(world.read(metadataPath).starts_with("bplist00"));
    EXPECT_EQ(world.item(metadataPath), ::geteuid() == 0 ? "file 0644 0:0" : world.item(metadataPath));
    EXPECT_EQ(onDisk(), metadataOf(2, mobile, "com.example.app", "ABCDEF00-0000-4000-8000-00000000000A"));
    const Dictionary info{{"CrashCounter", 3}};
    (*record)->setInfo(std::make_shared<const Dictionary>(info));
    ASSERT_TRUE(write());
    Dictionary expected = metadataOf(2, mobile, "com.example.app", "ABCDEF00-0000-4000-8000-00000000000A");
    expected.set("ZORMetadataInfo", info);
    EXPECT_EQ(onDisk(), expected);

    // A write that fails leaves the file before it.
    (*record)->setInfo(nullptr);
    world.disk().arm({.error = ENOSPC, .filter = [](const support::DiskCallInfo& call) {
                          return call.call == support::DiskCall::write;
                      }});
    const auto failed = write();
    world.disk().disarm();
    ASSERT_FALSE(failed);
    EXPECT_TRUE(failed.error().is(ErrorCode::propertyListNotWritten));
    EXPECT_EQ(failed.error().description(), "Failed to write metadata dictionary to URL " + world.path(container));
    ASSERT_NE(failed.error().underlying(), nullptr);
    EXPECT_TRUE(failed.error().underlying()->isPosix(ENOSPC));
    EXPECT_EQ(onDisk(), expected);
    EXPECT_EQ(world.names(container).size(), 1U);
}

// Goal: a place keeps any name exactly, whether it looks like a UUID or not. Method: forms next to the canonical one.
TEST(ContainerPlace, KeepsItsName) {
    for (const char* name : {"00000000-0000-4000-8000-00000000000A", "00000000-0000-4000-8000-00000000000a",
                             "com.veltra.settingsd", "0", "00000000-0000-4000-8000-00000000000AB"}) {
        const ContainerPlace place(FileURL::directory(std::string("/base/") + name));
        EXPECT_EQ(place.name(), name);
        EXPECT_EQ(place.parentPath(), "/base");
        EXPECT_EQ(place.url(), FileURL::directory(std::string("/base/") + name));
    }
    EXPECT_TRUE(ContainerPlace().empty());
}

} // namespace
} // namespace zor::test
