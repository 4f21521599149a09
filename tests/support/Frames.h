// SPDX-License-Identifier: Apache-2.0
// Frames of the socket protocol, right and wrong ones, and the calls on sockets that carry them.
#pragma once

#include "ipc/Frame.h"
#include "plist/Codec.h"

#include <cstring>
#include <optional>
#include <string>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>

namespace zor::support {

inline sockaddr_un addressOf(const std::string& path) {
    sockaddr_un address{.sun_family = AF_UNIX, .sun_path = {}};
    path.copy(address.sun_path, sizeof address.sun_path - 1);
    return address;
}

inline bool connectTo(int socket, const std::string& path) {
    const sockaddr_un address = addressOf(path);
    return ::connect(socket, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0;
}

inline bool bindTo(int socket, const std::string& path) {
    const sockaddr_un address = addressOf(path);
    return ::bind(socket, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0;
}

/// From now on calls give up after ten seconds.
inline void limitWaiting(int socket) {
    const timeval timeout = {.tv_sec = 10, .tv_usec = 0};
    ::setsockopt(socket, SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
    ::setsockopt(socket, SOL_SOCKET, SO_SNDTIMEO, &timeout, sizeof timeout);
}

/// One whole frame, whatever it says of itself.
inline plist::Data frameOf(std::uint32_t length, std::uint32_t flags, std::uint64_t id, const plist::Data& payload) {
    plist::Data frame(ipc::frameHeaderBytes);
    ipc::encodeFrameHeader({.payloadBytes = length, .flags = flags, .id = id},
                           std::span(frame).first<ipc::frameHeaderBytes>());
    frame.insert(frame.end(), payload.begin(), payload.end());
    return frame;
}
/// One that is right.
inline plist::Data frameOf(const plist::Value& message, std::uint64_t id,
                           std::uint32_t flags = ipc::frameExpectsReply) {
    const auto payload = plist::writeBinary(message);
    return frameOf(static_cast<std::uint32_t>(payload->size()), flags, id, *payload);
}

struct Frame {
    ipc::FrameHeader header;
    plist::Data payload;
    /// Empty when it holds no dictionary.
    [[nodiscard]] plist::Dictionary message() const {
        const auto value = plist::readBinary(payload);
        return value && value->asDictionary() ? *value->asDictionary() : plist::Dictionary();
    }
};
/// nullopt at the end of the stream, on a reset, or when nothing comes.
inline std::optional<Frame> receiveFrame(int socket) {
    const auto receiveAll = [socket](std::span<std::uint8_t> bytes) {
        return ::recv(socket, bytes.data(), bytes.size(), MSG_WAITALL) == std::ssize(bytes);
    };
    std::array<std::uint8_t, ipc::frameHeaderBytes> bytes;
    if (!receiveAll(bytes))
        return {};
    Frame frame{.header = ipc::decodeFrameHeader(bytes), .payload = {}};
    frame.payload.resize(frame.header.payloadBytes);
    return receiveAll(frame.payload) ? std::optional(frame) : std::nullopt;
}

/// False when the other side has closed.
inline bool sendAll(int socket, const plist::Data& bytes) {
    return ::send(socket, bytes.data(), bytes.size(), MSG_NOSIGNAL) == std::ssize(bytes);
}

/// As one message with a descriptor attached.
inline bool sendWithDescriptor(int socket, const plist::Data& bytes, int descriptor) {
    iovec part = {.iov_base = const_cast<std::uint8_t*>(bytes.data()), .iov_len = bytes.size()};
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))] = {};
    msghdr message = {};
    message.msg_iov = &part;
    message.msg_iovlen = 1;
    message.msg_control = control;
    message.msg_controllen = sizeof control;
    *CMSG_FIRSTHDR(&message) = {.cmsg_len = CMSG_LEN(sizeof(int)), .cmsg_level = SOL_SOCKET, .cmsg_type = SCM_RIGHTS};
    std::memcpy(CMSG_DATA(CMSG_FIRSTHDR(&message)), &descriptor, sizeof descriptor);
    return ::sendmsg(socket, &message, MSG_NOSIGNAL) == std::ssize(bytes);
}

} // namespace zor::support
