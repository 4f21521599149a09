// SPDX-License-Identifier: Apache-2.0
#include "support/FakeServer.h"

#include "ipc/Names.h"
#include "support/Files.h"
#include "support/Frames.h"

#include <fcntl.h>
#include <filesystem>
#include <sys/socket.h>

namespace zor::support {

using platform::FileDescriptor;

FakeServer::FakeServer(Serve serve, Accepts accepts, std::size_t depth)
    : root_(place_.path() + "/" + std::string(depth, 'r')), serve_(std::move(serve)),
      listening_(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
    const std::string directory = root_ + "/" + std::string(ipc::runtimeDirectory);
    std::filesystem::create_directories(directory);
    // The path may be longer than an address.
    const FileDescriptor opened = openDirectory(directory);
    const sockaddr_un address =
        addressOf("/proc/self/fd/" + std::to_string(opened.get()) + "/" + std::string(ipc::serviceName));
    checked(::bind(listening_.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), "bind");
    checked(::listen(listening_.get(), accepts == Accepts::one ? 1 : 16), "listen");
    acceptor_ = std::thread([this, accepts] {
        std::vector<std::jthread> connections;
        for (int client; (client = ::accept4(listening_.get(), nullptr, nullptr, SOCK_CLOEXEC)) >= 0;) {
            connections.emplace_back([this, client] {
                const FileDescriptor socket(client);
                serve_(socket.get());
            });
            if (accepts == Accepts::one)
                return;
        }
    });
}

FakeServer::~FakeServer() {
    ::shutdown(listening_.get(), SHUT_RD);
    if (acceptor_.joinable())
        acceptor_.join();
}

void FakeServer::stopListening() {
    acceptor_.join();
    listening_.reset();
}

} // namespace zor::support
