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

namespace {

std::uint32_t numberAt(std::span<const std::uint8_t> bytes, std::size_t offset) {
    std::uint32_t number = 0;
    std::memcpy(&number, bytes.data() + offset, sizeof number);
    return number;
}

} // namespace

Items& Items::string(std::uint16_t valueType, std::string_view text) {
    const std::string ended(text);
    EXPECT_EQ(
        sb_packbuff_pack_string(packbuff_.get(), valueType, ended.c_str(), static_cast<std::uint32_t>(ended.size())),
        packbuffSuccess);
    return *this;
}

Items& Items::number(std::uint16_t valueType, std::uint32_t value) {
    EXPECT_EQ(sb_packbuff_pack_uint32(packbuff_.get(), valueType, value), packbuffSuccess);
    return *this;
}

Items& Items::bytes(std::uint16_t valueType, std::string_view data) {
    EXPECT_EQ(sb_packbuff_pack_bytes(packbuff_.get(), valueType, data.data(), static_cast<std::uint32_t>(data.size())),
              packbuffSuccess);
    return *this;
}

ByteVector Items::buffer() const {
    const std::uint8_t* const bytes = sb_packbuff_get_bytes(packbuff_.get());
    return {bytes, bytes + sb_packbuff_get_size(packbuff_.get())};
}

std::string UpcallReply::types() const {
    std::string types;
    for (const auto& [type, text] : items)
        types += (types.empty() ? "" : " ") + std::to_string(type);
    return types;
}

std::string UpcallReply::text(unsigned type) const {
    const auto isOfType = [&](const auto& item) { return item.first == type; };
    const auto found = std::ranges::find_if(items, isOfType);
    return std::ranges::count_if(items, isOfType) == 1 ? found->second : "";
}

std::vector<std::pair<std::string, std::string>> UpcallReply::groups(unsigned keyType) const {
    std::vector<std::pair<std::string, std::string>> found;
    for (std::size_t i = 0; i + 1 < items.size(); ++i)
        if (items[i].first == keyType && items[i + 1].first == keyType + 1)
            found.emplace_back(items[i].second, items[i + 1].second);
    return found;
}

UpcallReply replyIn(std::span<const std::uint8_t> packet) {
    UpcallReply reply;
    if (packet.size() < 20) {
        ADD_FAILURE() << "no reply: " << packet.size() << " bytes";
        return reply;
    }
    reply.messageId = numberAt(packet, 4);
    reply.returnCode = static_cast<std::int32_t>(numberAt(packet, 8));
    const std::uint32_t descriptorCount = numberAt(packet, 12);
    EXPECT_EQ(numberAt(packet, 0), descriptorCount == 1 ? 52U : 36U);
    EXPECT_EQ(numberAt(packet, 16), packet.size() - 20);
    if (descriptorCount != 1) {
        EXPECT_EQ(descriptorCount, 0U);
        EXPECT_EQ(packet.size(), 20U);
        return reply;
    }
    reply.bufferBytes = packet.size() - 20;
    ByteVector buffer(packet.begin() + 20, packet.end());
    if (buffer.empty())
        return reply;
    const PackbuffPointer reader(sb_packbuff_init_with_buffer(buffer.data(), buffer.size(), true, packbuffDeallocNone));
    std::uint16_t valueType = 0;
    while (sb_packbuff_get_item_value_type(reader.get(), &valueType) != 0) {
        int error = 0;
        std::uint32_t length = 0;
        if (valueType == upcall::CM_KERN_REPLY_STATUS) {
            reply.items.emplace_back(valueType, std::to_string(sb_packbuff_unpack_uint32(reader.get(), &error)));
        } else if (const char* text = sb_packbuff_unpack_string(reader.get(), &length, &error)) {
            reply.items.emplace_back(valueType, std::string(text, length));
        }
        if (error != 0) {
            ADD_FAILURE() << "item of type " << valueType << " cannot be read: " << error;
            return reply;
        }
    }
    EXPECT_TRUE(sb_packbuff_is_at_end(reader.get()));
    EXPECT_EQ(reader->item, reader->item_buffer + buffer.size() - packbuffHeaderBytes) << "more than its items";
    return reply;
}

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
