// SPDX-License-Identifier: Apache-2.0
// What all threads of a soak share: the daemon, whether its surroundings are as they should be, and what was found.
#pragma once

#include "process/DaemonProcess.h"
#include "soak/Gate.h"

#include <atomic>
#include <deque>
#include <map>
#include <mutex>
#include <string>
#include <vector>

namespace zor::soak {

/// What is wrong with the surroundings on purpose. It changes only while no client is inside a request.
enum class Trouble : std::uint8_t { none, diskFull, fewDescriptors };

class Session {
public:
    Session(whole::DaemonProcess& daemon, bool printsOperations)
        : daemon_(daemon), printsOperations_(printsOperations) {}

    [[nodiscard]] whole::DaemonProcess& daemon() { return daemon_; }
    [[nodiscard]] std::string root() const { return daemon_.root(); }

    /// Held for a request and what belongs to it, and alone for what needs silence.
    Gate requests;
    std::atomic<Trouble> trouble{Trouble::none};
    std::atomic<bool> locked{false};
    /// Clients end at their next request.
    std::atomic<bool> stopped{false};

    /// Something that must not be. Ends the soak.
    void found(const std::string& what);
    [[nodiscard]] std::vector<std::string> findings() const;
    /// Counts an operation, and keeps it for the end of a soak that finds something.
    void did(const std::string& client, const std::string& operation, const std::string& detail);
    [[nodiscard]] std::map<std::string, std::uint64_t> counts() const;
    [[nodiscard]] std::deque<std::string> lastOperations() const;

private:
    whole::DaemonProcess& daemon_;
    const bool printsOperations_;
    mutable std::mutex mutex_;
    std::vector<std::string> findings_;
    std::map<std::string, std::uint64_t> counts_;
    std::deque<std::string> last_;
};

} // namespace zor::soak
