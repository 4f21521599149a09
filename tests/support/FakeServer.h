// SPDX-License-Identifier: Apache-2.0
// A root with a socket on which something answers that is no daemon: what a client meets that is lied to, kept waiting
// or hung up on.
#pragma once

#include "ipc/Protocol.h"
#include "support/FileTree.h"
#include "support/Files.h"
#include "support/Frames.h"

#include <fcntl.h>
#include <filesystem>
#include <functional>
#include <thread>

namespace zor::support {

class FakeServer {
public:
    /// Called by a thread for each connection, which ends when it returns.
    using Serve = std::function<void(int socket)>;
    enum class Accepts { all, one };
    /// `depth` more characters in the root's path.
    explicit FakeServer(Serve serve, Accepts accepts = Accepts::all, std::size_t depth = 1)
        : root_(place_.path() + "/" + std::string(depth, 'r')), serve_(std::move(serve)) {
        const std::string directory = root_ + "/" + std::string(ipc::runtimeDirectory);
        std::filesystem::create_directories(directory);
        // The path may be longer than an address.
        const platform::FileDescriptor opened = openDirectory(directory);
        const std::string path = "/proc/self/fd/" + std::to_string(opened.get()) + "/";
        checked(bindTo(listening_.get(), path + std::string(ipc::serviceName)) ? 0 : -1, "bind");
        checked(::listen(listening_.get(), accepts == Accepts::one ? 1 : 16), "listen");
        acceptor_ = std::thread([this, accepts] {
            std::vector<std::jthread> connections;
            for (int client; (client = ::accept4(listening_.get(), nullptr, nullptr, SOCK_CLOEXEC)) >= 0;) {
                connections.emplace_back([this, client] {
                    const platform::FileDescriptor socket(client);
                    serve_(socket.get());
                });
                if (accepts == Accepts::one)
                    return;
            }
        });
    }
    /// Waits for the clients to go.
    ~FakeServer() {
        ::shutdown(listening_.get(), SHUT_RD);
        if (acceptor_.joinable())
            acceptor_.join();
    }
    [[nodiscard]] const std::string& root() const { return root_; }
    /// When its one client has gone; the socket stays, and nobody listens.
    void stopListening() {
        acceptor_.join();
        listening_.reset();
    }

private:
    const TemporaryDirectory place_{"/tmp"};
    const std::string root_;
    const Serve serve_;
    platform::FileDescriptor listening_{::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    std::thread acceptor_;
};

} // namespace zor::support
