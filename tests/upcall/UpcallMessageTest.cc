// SPDX-License-Identifier: Apache-2.0
#include "upcall/ProcessContainersReply.h"
#include "upcall/UpcallWorld.h"

#include <gtest/gtest.h>

namespace zor::test {
namespace {

using namespace upcall;

ProcessContainers goldenContainers() {
    const std::string data = "/private/var/mobile/Containers/Data/Application/9985179A";
    return {.homeDirectory = "/private/var/mobile",
            .dataContainer = data,
            .temporaryDirectory = data + "/tmp",
            .appGroups = {{{"group.a", "/private/var/mobile/Containers/Shared/AppGroup/0B"}}},
            .systemContainer = std::nullopt,
            .systemGroups = {{{"sg", "/private/var/containers/Shared/SystemGroup/7F"}}}};
}

// Goal: both sides of the upcall write, and read, exactly the bytes of the golden packets. Method: each golden file
// made by the side that sends it, and read by the side that gets it.
TEST(UpcallMessage, IsTheGoldenOne) {
    const ByteVector request = golden("request.hex");
    Items items;
    items.string(CM_KERN_REQUEST_CONTAINER_ID, "com.example.app").number(CM_KERN_REQUEST_PERSONA_ID, 501);
    items.string(CM_KERN_REQUEST_APP_GROUP_ID, "group.a").string(CM_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID, "sg");
    EXPECT_EQ(toHex(items.packet()), toHex(request));
    const auto buffer = decodeRequest(request);
    ASSERT_TRUE(buffer);
    EXPECT_EQ(toHex(*buffer), toHex(items.buffer()));

    support::RecordingLog lines(logLevelNotice);
    const Log log(lines);
    const PackbuffPointer packbuff(sb_packbuff_new(4096));
    packProcessContainersReply(log, *packbuff, goldenContainers(), true);
    const std::span packed(sb_packbuff_get_bytes(packbuff.get()), sb_packbuff_get_size(packbuff.get()));
    const ByteVector reply = golden("reply.hex");
    EXPECT_EQ(toHex(encodeReply(processContainersMessageId, packed)), toHex(reply));
    const auto read = decodeReply(reply);
    ASSERT_TRUE(read);
    EXPECT_EQ(read->returnCode, ReturnCode::success);
    EXPECT_EQ(toHex(read->buffer), toHex(packed));

    const ByteVector refusal = golden("refusal.hex");
    EXPECT_EQ(toHex(encodeErrorReply(processContainersMessageId, ReturnCode::refused)), toHex(refusal));
    const auto refused = decodeReply(refusal);
    ASSERT_TRUE(refused);
    EXPECT_EQ(refused->returnCode, ReturnCode::refused);
    EXPECT_TRUE(refused->buffer.empty());
}

} // namespace
} // namespace zor::test
