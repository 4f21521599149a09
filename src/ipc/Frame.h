// SPDX-License-Identifier: Apache-2.0
// The frame header of the stream between a client and the daemon, 16 bytes, little-endian:
//
//   offset  width  field
//        0    u32  payload length in bytes; the payload follows the header at once
//        4    u32  flags: bit 0 in a request: a reply is expected; bit 1: this frame is a reply; all others 0
//        8    u64  id, chosen by the client, repeated in the reply
//
// The payload is a binary property list whose root is a dictionary. These functions judge the header alone.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <span>

namespace zor::ipc {

/// Length, flags, id.
inline constexpr std::size_t frameHeaderBytes = 16;
/// A request names one operation on one container; its largest part is an info value, and a metadata file takes 1 MiB
/// too.
inline constexpr std::uint32_t requestPayloadBytesMax = 1'048'576;
/// A reply is as long as its length field can say: a list of all containers of a class has no other bound.
inline constexpr std::uint32_t replyPayloadBytesMax = 0xFFFF'FFFF;

inline constexpr std::uint32_t frameExpectsReply = 1U << 0;
inline constexpr std::uint32_t frameIsReply = 1U << 1;

struct FrameHeader {
    std::uint32_t payloadBytes = 0;
    std::uint32_t flags = 0;
    std::uint64_t id = 0;

    [[nodiscard]] bool expectsReply() const { return (flags & frameExpectsReply) != 0; }
    /// A header that a daemon may read: a length from 1 to requestPayloadBytesMax, and no flag but frameExpectsReply.
    [[nodiscard]] bool isValidRequest() const {
        return payloadBytes >= 1 && payloadBytes <= requestPayloadBytesMax && (flags & ~frameExpectsReply) == 0;
    }
    /// A header that a client may read: a length of at least 1, and exactly the flag frameIsReply.
    [[nodiscard]] bool isValidReply() const { return payloadBytes >= 1 && flags == frameIsReply; }

    bool operator==(const FrameHeader&) const = default;
};

namespace detail {

template <typename Integer>
Integer readLittleEndian(const std::uint8_t* bytes) {
    Integer value = 0;
    for (std::size_t i = 0; i < sizeof(Integer); ++i)
        value |= static_cast<Integer>(bytes[i]) << (8 * i);
    return value;
}

template <typename Integer>
void writeLittleEndian(Integer value, std::uint8_t* bytes) {
    for (std::size_t i = 0; i < sizeof(Integer); ++i)
        bytes[i] = static_cast<std::uint8_t>(value >> (8 * i));
}

} // namespace detail

/// Any 16 bytes decode; whether they make sense is the caller's next question.
inline FrameHeader decodeFrameHeader(std::span<const std::uint8_t, frameHeaderBytes> bytes) {
    return {.payloadBytes = detail::readLittleEndian<std::uint32_t>(bytes.data()),
            .flags = detail::readLittleEndian<std::uint32_t>(bytes.data() + 4),
            .id = detail::readLittleEndian<std::uint64_t>(bytes.data() + 8)};
}

inline void encodeFrameHeader(const FrameHeader& header, std::span<std::uint8_t, frameHeaderBytes> bytes) {
    detail::writeLittleEndian(header.payloadBytes, bytes.data());
    detail::writeLittleEndian(header.flags, bytes.data() + 4);
    detail::writeLittleEndian(header.id, bytes.data() + 8);
}

} // namespace zor::ipc
