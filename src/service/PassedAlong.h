// SPDX-License-Identifier: Apache-2.0
// Keeps what peers pass along with their bytes from holding a thread.
//
// Nobody here wants a descriptor of a peer's. But whoever receives the bytes, or closes a socket that has them in its
// queue, drops the last reference, and then the kernel closes it in that thread, before the call returns. How long that
// takes is the peer's choice: a TCP socket that lingers waits until its far end reads. Kernels from 6.16 refuse such
// descriptors at the sender. On others, and for what was sent before a listening socket came to the daemon, a signal
// ends the wait: the call then returns what it would have returned at once.
//
// Receiving for clients is the hot path: it leaves a mark, and the pool's watcher, which looks whenever no thread
// waits for work, interrupts whoever stays. All other calls on sockets in use that may close something of a peer's are
// made in an InterruptedScope, but for the upcall's receives: who gets to that socket owns the root.
#pragma once

#include "os/FileDescriptor.h"

#include <atomic>
#include <cstdint>
#include <sys/types.h>
#include <utility>

namespace zor::platform {

/// For a listening socket: sockets that connect to it from now on cannot be sent descriptors, where the kernel can see
/// to that.
void refuseDescriptors(int listening);

/// Lets the calling thread be interrupted. The signal for it does nothing else, and restarts what it can.
void allowInterrupts();
/// Interrupts a thread of this process that allowed it; one that has ended is no harm.
void interruptThread(pid_t threadId);

/// While it lives the calling thread is interrupted again and again. Scopes do not nest.
class InterruptedScope {
public:
    InterruptedScope();
    ~InterruptedScope();
    InterruptedScope(const InterruptedScope&) = delete;
    InterruptedScope& operator=(const InterruptedScope&) = delete;
};

/// A thread's word on whether it is receiving, for the one thread that watches it.
class ReceivingMark {
public:
    void begin() { step(); }
    void end() { step(); }
    /// Whether it has been in one receive since the last look.
    [[nodiscard]] bool hasStayed() {
        const std::uint64_t now = steps_.load(std::memory_order_relaxed);
        return now == std::exchange(seen_, now) && now % 2 == 1;
    }

    [[nodiscard]] bool isSet() const { return steps_.load(std::memory_order_relaxed) % 2 == 1; }

private:
    void step() { steps_.store(steps_.load(std::memory_order_relaxed) + 1, std::memory_order_relaxed); }

    /// Odd inside a receive.
    std::atomic<std::uint64_t> steps_{0};
    std::uint64_t seen_ = 0;
};

/// Owner of a socket in whose queue something of a peer's may lie when it is closed: a connection, or one that listens.
class PeerSocket {
public:
    PeerSocket() = default;
    explicit PeerSocket(FileDescriptor socket) : socket_(std::move(socket)) {}
    PeerSocket(PeerSocket&&) noexcept = default;
    PeerSocket& operator=(PeerSocket&& other) noexcept {
        FileDescriptor taken = std::move(other.socket_);
        reset();
        socket_ = std::move(taken);
        return *this;
    }
    PeerSocket(const PeerSocket&) = delete;
    PeerSocket& operator=(const PeerSocket&) = delete;
    ~PeerSocket() { reset(); }

    [[nodiscard]] int get() const { return socket_.get(); }
    [[nodiscard]] bool valid() const { return socket_.valid(); }
    void reset() noexcept;

private:
    FileDescriptor socket_;
};

} // namespace zor::platform
