// SPDX-License-Identifier: Apache-2.0
// The bytes of one connection on their way: requests that have arrived, replies that have not left.
#pragma once

#include "plist/Value.h"
#include "service/ListenerPool.h"
#include "service/ListenerShares.h"

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <sys/types.h>

namespace zor::platform {

// The bytes of one connection that have arrived and are not served yet.
//
// They are received into the worker's scratch buffer and looked at there; only what is left when the worker turns to
// another connection is kept, in a buffer that never grows faster than bytes arrive and is charged to the user. So an
// idle connection keeps none. A large request is received straight into that buffer. Belongs to the worker that has the
// connection.

class ListenerInput {
public:
    ListenerInput() = default;
    ListenerInput(const ListenerInput&) = delete;
    ListenerInput& operator=(const ListenerInput&) = delete;

    void open(ListenerCharges& charges, ListenerCharges::Account& account, int socket, pid_t peerPid);
    /// Gives the buffer and its charge back.
    void close();

    enum class Received {
        bytes,
        /// Bytes, and the kernel says that nobody's wait behind them: what comes after is told by an event of its own.
        lastBytes,
        /// Nothing has arrived.
        nothing,
        /// The stream has ended or broken.
        ended,
        /// The bytes were sent by another process than the peer. They are not kept.
        foreign,
        /// The user has too much buffered.
        tooMuch,
    };
    /// Receives once. The pending bytes are the beginning of one frame with a valid header, or less.
    [[nodiscard]] Received receive(int socket, ListenerScratch& scratch);

    /// The bytes to look at. A frame that has arrived whole lies in them whole. After consuming one, ask again.
    [[nodiscard]] std::span<const std::uint8_t> pending() const;
    void consume(std::size_t count);

    /// Makes what is pending independent of the scratch buffer. False when the user has too much buffered.
    [[nodiscard]] bool keep();

private:
    /// The place of the next bytes: first behind what is kept, then into the scratch buffer behind what lies there.
    struct Room {
        std::size_t kept = 0;
        std::size_t scratch = 0;
    };
    /// Puts what is pending where the rest of it can be received. nullopt when the user has too much buffered.
    [[nodiscard]] std::optional<Room> makeRoom(ListenerScratch& scratch);
    [[nodiscard]] bool resizeKept(std::size_t capacity);

    ListenerCharges* charges_ = nullptr;
    ListenerCharges::Account* account_ = nullptr;
    pid_t peerPid_ = 0;

    // In order: first what is kept, then what lies in the scratch buffer.
    std::unique_ptr<std::uint8_t[]> kept_;
    std::size_t keptCapacity_ = 0;
    std::size_t keptBegin_ = 0;
    std::size_t keptEnd_ = 0;
    std::span<const std::uint8_t> inScratch_;
};

// The replies of one connection that its peer has not taken yet. Nothing here blocks: what the socket does not take is
// kept and charged to the user, up to a limit. Guarded by the connection's mutex.

class ListenerOutput {
public:
    ListenerOutput() = default;
    ListenerOutput(const ListenerOutput&) = delete;
    ListenerOutput& operator=(const ListenerOutput&) = delete;

    void open(ListenerCharges& charges, ListenerCharges::Account& account, std::size_t bytesMax);
    /// Drops what is kept and gives its charge back.
    void discard();
    /// The same, for good.
    void close();

    /// The bytes that are kept. This alone may be read without the mutex.
    [[nodiscard]] std::size_t pendingBytes() const { return pendingBytes_.load(std::memory_order_relaxed); }

    enum class Result { done, kept, broken, tooMuch };
    /// Sends a frame behind what is kept. `frame` may be left with anything in it. After broken and tooMuch what is
    /// kept is to be discarded. Throws std::bad_alloc, and has done nothing then.
    [[nodiscard]] Result write(int socket, plist::Data& frame);
    /// Sends once of what is kept.
    [[nodiscard]] Result flush(int socket);

private:
    [[nodiscard]] bool charge(std::size_t bytes);
    void append(const plist::Data& frame);

    ListenerCharges* charges_ = nullptr;
    ListenerCharges::Account* account_ = nullptr;
    std::size_t bytesMax_ = 0;
    plist::Data kept_;
    std::size_t begin_ = 0;
    std::atomic<std::size_t> pendingBytes_{0};
};

} // namespace zor::platform
