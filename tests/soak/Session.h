// SPDX-License-Identifier: Apache-2.0
// The state that all threads of a soak share: the daemon, whether its surroundings are as they should be, and what was
// found.
#pragma once

#include "process/DaemonProcess.h"

#include <atomic>
#include <cstdio>
#include <deque>
#include <mutex>
#include <random>
#include <shared_mutex>
#include <thread>

namespace zor::soak {

using Count = unsigned long long;

inline void sleepMilliseconds(std::uint64_t milliseconds) {
    std::this_thread::sleep_for(std::chrono::milliseconds(milliseconds));
}

/// Choices by lot. The same seed makes the same choices, whatever the standard library: no distribution of its own is
/// used.
class Choices {
public:
    Choices(std::uint64_t seed, std::uint64_t stream) : random_(seed * 1'000'003 + stream) {}
    /// 0 to count - 1.
    std::uint64_t upTo(std::uint64_t count) { return random_() % count; }
    bool oneIn(std::uint64_t count) { return upTo(count) == 0; }

private:
    std::mt19937_64 random_;
};

/// For std::shared_lock and std::unique_lock. A thread that wants the gate alone gets it next: a lock that prefers
/// sharers would never be free of clients that ask without pause.
class Gate {
public:
    void lock_shared() {
        const std::lock_guard turn(turn_);
        inside_.lock_shared();
    }
    void unlock_shared() { inside_.unlock_shared(); }
    void lock() {
        turn_.lock();
        inside_.lock();
    }
    void unlock() {
        inside_.unlock();
        turn_.unlock();
    }

private:
    std::mutex turn_;
    std::shared_mutex inside_;
};

/// A fault of the surroundings that is made on purpose. It changes only while no client is inside a request.
enum class Trouble : std::uint8_t { none, diskFull, fewDescriptors };

class Session {
public:
    Session(whole::DaemonProcess& daemon, bool printsOperations)
        : daemon_(daemon), printsOperations_(printsOperations) {}

    [[nodiscard]] whole::DaemonProcess& daemon() { return daemon_; }
    [[nodiscard]] std::string root() const { return daemon_.root(); }
    /// After a moment without one when there is no daemon.
    void connect(std::optional<zorvane::Client>& client) const {
        if (auto connected = zorvane::Client::connect(daemon_.connection()))
            client.emplace(std::move(*connected));
        else
            sleepMilliseconds(2);
    }

    /// Held for a request and what belongs to it, and alone for what needs silence.
    Gate requests;
    std::atomic<Trouble> trouble{Trouble::none};
    std::atomic<bool> locked{false};
    /// Held by who moves things about in the hostile user's home, and by who mounts there.
    std::mutex hostileTree;
    /// Clients end at their next request.
    std::atomic<bool> stopped{false};

    /// The facts that are told at the end, or meanwhile.
    struct Record {
        std::vector<std::string> findings;
        std::map<std::string, Count> counts;
        std::deque<std::string> lastOperations;
    };
    [[nodiscard]] Record record() const {
        const std::lock_guard lock(mutex_);
        return record_;
    }
    /// Something that must not be. Ends the soak.
    void found(const std::string& what) {
        const std::lock_guard lock(mutex_);
        record_.findings.push_back(what);
        stopped = true;
    }
    /// Counts an operation, and keeps it for the end of a soak that finds something.
    void did(const std::string& client, const std::string& operation, const std::string& detail = "") {
        const std::lock_guard lock(mutex_);
        ++record_.counts[operation];
        record_.lastOperations.push_back(client + " " + operation + " " + detail);
        if (printsOperations_)
            std::puts(record_.lastOperations.back().c_str());
        if (record_.lastOperations.size() > 60)
            record_.lastOperations.pop_front();
    }

private:
    whole::DaemonProcess& daemon_;
    const bool printsOperations_;
    mutable std::mutex mutex_;
    Record record_;
};

/// One client with identifiers of its own: random requests until the session is stopped, and a look at everything.
/// `user`: as whom it connects; root or a mobile user.
void live(Session& session, unsigned number, std::uint32_t user, std::uint64_t seed);

} // namespace zor::soak
