// SPDX-License-Identifier: Apache-2.0
#include "Client.h"

#include "Processes.h"
#include "Statistics.h"
#include "ipc/Frame.h"
#include "plist/Codec.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <sys/socket.h>
#include <sys/un.h>

namespace zor::bench {

using platform::FileDescriptor;

namespace {

constexpr std::size_t bufferBytes = std::size_t{64} * 1024; // more than nearly any reply here
constexpr std::uint64_t requestId = 1;

} // namespace

Frame containerRequest(const std::string& identifier, ContainerClass containerClass, Create create) {
    plist::Dictionary rest;
    if (create == Create::yes)
        rest.set(ipc::keys::createIfNecessary, true);
    return containerFrame(ipc::Command::createOrLookupContainer, identifier, containerClass, std::move(rest));
}

Frame containerFrame(ipc::Command command, const std::string& identifier, ContainerClass containerClass,
                     plist::Dictionary rest) {
    rest.set(ipc::keys::command, static_cast<std::uint64_t>(command));
    rest.set(ipc::keys::containerClass, static_cast<std::uint64_t>(containerClass));
    rest.set(ipc::keys::userId, userOf(containerClass));
    rest.set(ipc::keys::identifier, identifier);
    return requestFrame(rest);
}

Frame requestFrame(const plist::Dictionary& request) {
    Frame frame(ipc::frameHeaderBytes);
    if (!plist::appendBinary(request, frame))
        throw Failure("a request cannot be written");
    const ipc::FrameHeader header = {.payloadBytes = static_cast<std::uint32_t>(frame.size() - ipc::frameHeaderBytes),
                                     .flags = ipc::frameExpectsReply,
                                     .id = requestId};
    ipc::encodeFrameHeader(header, std::span(frame).first<ipc::frameHeaderBytes>());
    return frame;
}

Client::Client(const std::string& directory, std::string_view name)
    : socket_(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)), buffer_(bufferBytes) {
    const FileDescriptor opened(::open(directory.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    // A socket's address is short; a directory's path may be longer.
    const std::string path = "/proc/self/fd/" + std::to_string(opened.get()) + "/" + std::string(name);
    sockaddr_un address{};
    if (!socket_.valid() || !opened.valid() || path.size() >= sizeof address.sun_path)
        throw Failure("no way to a socket in " + directory);
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
    if (::connect(socket_.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0)
        failWithErrno("connect to " + std::string(name));
}

void Client::send(std::span<const std::uint8_t> frame) {
    while (!frame.empty()) {
        const ssize_t sent = ::send(socket_.get(), frame.data(), frame.size(), MSG_NOSIGNAL);
        if (sent < 0 && errno != EINTR)
            failWithErrno("send");
        if (sent > 0)
            frame = frame.subspan(static_cast<std::size_t>(sent));
    }
}

std::span<const std::uint8_t> Client::receive() {
    std::size_t filled = 0;
    std::size_t wanted = ipc::frameHeaderBytes;
    while (filled < wanted) {
        const ssize_t received = ::recv(socket_.get(), buffer_.data() + filled, buffer_.size() - filled, 0);
        if (received == 0)
            throw Failure("the connection was ended by the other side");
        if (received < 0 && errno != EINTR)
            failWithErrno("recv");
        filled += received > 0 ? static_cast<std::size_t>(received) : 0;
        if (filled < ipc::frameHeaderBytes)
            continue;
        wanted = ipc::frameHeaderBytes +
                 ipc::decodeFrameHeader(std::span(buffer_).first<ipc::frameHeaderBytes>()).payloadBytes;
        if (wanted > buffer_.size())
            buffer_.resize(wanted);
    }
    return std::span(buffer_).first(wanted);
}

std::vector<double> roundTrips(Client& client, const Frame& request, const Frame& reply, int count) {
    std::vector<double> microseconds;
    microseconds.reserve(static_cast<std::size_t>(count));
    for (int i = 0; i < count; ++i) {
        const auto begin = Clock::now();
        const auto received = client.exchange(request);
        microseconds.push_back(secondsSince(begin) * 1e6);
        if (!std::ranges::equal(received, reply))
            throw Failure("two replies to one request differ");
    }
    return microseconds;
}

plist::Dictionary replyOf(std::span<const std::uint8_t> frame) {
    const auto value = plist::readBinary(frame.subspan(ipc::frameHeaderBytes));
    const plist::Dictionary* reply = value ? value->asDictionary() : nullptr;
    if (!reply)
        throw Failure("a reply is no dictionary");
    return *reply;
}

void mustSucceed(std::span<const std::uint8_t> frame, bool existed) {
    const plist::Dictionary reply = replyOf(frame);
    if (reply.unsignedInteger(ipc::keys::replyError) == ipc::replySuccess &&
        reply.isTrue(ipc::keys::replyExisted) == existed)
        return;
    const plist::Value value(reply);
    throw Failure("unexpected reply: " + plist::describe(&value));
}

plist::Dictionary succeed(Client& client, const Frame& request) {
    plist::Dictionary reply = replyOf(client.exchange(request));
    if (reply.unsignedInteger(ipc::keys::replyError) == ipc::replySuccess)
        return reply;
    const plist::Value value(reply);
    throw Failure("a request failed: " + plist::describe(&value));
}

Container makeContainer(Client& client, const std::string& identifier, ContainerClass containerClass,
                        Lifetime lifetime) {
    const plist::Dictionary reply =
        succeed(client, containerFrame(ipc::Command::createOrLookupContainer, identifier, containerClass,
                                       {{std::string(ipc::keys::createIfNecessary), true},
                                        {std::string(ipc::keys::transient), lifetime == Lifetime::transient}}));
    const std::string* path = reply.string(ipc::keys::replyPath);
    const plist::Value* uuid = reply.find(ipc::keys::replyUUID);
    if (!path || !uuid || reply.isTrue(ipc::keys::replyExisted))
        throw Failure("a container was not made: " + identifier);
    return {.path = *path, .uuid = *uuid};
}

} // namespace zor::bench
