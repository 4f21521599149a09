// SPDX-License-Identifier: Apache-2.0
// One client's connection. Objects are reused and live as long as the listener, so an event that is out of date finds
// an object, and that the object tells it so.
//
// The kernel tells each arrival once. The worker that takes the event *holds* the connection until the kernel has
// nothing more for it (also while it is requeued): it reads, serves and closes; nobody else does. An event that another
// worker takes meanwhile is left to the holder, who looks again before it lets go. That bytes came short of what there
// was room for tells nothing: those of another sender may wait behind them, and no event comes for those any more. So
// the holder receives until it finds nothing, unless its event told of an arrival alone and the kernel says, with the
// bytes, that none wait behind them: an end of the stream that is no news any more was in the event.
//
// Replies may be sent by any thread at any time. While some are unsent, the connection waits for room as well: the
// holder sees to that when it lets go, and with no holder the thread that sent.
#pragma once

#include "base/Mutex.h"
#include "platform/PeerIdentity.h"
#include "platform/Service.h"
#include "service/ListenerIncidents.h"
#include "service/ListenerInput.h"
#include "service/ListenerOutput.h"
#include "service/ListenerPool.h"
#include "service/PassedAlong.h"

#include <atomic>
#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>

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

} // namespace zor::platform
