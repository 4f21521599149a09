// SPDX-License-Identifier: Apache-2.0
// A root with a socket on which something answers that is no daemon: what a client meets that is lied to, kept waiting
// or hung up on.
#pragma once

#include "os/FileDescriptor.h"
#include "support/FileTree.h"

#include <functional>
#include <thread>

namespace zor::support {

class FakeServer {
public:
    /// Called by a thread for each connection, which ends when it returns.
    using Serve = std::function<void(int socket)>;
    enum class Accepts { all, one };
    /// `depth` more characters in the root's path.
    explicit FakeServer(Serve serve, Accepts accepts = Accepts::all, std::size_t depth = 1);
    /// Waits for the clients to go.
    ~FakeServer();
    FakeServer(const FakeServer&) = delete;
    FakeServer& operator=(const FakeServer&) = delete;
    [[nodiscard]] const std::string& root() const { return root_; }
    /// When its one client has gone; the socket stays, and nobody listens.
    void stopListening();

private:
    const TemporaryDirectory place_{"/tmp"};
    const std::string root_;
    const Serve serve_;
    platform::FileDescriptor listening_;
    std::thread acceptor_;
};

} // namespace zor::support
