// SPDX-License-Identifier: Apache-2.0
// The metadata file: every way in which one is refused, what is accepted all the same, and what is written.
#include "store/ZORMetadata.h"
#include "world/World.h"

#include <gtest/gtest.h>
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
    Result<std::shared_ptr<ZORMetadata>> read() {
        return readAndValidateMetadataAtUrl(world.services().log(), world.services().defaultManager(),
                                            world.url(container), mobile, CheckClassPath::yes);
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

// Goal: any form is read, one is written. Method: XML read and written back.
TEST_F(Metadata, IsWrittenInOneForm) {
    world.makeDirectories(container);
    world.write(metadataPath, "<?xml version=\"1.0\"?><plist version=\"1.0\"><dict>"
                              "<key>ZORMetadataContentClass</key><integer>2</integer>"
                              "<key>ZORMetadataIdentifier</key><string>com.example.app</string>"
                              "<key>ZORMetadataUUID</key><string>abcdef00-0000-4000-8000-00000000000a</string>"
                              "<key>Unknown</key><string>dropped</string></dict></plist>");
    const auto record = read(); // without a persona it is of whoever asks
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
}

} // namespace
} // namespace zor::test
