// SPDX-License-Identifier: Apache-2.0
#include "upcall/UpcallPackets.h"

#include <algorithm>
#include <cstring>
#include <gtest/gtest.h>

namespace zor::test {

namespace {

std::uint32_t numberAt(std::span<const std::uint8_t> bytes, std::size_t offset) {
    std::uint32_t number = 0;
    std::memcpy(&number, bytes.data() + offset, sizeof number);
    return number;
}

} // namespace

Items& Items::string(std::uint16_t valueType, std::string_view text) {
    const std::string ended(text);
    const auto length = static_cast<std::uint32_t>(ended.size());
    EXPECT_EQ(sb_packbuff_pack_string(packbuff_.get(), valueType, ended.c_str(), length), packbuffSuccess);
    return *this;
}

Items& Items::number(std::uint16_t valueType, std::uint32_t value) {
    EXPECT_EQ(sb_packbuff_pack_uint32(packbuff_.get(), valueType, value), packbuffSuccess);
    return *this;
}

Items& Items::bytes(std::uint16_t valueType, std::string_view data) {
    EXPECT_EQ(sb_packbuff_pack_bytes(packbuff_.get(), valueType, data.data(), static_cast<std::uint32_t>(data.size())),
              packbuffSuccess);
    return *this;
}

ByteVector Items::buffer() const {
    const std::uint8_t* const bytes = sb_packbuff_get_bytes(packbuff_.get());
    return {bytes, bytes + sb_packbuff_get_size(packbuff_.get())};
}

std::string UpcallReply::types() const {
    std::string types;
    for (const auto& [type, text] : items)
        types += (types.empty() ? "" : " ") + std::to_string(type);
    return types;
}

std::string UpcallReply::text(unsigned type) const {
    const auto isOfType = [&](const auto& item) { return item.first == type; };
    const auto found = std::ranges::find_if(items, isOfType);
    return std::ranges::count_if(items, isOfType) == 1 ? found->second : "";
}

std::vector<std::pair<std::string, std::string>> UpcallReply::groups(unsigned keyType) const {
    std::vector<std::pair<std::string, std::string>> found;
    for (std::size_t i = 0; i + 1 < items.size(); ++i)
        if (items[i].first == keyType && items[i + 1].first == keyType + 1)
            found.emplace_back(items[i].second, items[i + 1].second);
    return found;
}

UpcallReply replyIn(std::span<const std::uint8_t> packet) {
    UpcallReply reply;
    if (packet.size() < 20) {
        ADD_FAILURE() << "no reply: " << packet.size() << " bytes";
        return reply;
    }
    reply.messageId = numberAt(packet, 4);
    reply.returnCode = static_cast<std::int32_t>(numberAt(packet, 8));
    const std::uint32_t descriptorCount = numberAt(packet, 12);
    EXPECT_EQ(numberAt(packet, 0), descriptorCount == 1 ? 52U : 36U);
    EXPECT_EQ(numberAt(packet, 16), packet.size() - 20);
    if (descriptorCount != 1) {
        EXPECT_EQ(descriptorCount, 0U);
        EXPECT_EQ(packet.size(), 20U);
        return reply;
    }
    reply.bufferBytes = packet.size() - 20;
    ByteVector buffer(packet.begin() + 20, packet.end());
    if (buffer.empty())
        return reply;
    const PackbuffPointer reader(sb_packbuff_init_with_buffer(buffer.data(), buffer.size(), true, packbuffDeallocNone));
    std::uint16_t valueType = 0;
    while (sb_packbuff_get_item_value_type(reader.get(), &valueType) != 0) {
        int error = 0;
        std::uint32_t length = 0;
        if (valueType == upcall::CM_KERN_REPLY_STATUS) {
            reply.items.emplace_back(valueType, std::to_string(sb_packbuff_unpack_uint32(reader.get(), &error)));
        } else if (const char* text = sb_packbuff_unpack_string(reader.get(), &length, &error)) {
            reply.items.emplace_back(valueType, std::string(text, length));
        }
        if (error != 0) {
            ADD_FAILURE() << "item of type " << valueType << " cannot be read: " << error;
            return reply;
        }
    }
    EXPECT_TRUE(sb_packbuff_is_at_end(reader.get()));
    EXPECT_EQ(reader->item, reader->item_buffer + buffer.size() - packbuffHeaderBytes) << "more than its items";
    return reply;
}

} // namespace zor::test
