// SPDX-License-Identifier: Apache-2.0
// A root with a socket that passes requests on to a real daemon, or loses them where the test wants that: what a client
// meets whose daemon is slow, or is being started anew.
#pragma once

#include "ipc/Keys.h"
#include "process/DaemonProcess.h"
#include "support/FakeServer.h"

namespace zor::whole {

class Relay : public support::FakeServer {
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
};

} // namespace zor::whole
