// SPDX-License-Identifier: Apache-2.0
#include "process/Relay.h"

#include "ipc/Frame.h"
#include "ipc/Names.h"
#include "plist/Binary.h"

#include <cstring>
#include <filesystem>
#include <sys/socket.h>
#include <sys/un.h>

namespace zor::whole {

using platform::FileDescriptor;

namespace {

sockaddr_un addressIn(const std::string& root) {
    sockaddr_un address{.sun_family = AF_UNIX, .sun_path = {}};
    const std::string path = root + "/" + std::string(ipc::runtimeDirectory) + "/" + std::string(ipc::serviceName);
    std::memcpy(address.sun_path, path.data(), std::min(path.size(), sizeof address.sun_path - 1));
    return address;
}

/// Empty at the end.
plist::Data receiveFrame(int socket) {
    plist::Data frame(ipc::frameHeaderBytes);
    if (::recv(socket, frame.data(), frame.size(), MSG_WAITALL) != static_cast<ssize_t>(frame.size()))
        return {};
    const auto header = ipc::decodeFrameHeader(std::span(frame).first<ipc::frameHeaderBytes>());
    frame.resize(frame.size() + header.payloadBytes);
    if (::recv(socket, frame.data() + ipc::frameHeaderBytes, header.payloadBytes, MSG_WAITALL) !=
        static_cast<ssize_t>(header.payloadBytes))
        return {};
    return frame;
}

ipc::Command commandOf(const plist::Data& frame) {
    auto request = plist::readBinary(std::span(frame).subspan(ipc::frameHeaderBytes));
    const plist::Dictionary* content = request ? request->asMutableDictionary() : nullptr;
    return static_cast<ipc::Command>(content ? content->unsignedInteger(ipc::keys::command).value_or(0) : 0);
}

} // namespace

Relay::Relay(const DaemonProcess& daemon, Judge judge) : daemon_(daemon.root()), judge_(std::move(judge)) {
    std::filesystem::create_directories(root() + "/" + std::string(ipc::runtimeDirectory));
    listening_.reset(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    const sockaddr_un address = addressIn(root());
    if (::bind(listening_.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0 ||
        ::listen(listening_.get(), 16) != 0)
        std::abort();
    acceptor_ = std::thread([this] {
        std::vector<std::jthread> connections;
        for (int client; (client = ::accept4(listening_.get(), nullptr, nullptr, SOCK_CLOEXEC)) >= 0;)
            connections.emplace_back([this, client] { serve(client); });
    });
}

Relay::~Relay() {
    ::shutdown(listening_.get(), SHUT_RD);
    acceptor_.join();
}

void Relay::serve(int client) const {
    const FileDescriptor from(client);
    const FileDescriptor to(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    const sockaddr_un address = addressIn(daemon_);
    if (::connect(to.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0)
        return;
    for (plist::Data request; !(request = receiveFrame(from.get())).empty();) {
        const Fate fate = judge_(commandOf(request));
        if (fate == Fate::unanswered) {
            const timeval patience{.tv_sec = 10, .tv_usec = 0};
            ::setsockopt(from.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
            (void)receiveFrame(from.get());
        }
        if (fate != Fate::passedOn)
            return;
        ::send(to.get(), request.data(), request.size(), MSG_NOSIGNAL);
        const plist::Data reply = receiveFrame(to.get());
        ::send(from.get(), reply.data(), reply.size(), MSG_NOSIGNAL);
    }
}

} // namespace zor::whole
