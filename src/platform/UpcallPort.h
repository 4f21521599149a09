// SPDX-License-Identifier: Apache-2.0
// The kernel's port: packets with the sender's credentials, and replies.
#pragma once

#include "platform/PeerIdentity.h"
#include "platform/RunLoop.h"

#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <span>
#include <string>
#include <vector>

namespace zor::platform {

struct UpcallPacket {
    std::span<const std::uint8_t> bytes;
    /// Absent when the kernel vouched for no credentials.
    std::optional<pid_t> senderPid;
    std::optional<uid_t> senderUserId;
};

class UpcallPort {
public:
    virtual ~UpcallPort() = default;
    /// Binds the port under its service name. 0 or an errno; `checkInCallName` names the call that failed.
    virtual int checkIn() = 0;
    [[nodiscard]] virtual const char* checkInCallName() const = 0;
    /// Serves packets on the loop: the handler returns the reply packet, empty for none. False when no source can be
    /// made; `sourceCallName` then names the call.
    virtual bool serve(RunLoop& loop, std::function<std::vector<std::uint8_t>(const UpcallPacket&)> handler) = 0;
    [[nodiscard]] virtual const char* sourceCallName() const = 0;
    /// The longest reply packet that the port can send; known once it is checked in. A longer one is dropped.
    [[nodiscard]] virtual std::size_t replyBytesMax() const { return std::size_t{1} << 20; }
};

} // namespace zor::platform
