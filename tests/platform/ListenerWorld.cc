// SPDX-License-Identifier: Apache-2.0
#include "platform/ListenerWorld.h"

#include "plist/Binary.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <system_error>
#include <thread>
#include <unistd.h>

namespace zor::platform::test {

namespace {

class KernelPeer final : public Peer {
public:
    KernelPeer(const ucred& credentials, std::atomic<int>& peers) : credentials_(credentials), peers_(peers) {
        ++peers_;
    }
    ~KernelPeer() override { --peers_; }
    Identity identify(Explain) override { return {.pid = credentials_.pid, .effectiveUserId = credentials_.uid}; }
    pid_t pid() const override { return credentials_.pid; }
    uid_t kernelUserId() const override { return credentials_.uid; }

private:
    const ucred credentials_;
    std::atomic<int>& peers_;
};

} // namespace

std::unique_ptr<Peer> KernelIdentity::peerOfSocket(int socket) {
    if (!knowsPeers)
        return nullptr;
    ucred credentials = {};
    socklen_t length = sizeof credentials;
    if (::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0)
        return nullptr;
    return std::make_unique<KernelPeer>(credentials, peers);
}

plist::Data frameOf(std::uint32_t length, std::uint32_t flags, std::uint64_t id, const plist::Data& payload) {
    plist::Data frame(ipc::frameHeaderBytes);
    ipc::encodeFrameHeader({.payloadBytes = length, .flags = flags, .id = id},
                           std::span(frame).first<ipc::frameHeaderBytes>());
    frame.insert(frame.end(), payload.begin(), payload.end());
    return frame;
}

plist::Data frameOf(const plist::Dictionary& message, std::uint64_t id, std::uint32_t flags) {
    const auto payload = plist::writeBinary(message);
    return frameOf(static_cast<std::uint32_t>(payload->size()), flags, id, *payload);
}

plist::Dictionary numbered(std::uint64_t number) {
    return {{"Number", number}};
}

RawClient::RawClient(const std::string& socketPath) : socket_(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, socketPath.c_str(), socketPath.size() + 1);
    if (!socket_.valid() || ::connect(socket_.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0)
        throw std::system_error(errno, std::generic_category(), "connect");
    const timeval timeout = {.tv_sec = 10, .tv_usec = 0};
    ::setsockopt(socket_.get(), SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
    ::setsockopt(socket_.get(), SOL_SOCKET, SO_SNDTIMEO, &timeout, sizeof timeout);
}

bool RawClient::send(const plist::Data& bytes) {
    for (std::size_t done = 0; done < bytes.size();) {
        const ssize_t count = ::send(socket_.get(), bytes.data() + done, bytes.size() - done, MSG_NOSIGNAL);
        if (count < 0)
            return false;
        done += static_cast<std::size_t>(count);
    }
    return true;
}

bool RawClient::receiveExactly(std::uint8_t* bytes, std::size_t count) {
    for (std::size_t done = 0; done < count;) {
        const ssize_t received = ::recv(socket_.get(), bytes + done, count - done, 0);
        if (received <= 0)
            return false;
        done += static_cast<std::size_t>(received);
    }
    return true;
}

std::optional<Reply> RawClient::receive() {
    std::array<std::uint8_t, ipc::frameHeaderBytes> bytes;
    if (!receiveExactly(bytes.data(), bytes.size()))
        return std::nullopt;
    const ipc::FrameHeader header = ipc::decodeFrameHeader(bytes);
    EXPECT_TRUE(header.isValidReply());
    plist::Data payload(header.payloadBytes);
    if (!receiveExactly(payload.data(), payload.size()))
        return std::nullopt;
    auto value = plist::readBinary(payload);
    if (!value || !value->asDictionary())
        return std::nullopt;
    return Reply{.id = header.id, .message = std::move(*value->asMutableDictionary())};
}

std::optional<Reply> RawClient::receiveIfAny() {
    pollfd descriptor = {.fd = socket_.get(), .events = POLLIN, .revents = 0};
    return ::poll(&descriptor, 1, 5) > 0 ? receive() : std::nullopt;
}

bool RawClient::ended() {
    std::uint8_t byte = 0;
    const ssize_t received = ::recv(socket_.get(), &byte, 1, 0);
    return received == 0 || (received < 0 && errno == ECONNRESET);
}

bool RawClient::isServed() {
    const std::optional<Reply> reply = send(numbered(77), 4711) ? receive() : std::nullopt;
    return reply && reply->id == 4711 && reply->message == numbered(77);
}

ListenerWorld::ListenerWorld() : directory_("/tmp/zorvane-listener-XXXXXX") {
    if (!::mkdtemp(directory_.data()))
        throw std::system_error(errno, std::generic_category(), "mkdtemp");
    directoryDescriptor_.reset(::open(directory_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    socketPath_ = directory_ + "/service";
}

ListenerWorld::~ListenerWorld() {
    stop();
    ::unlink(socketPath_.c_str());
    ::rmdir(directory_.c_str());
}

void ListenerWorld::start(MessageHandler onMessage) {
    onMessage_ = std::move(onMessage);
    ListenerOptions options;
    options.address = {.directory = directoryDescriptor_.get(), .directoryPath = directory_, .name = "service"};
    options.limits = limits;
    options.report = [this](std::string_view line) {
        const std::lock_guard lock(mutex_);
        reports_.emplace_back(line);
    };
    listener_ = std::make_unique<LinuxServiceListener>(identity, std::move(options));
    const bool resumed = listener_->resume([this](PeerConnection& connection, ServiceEvent& event) {
        {
            const std::lock_guard lock(mutex_);
            EXPECT_TRUE(inHandler_.insert(&connection).second) << "two events of one connection at once";
        }
        handle(connection, event);
        const std::lock_guard lock(mutex_);
        inHandler_.erase(&connection);
    });
    if (!resumed)
        throw std::system_error(errno, std::generic_category(), "resume");
}

void ListenerWorld::handle(PeerConnection& connection, ServiceEvent& event) {
    switch (event.kind) {
    case ServiceEvent::Kind::message:
        ++counts.messages;
        if (onMessage_)
            onMessage_(connection, event);
        else if (event.reply)
            event.reply->send(event.request);
        return;
    case ServiceEvent::Kind::other:
        ++counts.others;
        EXPECT_EQ(event.reply, nullptr);
        return;
    case ServiceEvent::Kind::invalid:
        ++counts.invalids;
        return;
    }
}

void ListenerWorld::stop() {
    if (listener_)
        listener_->stop();
}

bool ListenerWorld::isAtRest() {
    return eventually([this] {
        const ListenerCounters now = listener_->counters();
        return now.connections == 0 && now.inputBytes == 0 && now.outputBytes == 0 && identity.peers == 0;
    });
}

std::vector<std::string> ListenerWorld::reports() {
    const std::lock_guard lock(mutex_);
    return reports_;
}

bool eventually(const std::function<bool()>& condition) {
    const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (!condition()) {
        if (std::chrono::steady_clock::now() > end)
            return false;
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    return true;
}

} // namespace zor::platform::test
