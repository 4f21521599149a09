// SPDX-License-Identifier: Apache-2.0
// What the kernel's agent sends and what comes back, item by item.
#pragma once

#include "upcall/packbuff/Packbuff.h"
#include "upcall/packbuff/UpcallMessage.h"

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace zor::test {

using ByteVector = std::vector<std::uint8_t>;

/// A request's packed buffer, item by item; the end item is put behind it.
class Items {
public:
    Items& string(std::uint16_t valueType, std::string_view text);
    Items& number(std::uint16_t valueType, std::uint32_t value);
    Items& bytes(std::uint16_t valueType, std::string_view data);
    [[nodiscard]] ByteVector buffer() const;
    [[nodiscard]] ByteVector packet() const { return upcall::encodeRequest(buffer()); }

private:
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
    [[nodiscard]] std::string types() const;
    /// The only item of a type; "" when there is none or are several.
    [[nodiscard]] std::string text(unsigned type) const;
    /// Each item of `keyType` with the one behind it.
    [[nodiscard]] std::vector<std::pair<std::string, std::string>> groups(unsigned keyType) const;
};
/// Fails the test when the packet is no reply.
UpcallReply replyIn(std::span<const std::uint8_t> packet);

} // namespace zor::test
