// SPDX-License-Identifier: Apache-2.0
// Tells the service manager how the daemon is, over the datagram socket that NOTIFY_SOCKET names. Any thread.
#pragma once

#include <chrono>
#include <optional>
#include <string>
#include <string_view>

namespace zor::platform {

class NotifySocket {
public:
    /// `address` is the variable's value: a path, or "@" and an abstract name. Empty: nobody wants to know.
    explicit NotifySocket(std::string address) : address_(std::move(address)) {}
    /// The one of this process's environment.
    [[nodiscard]] static NotifySocket ofEnvironment();

    /// How long the manager waits for each "WATCHDOG=1" of this process, as its environment says; absent: it does not.
    [[nodiscard]] static std::optional<std::chrono::microseconds> watchdogOfEnvironment();

    /// "READY=1", "STOPPING=1", "STATUS=..." or several of them, a line each. 0 (also when nobody wants to know) or an
    /// errno. Waits a few seconds at most.
    [[nodiscard]] int send(std::string_view state) const;

private:
    std::string address_;
};

} // namespace zor::platform
