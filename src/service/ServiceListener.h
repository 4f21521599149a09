// SPDX-License-Identifier: Apache-2.0
// The named service on a stream socket: accepts connections and has an elastic pool of threads serve them.
//
// The thread that finds a connection readable reads the frames, calls the handler and sends the reply itself. Memory
// and connections are bounded (ListenerShares.h); no peer can make a thread wait.
//
// ListenerSocket        who gets in                   ListenerConnection   one peer: frames in, replies out
// ListenerPool          the threads, one epoll        ListenerInput/Output its buffers
// ListenerTurns         whose turn it is
// ListenerLimits        who may use how much          ListenerIncidents    what is counted and logged
// PassedAlong           descriptors sent by peers
#pragma once

#include "platform/Errno.h"
#include "platform/Service.h"
#include "service/ListenerConnection.h"
#include "service/ListenerShares.h"
#include "service/ListenerSocket.h"

#include <cstdint>
#include <memory>

namespace zor::platform {

struct ListenerCore;

struct ListenerOptions {
    /// The place where the socket is made (mode 0666) and, on stop, removed.
    ListenerAddress address;
    /// A listening socket that the service manager made; when valid it is used, and the address is not.
    FileDescriptor passed;
    ListenerLimits limits;
    /// Gets lines for the log, now and then one of each kind.
    ListenerReport report;
};

struct ListenerCounters {
    std::uint64_t connections = 0;
    std::uint64_t connectionsAccepted = 0;
    std::uint64_t connectionsRefused = 0;
    std::uint64_t messages = 0;
    std::uint64_t brokenFrames = 0;
    std::uint64_t foreignSenders = 0;
    std::uint64_t connectionsDropped = 0;
    std::uint64_t inputBytes = 0;
    std::uint64_t outputBytes = 0;
    std::uint64_t threads = 0;
    std::uint64_t threadsBlocked = 0;
    std::uint64_t threadsMost = 0;
};

class ServiceListener {
public:
    ServiceListener(PeerIdentity& identity, ListenerOptions options);
    ~ServiceListener();
    ServiceListener(const ServiceListener&) = delete;
    ServiceListener& operator=(const ServiceListener&) = delete;

    /// Begins to accept and serve. Once. False, with errno, on failure; nobody can connect to a socket that the
    /// listener made then.
    [[nodiscard]] bool resume(ServiceHandler handler);
    /// Stops accepting, ends every connection and joins the threads. Each connection that is still open gets its
    /// invalid event from the calling thread. Replies that come later go nowhere.
    void stop();

    /// Whether the pool has answered the question of the last call; asks a new one. For one thread that calls it now
    /// and then, between resume and stop.
    [[nodiscard]] bool answers();

    /// All zero before resume. Any thread, but not during resume.
    [[nodiscard]] ListenerCounters counters() const;

private:
    class Acceptance;
    class Probe;

    /// Something may have begun in spite of an error.
    Errno begin(ServiceHandler handler);
    Errno takeSocket();

    PeerIdentity& identity_;
    ListenerOptions options_;
    bool socketIsOurs_ = false;
    PeerSocket socket_;
    std::unique_ptr<ListenerCore> core_;
    std::unique_ptr<Acceptance> acceptance_;
    std::unique_ptr<Probe> probe_;
};

} // namespace zor::platform
