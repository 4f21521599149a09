// SPDX-License-Identifier: Apache-2.0
#include "upcall/packbuff/UpcallMessage.h"

#include <array>
#include <cstring>

namespace zor::upcall {

namespace {

std::uint32_t numberAt(Bytes packet, std::size_t offset) {
    std::uint32_t number = 0;
    for (std::size_t i = sizeof number; i > 0; --i)
        number = number << 8U | packet[offset + i - 1];
    return number;
}

void putNumber(std::vector<std::uint8_t>& packet, std::size_t offset, std::uint32_t number) {
    for (std::size_t i = 0; i < sizeof number; ++i)
        packet[offset + i] = static_cast<std::uint8_t>(number >> (8 * i));
}

std::vector<std::uint8_t> packetAround(std::size_t headerBytes, Bytes buffer) {
    std::vector<std::uint8_t> packet;
    packet.reserve(headerBytes + buffer.size());
    packet.resize(headerBytes);
    packet.insert(packet.end(), buffer.begin(), buffer.end());
    return packet;
}

void putReplyHeader(std::vector<std::uint8_t>& packet, std::uint32_t totalBytes, std::uint32_t requestId,
                    ReturnCode code) {
    putNumber(packet, ReplyOffset::totalBytes, totalBytes);
    putNumber(packet, ReplyOffset::messageId, requestId + replyIdOffset);
    putNumber(packet, ReplyOffset::returnCode, static_cast<std::uint32_t>(code));
}

} // namespace

std::vector<std::uint8_t> encodeRequest(Bytes buffer) {
    std::vector<std::uint8_t> packet = packetAround(RequestOffset::buffer, buffer);
    const auto count = static_cast<std::uint32_t>(buffer.size());
    putNumber(packet, RequestOffset::totalBytes, requestTotalBytes);
    putNumber(packet, RequestOffset::messageId, processContainersMessageId);
    putNumber(packet, RequestOffset::descriptorCount, 1);
    putNumber(packet, RequestOffset::descriptorType, outOfLineDescriptor);
    putNumber(packet, RequestOffset::descriptorBytes, count);
    putNumber(packet, RequestOffset::byteCount, count);
    return packet;
}

std::optional<Reply> decodeReply(Bytes packet) {
    if (packet.size() < ReplyOffset::buffer ||
        numberAt(packet, ReplyOffset::messageId) != processContainersMessageId + replyIdOffset)
        return std::nullopt;
    const std::uint32_t totalBytes = numberAt(packet, ReplyOffset::totalBytes);
    const std::uint32_t descriptorCount = numberAt(packet, ReplyOffset::descriptorCount);
    const auto code = static_cast<ReturnCode>(numberAt(packet, ReplyOffset::returnCode));
    const Bytes buffer = packet.subspan(ReplyOffset::buffer);
    const bool hasBuffer = code == ReturnCode::success;
    if (totalBytes != (hasBuffer ? replyTotalBytesWithBuffer : replyTotalBytesWithoutBuffer) ||
        descriptorCount != (hasBuffer ? 1U : 0U) || numberAt(packet, ReplyOffset::byteCount) != buffer.size() ||
        (!hasBuffer && !buffer.empty()))
        return std::nullopt;
    return Reply{.returnCode = code, .buffer = buffer};
}

std::optional<std::uint32_t> messageIdOf(Bytes packet) {
    if (packet.size() < RequestOffset::messageId + sizeof(std::uint32_t))
        return std::nullopt;
    return numberAt(packet, RequestOffset::messageId);
}

std::expected<Bytes, ReturnCode> decodeRequest(Bytes packet) {
    if (messageIdOf(packet) != processContainersMessageId)
        return std::unexpected(ReturnCode::unknownMessage);
    if (packet.size() < RequestOffset::buffer || numberAt(packet, RequestOffset::totalBytes) != requestTotalBytes ||
        numberAt(packet, RequestOffset::descriptorCount) != 1)
        return std::unexpected(ReturnCode::wrongForm);
    const Bytes buffer = packet.subspan(RequestOffset::buffer);
    const std::uint32_t size = numberAt(packet, RequestOffset::descriptorBytes);
    if (numberAt(packet, RequestOffset::descriptorType) != outOfLineDescriptor ||
        numberAt(packet, RequestOffset::byteCount) != size || buffer.size() != size)
        return std::unexpected(ReturnCode::wrongDescriptor);
    return buffer;
}

std::vector<std::uint8_t> encodeErrorReply(std::uint32_t requestId, ReturnCode code) {
    std::vector<std::uint8_t> packet(ReplyOffset::buffer);
    putReplyHeader(packet, replyTotalBytesWithoutBuffer, requestId, code);
    return packet;
}

std::vector<std::uint8_t> encodeReply(std::uint32_t requestId, Bytes buffer) {
    std::vector<std::uint8_t> packet = packetAround(ReplyOffset::buffer, buffer);
    putReplyHeader(packet, replyTotalBytesWithBuffer, requestId, ReturnCode::success);
    putNumber(packet, ReplyOffset::descriptorCount, 1);
    putNumber(packet, ReplyOffset::byteCount, static_cast<std::uint32_t>(buffer.size()));
    return packet;
}

} // namespace zor::upcall
