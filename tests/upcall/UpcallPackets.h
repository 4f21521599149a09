// SPDX-License-Identifier: Apache-2.0
// What the kernel's agent sends and what comes back, item by item; and a port over which nothing comes.
#pragma once

#include "platform/ServiceListener.h"
#include "upcall/packbuff/Packbuff.h"
#include "upcall/packbuff/UpcallMessage.h"

#include <memory>
#include <optional>
#include <stdexcept>
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

/// A port over which nothing comes; a reply may have this many bytes.
class NoPort final : public platform::UpcallPort {
public:
    int checkIn() override { return 0; }
    [[nodiscard]] const char* checkInCallName() const override { return "none"; }
    bool serve(platform::RunLoop&, std::function<ByteVector(const platform::UpcallPacket&)>) override { return true; }
    [[nodiscard]] const char* sourceCallName() const override { return "none"; }
    [[nodiscard]] std::size_t replyBytesMax() const override {
        return fails ? throw std::runtime_error("the port failed") : bytesMax;
    }
    std::size_t bytesMax = std::size_t{1} << 20;
    bool fails = false;
};

} // namespace zor::test
