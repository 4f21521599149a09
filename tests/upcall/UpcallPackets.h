// SPDX-License-Identifier: Apache-2.0
// The packets of the kernel's agent and their answers, item by item.
#pragma once

#include "upcall/packbuff/Packbuff.h"
#include "upcall/packbuff/UpcallMessage.h"

#include <algorithm>
#include <cstring>
#include <gtest/gtest.h>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace zor::test {

using ByteVector = std::vector<std::uint8_t>;

/// A request's packed buffer, item by item; the end item is put behind it.
class Items {
public:
    Items& string(std::uint16_t valueType, std::string_view text) {
        const std::string ended(text);
        return packed(sb_packbuff_pack_string(packbuff_.get(), valueType, ended.c_str(),
                                              static_cast<std::uint32_t>(ended.size())));
    }
    Items& number(std::uint16_t valueType, std::uint32_t value) {
        return packed(sb_packbuff_pack_uint32(packbuff_.get(), valueType, value));
    }
    Items& bytes(std::uint16_t valueType, std::string_view data) {
        return packed(
            sb_packbuff_pack_bytes(packbuff_.get(), valueType, data.data(), static_cast<std::uint32_t>(data.size())));
    }
    [[nodiscard]] ByteVector buffer() const {
        const std::uint8_t* const bytes = sb_packbuff_get_bytes(packbuff_.get());
        return {bytes, bytes + sb_packbuff_get_size(packbuff_.get())};
    }
    [[nodiscard]] ByteVector packet() const { return upcall::encodeRequest(buffer()); }

private:
    Items& packed(int result) {
        EXPECT_EQ(result, packbuffSuccess);
        return *this;
    }
    std::shared_ptr<sb_packbuff> packbuff_{sb_packbuff_new(4096), PackbuffDeleter()};
};

/// A reply as it came.
struct UpcallReply {
    std::uint32_t messageId = 0;
    std::int32_t returnCode = 0;
    /// Value types and texts in order; a number is in decimal. Empty without a buffer.
    std::vector<std::pair<unsigned, std::string>> items;
    /// The size of the reply's buffer; absent when it has none.
    std::optional<std::size_t> bufferBytes;

    /// In order, with spaces between.
    [[nodiscard]] std::string types() const {
        std::string types;
        for (const auto& [type, text] : items)
            types += (types.empty() ? "" : " ") + std::to_string(type);
        return types;
    }
    /// The only item of a type; "" when there is none or are several.
    [[nodiscard]] std::string text(unsigned type) const {
        const auto isOfType = [&](const auto& item) { return item.first == type; };
        return std::ranges::count_if(items, isOfType) == 1 ? std::ranges::find_if(items, isOfType)->second : "";
    }
    /// Each item of `keyType` with the one behind it.
    [[nodiscard]] std::vector<std::pair<std::string, std::string>> groups(unsigned keyType) const {
        std::vector<std::pair<std::string, std::string>> found;
        for (std::size_t i = 0; i + 1 < items.size(); ++i)
            if (items[i].first == keyType && items[i + 1].first == keyType + 1)
                found.emplace_back(items[i].second, items[i + 1].second);
        return found;
    }
};

/// Fails the test when the packet is no reply.
inline UpcallReply replyIn(std::span<const std::uint8_t> packet) {
    UpcallReply reply;
    std::uint32_t head[5] = {};
    if (packet.size() < sizeof head) {
        ADD_FAILURE() << "no reply: " << packet.size() << " bytes";
        return reply;
    }
    std::memcpy(head, packet.data(), sizeof head);
    const auto [length, messageId, returnCode, descriptorCount, bufferBytes] = head;
    reply.messageId = messageId;
    reply.returnCode = static_cast<std::int32_t>(returnCode);
    EXPECT_EQ(length, descriptorCount == 1 ? 52U : 36U);
    EXPECT_EQ(bufferBytes, packet.size() - sizeof head);
    if (descriptorCount != 1) {
        EXPECT_EQ(descriptorCount, 0U);
        EXPECT_EQ(bufferBytes, 0U);
        return reply;
    }
    reply.bufferBytes = bufferBytes;
    ByteVector buffer(packet.begin() + sizeof head, packet.end());
    if (buffer.empty())
        return reply;
    const PackbuffPointer reader(sb_packbuff_init_with_buffer(buffer.data(), buffer.size(), true, packbuffDeallocNone));
    std::uint16_t valueType = 0;
    while (sb_packbuff_get_item_value_type(reader.get(), &valueType) != 0) {
        int error = 0;
        std::uint32_t textBytes = 0;
        if (valueType == upcall::CM_KERN_REPLY_STATUS) {
            reply.items.emplace_back(valueType, std::to_string(sb_packbuff_unpack_uint32(reader.get(), &error)));
        } else if (const char* text = sb_packbuff_unpack_string(reader.get(), &textBytes, &error)) {
            reply.items.emplace_back(valueType, std::string(text, textBytes));
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
