// SPDX-License-Identifier: Apache-2.0
// A root with a socket that passes requests on to a real daemon, or loses them where the test wants that: what a client
// meets whose daemon is slow, or is being started anew.
#pragma once

#include "ipc/Keys.h"
#include "os/FileDescriptor.h"
#include "process/DaemonProcess.h"

#include <functional>
#include <thread>

namespace zor::whole {

class Relay {
public:
    enum class Fate {
        passedOn,
        /// Nothing comes for ten seconds, or until the client goes; then the connection ends.
        unanswered,
        hungUp,
    };
    /// Called by a thread for each connection.
    using Judge = std::function<Fate(ipc::Command)>;
    Relay(const DaemonProcess& daemon, Judge judge);
    /// Waits for the clients to go.
    ~Relay();
    Relay(const Relay&) = delete;
    Relay& operator=(const Relay&) = delete;
    [[nodiscard]] std::string root() const { return place_.path(); }

private:
    void serve(int client) const;

    const support::TemporaryDirectory place_;
    const std::string daemon_;
    const Judge judge_;
    platform::FileDescriptor listening_;
    std::thread acceptor_;
};

} // namespace zor::whole
