// SPDX-License-Identifier: Apache-2.0
// A daemon that serves the upcall on a root of its own, and what speaks to it through a socket, as the kernel's agent
// does: the test's own program is registered as that agent.
#pragma once

#include "os/FileDescriptor.h"
#include "upcall/PackbuffWorld.h"
#include "upcall/UpcallPackets.h"
#include "world/World.h"

#include <thread>

namespace zor::test {

enum class Agent { registered, unknown };

/// Its daemon runs on a thread of its own until this object ends.
class ServedUpcall {
public:
    explicit ServedUpcall(Agent agent = Agent::registered, World::Options options = {});
    ~ServedUpcall();
    ServedUpcall(const ServedUpcall&) = delete;
    ServedUpcall& operator=(const ServedUpcall&) = delete;

    World world;

    [[nodiscard]] platform::FileDescriptor connect() const;
    /// Sends it on a connection kept for that, and returns the whole reply packet; empty when none comes.
    ByteVector exchange(std::span<const std::uint8_t> packet);
    UpcallReply ask(const Items& items) { return replyIn(exchange(items.packet())); }

private:
    std::thread thread_;
    platform::FileDescriptor socket_;
};

void sendPacket(int socket, std::span<const std::uint8_t> packet);
/// Empty when none comes in time.
ByteVector receivePacket(int socket);

} // namespace zor::test
