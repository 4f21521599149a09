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
    [[nodiscard]] bool isValidRequest() const;
    /// A header that a client may read: a length of at least 1, and exactly the flag frameIsReply.
    [[nodiscard]] bool isValidReply() const;

    bool operator==(const FrameHeader&) const = default;
};

/// Any 16 bytes decode; whether they make sense is the caller's next question.
FrameHeader decodeFrameHeader(std::span<const std::uint8_t, frameHeaderBytes> bytes);
void encodeFrameHeader(const FrameHeader& header, std::span<std::uint8_t, frameHeaderBytes> bytes);

} // namespace zor::ipc
