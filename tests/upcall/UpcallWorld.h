// SPDX-License-Identifier: Apache-2.0
// A daemon that serves the upcall on a root of its own, and what speaks to it through a socket, as the kernel's agent
// does: the test's own program is registered as that agent.
#pragma once

#include "daemon/Daemon.h"
#include "ipc/Protocol.h"
#include "os/SystemRoot.h"
#include "support/Frames.h"
#include "upcall/PackbuffWorld.h"
#include "world/World.h"

#include <fcntl.h>

namespace zor::test {

enum class Agent { registered, unknown };

inline void sendPacket(int socket, std::span<const std::uint8_t> packet) {
    EXPECT_EQ(::send(socket, packet.data(), packet.size(), MSG_NOSIGNAL), static_cast<ssize_t>(packet.size()));
}
/// Empty when none comes in time.
inline ByteVector receivePacket(int socket) {
    ByteVector packet(std::size_t{2} << 20);
    const ssize_t received = ::recv(socket, packet.data(), packet.size(), 0);
    packet.resize(received < 0 ? 0 : static_cast<std::size_t>(received));
    return packet;
}

/// Its daemon runs on a thread of its own until this object ends.
class ServedUpcall {
public:
    explicit ServedUpcall(Agent agent = Agent::registered, World::Options options = {}) : world(std::move(options)) {
        if (agent == Agent::registered)
            world.write(
                std::string(platform::names::identityDirectory) + "/agent" + platform::names::identityFileSuffix,
                binary(plist::Dictionary{{"Executable", std::filesystem::read_symlink("/proc/self/exe").string()},
                                         {"KernelAgent", true}}));
        world.restart();
        std::promise<void> ready;
        thread_ = std::thread([this, &ready] {
            Daemon daemon(world.services(), {.logLevel = world.log.level(), .ready = [&ready] { ready.set_value(); }});
            EXPECT_EQ(daemon.run(), 0);
        });
        ready.get_future().wait();
        world.log.take();
        socket_ = connect();
    }
    ~ServedUpcall() {
        world.linux().roles().runLoop.stop();
        thread_.join();
    }

    World world;

    [[nodiscard]] platform::FileDescriptor connect() const {
        platform::FileDescriptor socket(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
        const platform::FileDescriptor directory(::open(world.path(ipc::runtimeDirectory).c_str(), O_PATH | O_CLOEXEC));
        EXPECT_TRUE(support::connectTo(socket.get(), "/proc/self/fd/" + std::to_string(directory.get()) + "/" +
                                                         std::string(ipc::upcallServiceName)));
        support::limitWaiting(socket.get());
        return socket;
    }
    /// Sends it on a connection kept for that, and returns the whole reply packet; empty when none comes.
    ByteVector exchange(std::span<const std::uint8_t> packet) {
        sendPacket(socket_.get(), packet);
        return receivePacket(socket_.get());
    }
    UpcallReply ask(const Items& items) { return replyIn(exchange(items.packet())); }

private:
    std::thread thread_;
    platform::FileDescriptor socket_;
};

} // namespace zor::test
