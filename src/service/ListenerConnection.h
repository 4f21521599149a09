// SPDX-License-Identifier: Apache-2.0
// One client's connection. Objects are reused and live as long as the listener, so an event that is out of date finds
// an object, which finds that it is out of date.
//
// The kernel tells each arrival once. The worker that takes the event *holds* the connection until the kernel has
// nothing more for it (also while it is requeued): it reads, serves and closes; nobody else does. An event that another
// worker takes meanwhile is left to the holder, who looks again before it lets go. A receive that brings fewer bytes
// than there is room for does not mean that none are left: bytes of another sender may wait behind them, of which no
// further event tells. So the holder receives until it finds nothing, unless its event told of an arrival alone (not of
// an end of the stream) and the kernel says, with the bytes, that none wait behind them.
//
// Replies may be sent by any thread at any time. While some are unsent, the connection waits for room as well: the
// holder sees to that when it lets go, and with no holder the thread that sent.
#pragma once

#include "base/Mutex.h"
#include "platform/Service.h"
#include "service/ListenerPool.h"
#include "service/ListenerShares.h"
#include "service/ListenerStreams.h"
#include "service/PassedAlong.h"

#include <array>
#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string_view>
#include <utility>
#include <vector>

namespace zor::platform {

// Everything that goes wrong on connections, counted, and told to the keeper of the log: of each kind a line now and
// then, so that clients cannot fill it. Any thread.

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

namespace zor::ipc {
struct FrameHeader;
}

namespace zor::platform {

struct ListenerCore;

class ListenerConnection final : public ListenerTask,
                                 public PeerConnection,
                                 public std::enable_shared_from_this<ListenerConnection> {
public:
    explicit ListenerConnection(ListenerCore& core) : core_(core) {}

    /// Begins to serve. The account holds the charge of this connection and is given back at its end.
    void open(PeerSocket socket, std::unique_ptr<Peer> peer, ListenerCharges::Account& account) ZOR_EXCLUDES(mutex_);
    /// Ends the connection when no worker is left. Nothing happens when it has ended already.
    void endAfterStop() ZOR_EXCLUDES(mutex_);

    // ListenerTask
    void run(ListenerScratch& scratch, std::uint32_t events) override ZOR_EXCLUDES(mutex_);
    // PeerConnection
    Peer& peer() override { return *peer_; }
    void cancel() override ZOR_EXCLUDES(mutex_);

private:
    class Channel;

    enum class Outcome {
        /// Wait for the next event.
        wait,
        /// More is there, but others come first.
        requeue,
        end,
    };

    /// How much of its turn the connection has had.
    struct Turn {
        unsigned frames = 0;
        unsigned receives = 0;
        /// Nothing but an arrival was told, so all else is still to come with an event.
        bool onlyArrival = false;
        /// Looked at when a second frame is at hand: most turns have one, and need no clock.
        std::chrono::steady_clock::time_point firstServed;
    };

    /// Sends on of what is kept, as far as there is room, and forgets what has happened before: whether anything has.
    bool lookAtRoom() ZOR_EXCLUDES(mutex_);
    Outcome serve(ListenerScratch& scratch, Turn& turn);
    [[nodiscard]] bool isOver(Turn& turn) const;
    /// Keeps what has arrived of the next request, whatever the worker's scratch buffer is used for meanwhile.
    Outcome keepRest(Outcome outcome);
    /// Serves the frames that have arrived whole. nullopt when more has to be received.
    std::optional<Outcome> serveArrived(ListenerScratch& scratch, Turn& turn);
    /// False when it was no request.
    bool serveFrame(const ipc::FrameHeader& header, std::span<const std::uint8_t> payload);
    Outcome endWithOther(ListenerIncident incident);
    Outcome endWithIncident(ListenerIncident incident, std::int64_t about);
    std::shared_ptr<Channel> channelFor(std::uint64_t id) ZOR_EXCLUDES(mutex_);
    /// Ends the hold. False when there is more to do.
    bool letGo() ZOR_EXCLUDES(mutex_);
    /// Has epoll tell what the connection waits for now. False when it cannot be told.
    [[nodiscard]] bool await() ZOR_REQUIRES(mutex_);
    void close() ZOR_EXCLUDES(mutex_);

    /// Sends one frame for a channel, if that still stands for a reply of this life.
    void transmit(Channel& channel, plist::Data& frame) ZOR_EXCLUDES(mutex_);
    [[nodiscard]] std::uint32_t eventsWanted() const;
    void unwritable(Channel& channel) ZOR_EXCLUDES(mutex_);
    /// Ends the connection from any thread: whoever holds it, or the worker that its end wakes, closes it.
    void dropLocked() ZOR_REQUIRES(mutex_);

    ListenerCore& core_;

    // Members of the connection's holder.
    ListenerInput input_;
    std::unique_ptr<Peer> peer_;
    /// Used again for the next request when nobody else has kept it.
    std::shared_ptr<Channel> channel_;
    int descriptor_ = -1;

    /// No more requests are served and no more replies sent. Once set it stays so for this life.
    std::atomic<bool> over_{false};

    /// An event has come since the holder began to look the last time.
    std::atomic<bool> lookAgain_{false};

    Mutex mutex_;
    /// Closed only by the holder, who therefore may use descriptor_, the same number, without the mutex.
    PeerSocket socket_ ZOR_GUARDED_BY(mutex_);
    ListenerCharges::Account* account_ ZOR_GUARDED_BY(mutex_) = nullptr;
    uid_t uid_ ZOR_GUARDED_BY(mutex_) = 0;
    bool open_ ZOR_GUARDED_BY(mutex_) = false;
    bool held_ ZOR_GUARDED_BY(mutex_) = false;
    std::uint32_t awaited_ ZOR_GUARDED_BY(mutex_) = 0;
    /// Which of the connections that this object has been; a channel belongs to one.
    std::uint64_t life_ ZOR_GUARDED_BY(mutex_) = 0;
    /// pendingBytes() may be read without the mutex.
    ListenerOutput output_;
};

// The state that the connections of one listener share. It outlives them while they are open.

struct ListenerCore {
    ListenerCore(const ListenerLimits& theLimits, ListenerReport report)
        : limits(theLimits), charges(theLimits), incidents(std::move(report), theLimits.incidentLineEvery),
          pool(theLimits) {}

    [[nodiscard]] std::shared_ptr<ListenerConnection> unusedConnection() ZOR_EXCLUDES(mutex);
    /// The connection has ended and its object may be used for another.
    void recycle(ListenerConnection& connection) ZOR_EXCLUDES(mutex);

    const ListenerLimits limits;
    ServiceHandler handler;
    ListenerCharges charges;
    ListenerIncidents incidents;
    std::atomic<std::uint64_t> accepted{0};

    Mutex mutex;
    std::vector<std::shared_ptr<ListenerConnection>> connections ZOR_GUARDED_BY(mutex);
    std::vector<ListenerConnection*> unused ZOR_GUARDED_BY(mutex);

    /// Last: its threads use all of the above.
    ListenerPool pool;
};

} // namespace zor::platform
