// SPDX-License-Identifier: Apache-2.0
#include "ipc/Frame.h"

namespace zor::ipc {

namespace {

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

} // namespace

bool FrameHeader::isValidRequest() const {
    return payloadBytes >= 1 && payloadBytes <= requestPayloadBytesMax && (flags & ~frameExpectsReply) == 0;
}

bool FrameHeader::isValidReply() const {
    return payloadBytes >= 1 && flags == frameIsReply;
}

FrameHeader decodeFrameHeader(std::span<const std::uint8_t, frameHeaderBytes> bytes) {
    return {.payloadBytes = readLittleEndian<std::uint32_t>(bytes.data()),
            .flags = readLittleEndian<std::uint32_t>(bytes.data() + 4),
            .id = readLittleEndian<std::uint64_t>(bytes.data() + 8)};
}

void encodeFrameHeader(const FrameHeader& header, std::span<std::uint8_t, frameHeaderBytes> bytes) {
    writeLittleEndian(header.payloadBytes, bytes.data());
    writeLittleEndian(header.flags, bytes.data() + 4);
    writeLittleEndian(header.id, bytes.data() + 8);
}

} // namespace zor::ipc
