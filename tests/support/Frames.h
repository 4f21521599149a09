// SPDX-License-Identifier: Apache-2.0
// Frames of the socket protocol, right and wrong ones, and the calls on sockets that carry them.
#pragma once

#include "ipc/Frame.h"
#include "plist/Value.h"

#include <optional>
#include <string>
#include <sys/un.h>

namespace zor::support {

sockaddr_un addressOf(const std::string& path);
bool connectTo(int socket, const std::string& path);
/// From now on calls give up after ten seconds.
void limitWaiting(int socket);

/// One whole frame, whatever it says of itself.
plist::Data frameOf(std::uint32_t length, std::uint32_t flags, std::uint64_t id, const plist::Data& payload);
/// One that is right.
plist::Data frameOf(const plist::Value& message, std::uint64_t id, std::uint32_t flags = ipc::frameExpectsReply);

struct Frame {
    ipc::FrameHeader header;
    plist::Data payload;
    /// Empty when it holds no dictionary.
    [[nodiscard]] plist::Dictionary message() const;
};
/// nullopt at the end of the stream, on a reset, or when nothing comes.
std::optional<Frame> receiveFrame(int socket);
/// False when the other side has closed.
bool sendAll(int socket, const plist::Data& bytes);
/// As one message with a descriptor attached.
bool sendWithDescriptor(int socket, const plist::Data& bytes, int descriptor);

} // namespace zor::support
