// SPDX-License-Identifier: Apache-2.0
// The status socket: whoever connects gets one reply frame (id 0) and the end of the stream. Nothing is read, so there
// is no request that could go wrong, and a program that is refused everywhere else can ask why.
//
// Everything happens on the run loop's thread and never blocks it: the brief form of a reply is sent when a new
// connection's buffer would not take the full one.
#pragma once

#include "os/RunLoop.h"
#include "platform/Errno.h"
#include "platform/Service.h"
#include "plist/Value.h"
#include "service/ListenerSocket.h"

#include <functional>

namespace zor::platform {

class StatusSocket {
public:
    /// Without what may grow with the number of containers, or whole.
    enum class Detail { brief, full };
    /// Makes the dictionary for one peer.
    using Build = std::function<plist::Dictionary(Peer&, Detail)>;

    StatusSocket(PeerIdentity& identity, RunLoop& runLoop, Build build);
    ~StatusSocket();
    StatusSocket(const StatusSocket&) = delete;
    StatusSocket& operator=(const StatusSocket&) = delete;

    /// Makes the socket (mode 0666) and begins to answer. The address's directory stays open meanwhile.
    Errno open(const ListenerAddress& address);
    /// The same with a listening socket that the service manager made.
    Errno adopt(FileDescriptor listening);
    /// Ends it; a socket that open made is removed. On the loop's thread, or when the loop does not run.
    void close();

private:
    Errno serve();
    void answerAll();
    void answer(int socket);
    /// False when it cannot be written as a frame.
    [[nodiscard]] bool makeFrame(Peer& peer, Detail detail);
    /// Asks for a buffer that takes the frame; whether the socket has one then.
    [[nodiscard]] bool fits(int socket) const;

    PeerIdentity& identity_;
    RunLoop& runLoop_;
    const Build build_;
    PeerSocket listening_;
    ListenerAddress made_;
    ListenerAcceptor acceptor_;
    plist::Data frame_;
};

} // namespace zor::platform
