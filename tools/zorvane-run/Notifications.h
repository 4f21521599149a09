// SPDX-License-Identifier: Apache-2.0
// The program's messages to the service manager (NOTIFY_SOCKET): that it is ready, what it does, that it still lives.
//
// The manager listens to the launcher, which is the unit's main process, and its socket is not in the sandbox. There
// the program finds one of this object's. The lines of each message that speak of the program's own state are sent on,
// and no descriptor: no other process can be named, nothing be left with the manager. A message that the manager does
// not take yet is kept, and no other is read meanwhile: a program that tells too much waits, the launcher does not. One
// thread.
#pragma once

#include "Failure.h"
#include "os/FileDescriptor.h"

#include <poll.h>
#include <string>
#include <string_view>
#include <vector>

namespace zorvanerun {

class Notifications {
public:
    /// The notifications of the caller's environment; without NOTIFY_SOCKET the program finds nothing, and nothing is
    /// sent.
    [[nodiscard]] static Result<Notifications> ofCaller();

    [[nodiscard]] bool areWanted() const { return manager_.valid(); }
    /// "NAME=VALUE" each, for the program.
    [[nodiscard]] std::vector<std::string> environment() const;
    /// For the maker of the sandbox: what shows the socket to the program.
    [[nodiscard]] std::vector<std::string> arguments() const;
    /// When all is staged. nullptr, or the name of the call that failed.
    [[nodiscard]] const char* appear() const;

    /// The event that pass() waits for; to be polled.
    [[nodiscard]] pollfd event() const;
    /// Sends on one message, if it can. False: nothing was there.
    bool pass();
    /// When the program has ended: all that it said. A manager that takes nothing for a second is told no more.
    void passRest();

private:
    zor::platform::FileDescriptor own_;
    zor::platform::FileDescriptor manager_;
    /// For the manager, which does not take it yet.
    std::string waiting_;
    std::string watchdog_;
};

/// The lines of a message that the manager may be told.
[[nodiscard]] std::string passedOnOf(std::string_view message);

} // namespace zorvanerun
