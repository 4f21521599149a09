// SPDX-License-Identifier: Apache-2.0
#include "upcall/UpcallWorld.h"

#include "daemon/Daemon.h"
#include "ipc/Names.h"
#include "os/Names.h"

#include <fcntl.h>
#include <filesystem>
#include <future>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>

namespace zor::test {

using platform::FileDescriptor;

ServedUpcall::ServedUpcall(Agent agent, World::Options options) : world(std::move(options)) {
    if (agent == Agent::registered)
        world.write(std::string(platform::names::identityDirectory) + "/agent" + platform::names::identityFileSuffix,
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

ServedUpcall::~ServedUpcall() {
    world.linux().roles().runLoop.stop();
    thread_.join();
}

FileDescriptor ServedUpcall::connect() const {
    FileDescriptor socket(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
    const FileDescriptor directory(::open(world.path(ipc::runtimeDirectory).c_str(), O_PATH | O_CLOEXEC));
    const std::string path =
        "/proc/self/fd/" + std::to_string(directory.get()) + "/" + std::string(ipc::upcallServiceName);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
    EXPECT_EQ(::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    const timeval patience{.tv_sec = 20, .tv_usec = 0};
    EXPECT_EQ(::setsockopt(socket.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience), 0);
    return socket;
}

ByteVector ServedUpcall::exchange(std::span<const std::uint8_t> packet) {
    sendPacket(socket_.get(), packet);
    return receivePacket(socket_.get());
}

void sendPacket(int socket, std::span<const std::uint8_t> packet) {
    EXPECT_EQ(::send(socket, packet.data(), packet.size(), MSG_NOSIGNAL), static_cast<ssize_t>(packet.size()));
}

ByteVector receivePacket(int socket) {
    ByteVector packet(std::size_t{2} << 20);
    const ssize_t received = ::recv(socket, packet.data(), packet.size(), 0);
    packet.resize(received < 0 ? 0 : static_cast<std::size_t>(received));
    return packet;
}

} // namespace zor::test
