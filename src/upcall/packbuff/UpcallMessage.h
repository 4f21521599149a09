// SPDX-License-Identifier: Apache-2.0
// The upcall's packets: what asks for the containers of a process, and what answers. The one home of every number in
// them; docs/formats.md shows them byte by byte. The daemon and the programs that speak to it use the same source.
//
// A packet is a short header of little-endian 32-bit numbers and one buffer, which holds a packed buffer (Packbuff.h).
#pragma once

#include <cstddef>
#include <cstdint>
#include <expected>
#include <optional>
#include <span>
#include <vector>

namespace zor::upcall {

/// Asks for the containers of a process, and makes those that are missing.
inline constexpr std::uint32_t processContainersMessageId = 322'514'900;
/// A reply's id is that of its request and this.
inline constexpr std::uint32_t replyIdOffset = 100;

/// The sizes that the numbers at the start of a packet tell are those of the interface, not of the packet.
inline constexpr std::uint32_t requestTotalBytes = 52;
inline constexpr std::uint32_t replyTotalBytesWithBuffer = 52;
inline constexpr std::uint32_t replyTotalBytesWithoutBuffer = 36;
inline constexpr std::uint32_t outOfLineDescriptor = 1;

// The places of a packet's fields. The buffer is what follows the header, to the packet's end.
struct RequestOffset {
    static constexpr std::size_t totalBytes = 0;
    static constexpr std::size_t messageId = 4;
    static constexpr std::size_t descriptorCount = 8;
    static constexpr std::size_t descriptorType = 12;
    static constexpr std::size_t descriptorBytes = 16;
    static constexpr std::size_t byteCount = 20;
    static constexpr std::size_t buffer = 24;
};
struct ReplyOffset {
    static constexpr std::size_t totalBytes = 0;
    static constexpr std::size_t messageId = 4;
    static constexpr std::size_t returnCode = 8;
    static constexpr std::size_t descriptorCount = 12;
    static constexpr std::size_t byteCount = 16;
    static constexpr std::size_t buffer = 20;
};

enum class ReturnCode : std::int32_t {
    success = 0,
    unsupportedItem = 4,    // or one that is not known
    refused = 5,            // not the kernel, or a request that cannot be read
    noBuffer = 9,           // the request's or the reply's could not be set up
    wrongDescriptor = -300, // not out of line, or of another size than the count says
    unknownMessage = -303,
    wrongForm = -304, // not exactly one buffer and its count
    senderUnknown = -309,
};

// The names of the items are those of the other side of the interface. In a request the type of an item is string, but
// for the persona, which is a uint32.
enum RequestValueType : std::uint16_t {
    CM_KERN_REQUEST_CODE_SIGNATURE_ID = 0,
    CM_KERN_REQUEST_CONTAINER_ID = 1,
    CM_KERN_REQUEST_APPLICATION_ID = 2,
    CM_KERN_REQUEST_PERSONA_ID = 3,
    CM_KERN_REQUEST_APP_GROUP_ID = 4,
    CM_KERN_REQUEST_CONTAINER_TYPE = 5,
    CM_KERN_REQUEST_SYSTEM_CONTAINER_ID = 6,
    CM_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID = 7,
};

// In a reply all are strings, but for the status, a uint32. A group's identifier is followed by its path.
enum ReplyValueType : std::uint16_t {
    CM_KERN_REPLY_STATUS = 0,
    CM_KERN_REPLY_DATA_CONTAINER_PATH = 1,
    CM_KERN_REPLY_TEMP_DIR_PATH = 2,
    CM_KERN_REPLY_APP_GROUP_ID = 3,
    CM_KERN_REPLY_APP_GROUP_PATH = 4,
    CM_KERN_REPLY_HOME_DIR_PATH = 100,
    CM_KERN_REPLY_SYSTEM_CONTAINER_PATH = 101,
    CM_KERN_REPLY_SYSTEM_GROUP_ID = 102,
    CM_KERN_REPLY_SYSTEM_GROUP_PATH = 103,
};

using Bytes = std::span<const std::uint8_t>;

// The asking side.
/// A whole request packet around a packed buffer.
[[nodiscard]] std::vector<std::uint8_t> encodeRequest(Bytes buffer);
struct Reply {
    ReturnCode returnCode = ReturnCode::success;
    Bytes buffer; // in the packet; empty, too, when the daemon could not send what it had
};
/// nullopt for a packet that is no reply to `processContainersMessageId`.
[[nodiscard]] std::optional<Reply> decodeReply(Bytes packet);

// The answering side.
/// nullopt for a packet too short to have one.
[[nodiscard]] std::optional<std::uint32_t> messageIdOf(Bytes packet);
/// The buffer in a request packet, or what is wrong with the packet: its id is looked at first, then its form, then its
/// descriptor.
[[nodiscard]] std::expected<Bytes, ReturnCode> decodeRequest(Bytes packet);
/// A reply without a buffer.
[[nodiscard]] std::vector<std::uint8_t> encodeErrorReply(std::uint32_t requestId, ReturnCode code);
/// A success reply; its buffer may be empty.
[[nodiscard]] std::vector<std::uint8_t> encodeReply(std::uint32_t requestId, Bytes buffer);

} // namespace zor::upcall
