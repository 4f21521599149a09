// SPDX-License-Identifier: Apache-2.0
#include "ipc/Frame.h"
#include "ipc/Identifiers.h"
#include "ipc/Protocol.h"

#include <gtest/gtest.h>
#include <map>

namespace zor::ipc {
namespace {

// The header's bytes are those that other programs write and read.
TEST(Frame, HeaderBytes) {
    const std::array<std::uint8_t, frameHeaderBytes> bytes = {0x01, 0x02, 0x10, 0x00, 0x01, 0x00, 0x00, 0x00,
                                                              0x88, 0x77, 0x66, 0x55, 0x44, 0x33, 0x22, 0x11};
    const FrameHeader header = decodeFrameHeader(bytes);
    EXPECT_EQ(header.payloadBytes, 0x0010'0201U);
    EXPECT_EQ(header.flags, 1U);
    EXPECT_EQ(header.id, 0x1122'3344'5566'7788U);
    std::array<std::uint8_t, frameHeaderBytes> written{};
    encodeFrameHeader(header, written);
    EXPECT_EQ(written, bytes);
}

// Each side takes exactly what the other may send: lengths and flags around every limit.
TEST(Frame, WhatEachSideTakes) {
    const struct {
        std::uint32_t payloadBytes;
        std::uint32_t flags;
        bool request;
        bool reply;
    } rows[] = {{0, 0, false, false},
                {0, 2, false, false},
                {1, 0, true, false},
                {1, 1, true, false},
                {1, 2, false, true},
                {1, 3, false, false},
                {1, 4, false, false},
                {1, 6, false, false},
                {1, 0x8000'0000, false, false},
                {1'048'576, 1, true, false},
                {1'048'577, 1, false, false},
                {1'048'577, 2, false, true},
                {0xFFFF'FFFF, 1, false, false},
                {0xFFFF'FFFF, 2, false, true}};
    for (const auto& row : rows) {
        const FrameHeader header = {.payloadBytes = row.payloadBytes, .flags = row.flags, .id = 0};
        EXPECT_EQ(header.isValidRequest(), row.request) << row.payloadBytes << " " << row.flags;
        EXPECT_EQ(header.isValidReply(), row.reply) << row.payloadBytes << " " << row.flags;
    }
}

// Goal: identifiers that were chosen to meet in a table, where each lookup walks past all of them, do not. Method: a
// thousand that the library's own hash puts in one of a thousand places.
TEST(Identifiers, AreNotMadeToMeet) {
    constexpr std::size_t places = 1009;
    std::map<std::size_t, int> met;
    for (int number = 0, chosen = 0; chosen < 1000; ++number) {
        const std::string identifier = "com.example." + std::to_string(number);
        if (std::hash<std::string_view>()(identifier) % places != 0)
            continue;
        ++chosen;
        EXPECT_LT(++met[hashOfIdentifier(identifier) % places], 20);
    }
}

// A UUID is 16 bytes of data or nothing, and its text is exact.
TEST(Uuid, ValuesAndText) {
    const UUID uuid({0x00, 0x11, 0x22, 0x33, 0x44, 0x55, 0x66, 0x77, 0x88, 0x99, 0xAA, 0xBB, 0xCC, 0xDD, 0xEE, 0xFF});
    const plist::Value value = uuid.value();
    EXPECT_EQ(UUID::of(&value), uuid);
    for (const plist::Value& other : std::initializer_list<plist::Value>{
             plist::Data(15), plist::Data(17), plist::Data(), "0011223344556677", std::uint64_t{1}, plist::Array()})
        EXPECT_FALSE(UUID::of(&other));
    EXPECT_FALSE(UUID::of(nullptr));
    EXPECT_FALSE(UUID::of(plist::Dictionary{{"A", value}}, "B"));

    const std::string text = "00112233-4455-6677-8899-AABBCCDDEEFF";
    EXPECT_EQ(uuid.string(), text);
    EXPECT_EQ(UUID::parse(text), uuid);
    EXPECT_EQ(UUID::parse("00112233-4455-6677-8899-aabbccddeeff"), uuid);
    for (const char* wrong : {"", "00112233445566778899AABBCCDDEEFF", "00112233-4455-6677-8899-AABBCCDDEEF",
                              "00112233-4455-6677-8899-AABBCCDDEEFF0", "0011223-34455-6677-8899-AABBCCDDEEFF",
                              "00112233-4455-6677-8899-AABBCCDDEEFG", "0011223344-55-6677-8899-AABBCCDDEEFF",
                              "00112233-4455-6677-8899+AABBCCDDEEFF", "{0112233-4455-6677-8899-AABBCCDDEEFF"})
        EXPECT_FALSE(UUID::parse(wrong)) << wrong;
}

static_assert(static_cast<std::uint64_t>(Command::retryTest) + 1 == commandCount);

} // namespace
} // namespace zor::ipc
