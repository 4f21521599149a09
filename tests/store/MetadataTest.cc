// SPDX-License-Identifier: Apache-2.0
// The metadata file: every way in which one is refused, what is accepted all the same, and what is written.
#include "store/ZORMetadata.h"
#include "world/World.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

namespace zor::test {
namespace {

using plist::Array;
using plist::Dictionary;
using plist::Value;

const std::string container = applications + "/X";
const std::string metadataPath = container + "/" + names::metadataFile;

class Metadata : public testing::Test {
protected:
    Result<std::shared_ptr<ZORMetadata>> read(std::uint32_t userId = mobile,
                                              CheckClassPath checkClassPath = CheckClassPath::yes) {
        return readAndValidateMetadataAtUrl(world.services().log(), world.services().defaultManager(),
                                            world.url(container), userId, checkClassPath);
    }
    static Dictionary good() { return metadataOf(2, mobile, "com.example.app"); }
    World world;
};

// Goal: the first failing step decides, with its own words. Method: one change to a good file a row.
TEST_F(Metadata, RefusesByTheFirstFailingStep) {
    struct Row {
        const char* key;
        std::optional<Value> value; // absent: the key is
        std::string message;
    };
    const std::string at = " at " + world.path(container);
    const Value tooLong(std::string(1025, 'i'));
    const auto shown = [](const Value& value) { return plist::describe(&value); };
    const Row rows[] = {
        {"ZORMetadataPersona", 502, "Incorrect UserId: 502, expecting: 501" + at},
        {"ZORMetadataPersona", -1, "Incorrect UserId: -1, expecting: 501" + at},
        {"ZORMetadataPersona", "502 \"", "Incorrect UserId: 502 \", expecting: 501" + at},
        {"ZORMetadataIdentifier", {}, "Invalid metadata Identifier: (null)" + at},
        {"ZORMetadataIdentifier", 5, "Invalid metadata Identifier: 5" + at},
        {"ZORMetadataIdentifier", tooLong, "Invalid metadata Identifier: " + shown(tooLong) + at},
        {"ZORMetadataUUID", {}, "Invalid metadata UUID String: (null)" + at},
        {"ZORMetadataUUID", 5, "Invalid metadata UUID String: 5" + at},
        {"ZORMetadataUUID", "nonsense", "Invalid metadata UUID: nonsense" + at},
        {"ZORMetadataUUID", "{0000000-0000-4000-8000-000000000001}",
         "Invalid metadata UUID: {0000000-0000-4000-8000-000000000001}" + at},
        {"ZORMetadataContentClass", {}, "Invalid metadata Class: (null)" + at},
        {"ZORMetadataContentClass", 0, "Invalid metadata Content Class: 0" + at},
        {"ZORMetadataContentClass", 14, "Invalid metadata Content Class: 14" + at},
        {"ZORMetadataContentClass", std::int64_t{4294967298}, "Invalid metadata Content Class: 4294967298" + at},
        {"ZORMetadataContentClass", -1, "Invalid metadata Content Class: -1" + at},
        {"ZORMetadataInfo", true, "Invalid metadata Info: " + shown(true) + at},
        {"ZORMetadataInfo", Array{}, "Invalid metadata Info: " + shown(Array{}) + at},
        {"ZORMetadataContentClass", 4,
         "Invalid metadata-URLs should match: " + world.path(container) + " : " + world.path(mobileContainers) +
             "/Data/KolvexPlugin"},
        {"", {}, "Incorrect UserId: 33, expecting: 501" + at},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.message);
        Dictionary content = good();
        content.erase(row.key);
        if (row.value)
            content.set(row.key, *row.value);
        else if (*row.key == '\0')
            content = {{"ZORMetadataPersona", 33}, {"ZORMetadataInfo", 1}};
        world.putContainer(container, content);
        EXPECT_EQ(complaintOf(read()), "29 " + row.message);
        const auto said = world.log.take();
        ASSERT_EQ(said.size(), 1U);
        EXPECT_TRUE(support::hasLine(said, 3, "readAndValidateMetadataAtUrl", row.message)) << said[0];
    }
}

// Goal: only a file that the daemon itself can have written counts. Method: what an owner can put in its place.
TEST_F(Metadata, HostileFilesReadAsUnreadable) {
    const std::string bytes = binary(good());
    const std::string file = world.path(metadataPath);
    const std::string elsewhere = world.path("elsewhere");
    world.makeDirectories(container);
    world.write("elsewhere", bytes);
    const std::function<void()> hostile[] = {
        [] {}, // none at all
        [&] { ASSERT_EQ(::symlink(elsewhere.c_str(), file.c_str()), 0); },
        [&] { ASSERT_EQ(::link(elsewhere.c_str(), file.c_str()), 0); },
        [&] { ASSERT_EQ(::mkfifo(file.c_str(), 0644), 0); },
        [&] { ASSERT_EQ(::mkdir(file.c_str(), 0755), 0); },
        [&] { world.write(metadataPath, bytes, 0664); },
        [&] { world.write(metadataPath, bytes, 0646); },
        [&] { world.write(metadataPath, bytes + std::string(1 << 20, '\0')); },
        [&] { world.write(metadataPath, "nonsense"); },
        [&] { world.write(metadataPath, binary(Array{1})); },
    };
    for (const auto& make : hostile) {
        SCOPED_TRACE(&make - hostile);
        make();
        EXPECT_EQ(complaintOf(read()), "12 Failed to read metadata at URL " + world.path(container));
        EXPECT_EQ(world.log.take().size(), 1U);
        ASSERT_TRUE(::remove(file.c_str()) == 0 || errno == ENOENT);
    }
    world.write(metadataPath, bytes);
    EXPECT_TRUE(read());
    if (::geteuid() == 0) {
        ASSERT_EQ(::chown(file.c_str(), mobile, mobile), 0);
        EXPECT_EQ(codeOf(read()), ErrorCode::metadataUnreadable);
        ASSERT_EQ(::chown(file.c_str(), 0, 0), 0);
    }
    // The whole container behind a link.
    ASSERT_EQ(::rename(world.path(container).c_str(), world.path("moved").c_str()), 0);
    ASSERT_EQ(::symlink(world.path("moved").c_str(), world.path(container).c_str()), 0);
    EXPECT_FALSE(read());
    if (::geteuid() != 0)
        GTEST_SKIP() << "its owner's own file needs root";
}

// Goal: no persona means whoever asks; the class path counts only where asked. Method: one file of both.
TEST_F(Metadata, WhatIsAcceptedAllTheSame) {
    Dictionary content = good();
    content.erase("ZORMetadataPersona");
    content.set("ZORMetadataContentClass", 4);
    world.putContainer(container, content);
    for (const std::uint32_t userId : {mobile, second}) {
        const auto record = read(userId, CheckClassPath::no);
        ASSERT_TRUE(record);
        EXPECT_EQ((*record)->uid(), userId);
        EXPECT_EQ((*record)->containerClass(), ContainerClass::dataKolvexPlugin);
        EXPECT_EQ((*record)->info(), nullptr);
        EXPECT_FALSE((*record)->transient() || (*record)->existed());
        EXPECT_EQ((*record)->url(), world.url(container));
    }
}

// Goal: any form is read, one is written, or the file before it stays. Method: XML read, written back, refused.
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
    EXPECT_TRUE(world.item(metadataPath).starts_with("file 0644 " + std::to_string(::geteuid())));
    Dictionary expected = metadataOf(2, mobile, "com.example.app", "ABCDEF00-0000-4000-8000-00000000000A");
    EXPECT_EQ(world.readDictionary(metadataPath), expected);
    expected.set("ZORMetadataInfo", Dictionary{{"CrashCounter", 3}});
    (*record)->setInfo(std::make_shared<const Dictionary>(Dictionary{{"CrashCounter", 3}}));
    ASSERT_TRUE(write());
    EXPECT_EQ(world.readDictionary(metadataPath), expected);

    (*record)->setInfo(nullptr);
    world.refuse(support::DiskCall::write, ENOSPC);
    const auto failed = write();
    EXPECT_EQ(complaintOf(failed), "34 Failed to write metadata dictionary to URL " + world.path(container));
    ASSERT_NE(failed.error().underlying(), nullptr);
    EXPECT_TRUE(failed.error().underlying()->isPosix(ENOSPC));
    EXPECT_EQ(world.readDictionary(metadataPath), expected);
    EXPECT_EQ(world.names(container).size(), 1U);
}

// Goal: a place keeps any name exactly, whether it looks like a UUID or not. Method: forms next to the canonical one.
TEST(ContainerPlace, KeepsItsName) {
    for (const char* name : {"00000000-0000-4000-8000-00000000000A", "00000000-0000-4000-8000-00000000000a",
                             "com.veltra.settingsd", "0", "00000000-0000-4000-8000-00000000000AB"}) {
        const ContainerPlace place(FileURL::directory(std::string("/base/") + name));
        EXPECT_EQ(place.name(), name);
        EXPECT_EQ(place.url(), FileURL::directory(std::string("/base/") + name));
    }
}

} // namespace
} // namespace zor::test
