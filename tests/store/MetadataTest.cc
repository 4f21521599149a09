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

// Goal: whatever is not as it must be makes a file invalid, and is said. Method: one change to a good file a row.
TEST_F(Metadata, RefusesWhatIsNotAsItMustBe) {
    const std::optional<Value> absent;
    const std::pair<const char*, std::optional<Value>> rows[] = {
        {"ZORMetadataPersona", 502},         {"ZORMetadataPersona", -1},
        {"ZORMetadataPersona", "502 \""},    {"ZORMetadataIdentifier", absent},
        {"ZORMetadataIdentifier", 5},        {"ZORMetadataIdentifier", std::string(1025, 'i')},
        {"ZORMetadataUUID", absent},         {"ZORMetadataUUID", 5},
        {"ZORMetadataUUID", "nonsense"},     {"ZORMetadataUUID", "{0000000-0000-4000-8000-000000000001}"},
        {"ZORMetadataContentClass", absent}, {"ZORMetadataContentClass", 0},
        {"ZORMetadataContentClass", 14},     {"ZORMetadataContentClass", std::int64_t{4294967298}},
        {"ZORMetadataContentClass", -1},     {"ZORMetadataContentClass", 4}, // in another class's directory
        {"ZORMetadataInfo", true},           {"ZORMetadataInfo", Array{}},
    };
    for (const auto& [key, value] : rows) {
        SCOPED_TRACE(std::string(key) + " " + plist::describe(value ? &*value : nullptr).substr(0, 40));
        Dictionary content = good();
        content.erase(key);
        if (value)
            content.set(key, *value);
        world.putContainer(container, content);
        EXPECT_EQ(codeOf(read()), ErrorCode::metadataInvalid);
        EXPECT_EQ(world.complaints("readAndValidateMetadataAtUrl").size(), 1U);
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
        [&] { world.write(metadataPath, bytes, 0646); },
        [&] { world.write(metadataPath, bytes + std::string(1 << 20, '\0')); },
        [&] { world.write(metadataPath, binary(Array{1})); },
        [&] {
            world.write(metadataPath, bytes);
            ASSERT_TRUE(::geteuid() != 0 || ::chown(file.c_str(), mobile, mobile) == 0);
        },
    };
    for (const auto& make : hostile) {
        SCOPED_TRACE(&make - hostile);
        make();
        EXPECT_EQ(read().has_value(), ::geteuid() != 0 && &make == std::end(hostile) - 1);
        ASSERT_TRUE(::remove(file.c_str()) == 0 || errno == ENOENT);
    }
    world.write(metadataPath, bytes);
    EXPECT_TRUE(read());
    // The whole container behind a link.
    ASSERT_EQ(::rename(world.path(container).c_str(), world.path("moved").c_str()), 0);
    ASSERT_EQ(::symlink(world.path("moved").c_str(), world.path(container).c_str()), 0);
    EXPECT_FALSE(read());
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
    EXPECT_EQ(codeOf(write()), ErrorCode::propertyListNotWritten);
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
