// SPDX-License-Identifier: Apache-2.0
// Everything that goes wrong on connections, counted, and told to the keeper of the log: of each kind a line now and
// then, so that clients cannot fill it. Any thread.
#pragma once

#include <array>
#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <string_view>
#include <utility>

namespace zor::platform {

enum class ListenerIncident : std::uint8_t {
    /// A connection was closed at once: the user, or the listener, has as many as it may.
    tooManyConnections,
    /// A connection was closed at once: the process is out of descriptors or memory.
    outOfDescriptors,
    /// The kernel does not say who connected.
    unknownPeer,
    /// Bytes came from another process than the one that connected.
    foreignSender,
    /// Something that is no request.
    brokenFrame,
    /// More of requests was buffered than the user may have buffered.
    tooMuchInput,
    /// A peer left more of its replies unread than is kept.
    tooMuchOutput,
    /// A reply that cannot be written: a fault of the daemon, or it has no memory for it.
    unwritableReply,
    /// A request could not be served to its end, mostly for want of memory.
    unservable,
};
inline constexpr std::size_t listenerIncidentKinds = 9;

/// Gets a line for the log. Any thread, one call at a time for each kind.
using ListenerReport = std::function<void(std::string_view line)>;

class ListenerIncidents {
public:
    ListenerIncidents(ListenerReport report, std::chrono::seconds lineEvery)
        : report_(std::move(report)), lineEvery_(lineEvery) {}
    /// `about` is the uid or the pid that the incident is about, `request` the client's number of the request whose
    /// reply is meant. Without memory the line is left out, not the count.
    void happened(ListenerIncident incident, std::int64_t about, std::uint64_t request = 0) noexcept;
    [[nodiscard]] std::uint64_t count(ListenerIncident incident) const;

private:
    struct Kind {
        std::atomic<std::uint64_t> count{0};
        std::atomic<std::uint64_t> countTold{0};
        /// A time of the steady clock.
        std::atomic<std::int64_t> tellFromSeconds{0};
    };
    const ListenerReport report_;
    const std::chrono::seconds lineEvery_;
    std::array<Kind, listenerIncidentKinds> kinds_;
};

} // namespace zor::platform
