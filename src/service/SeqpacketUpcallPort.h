// SPDX-License-Identifier: Apache-2.0
// The upcall port as a SOCK_SEQPACKET socket that only the root's owner can connect to.
//
// Each packet carries the credentials that the kernel took of its sender. The sender counts as the kernel (pid 0) only
// when it is the very process that connected, runs under the daemon's own uid, and its executable is registered as a
// kernel agent. A sender whose pid the kernel cannot name here (another pid namespace) has no credentials at all: pid 0
// as such is never taken from the wire.
//
// Everything runs on the loop's thread and never blocks it: a reply that the peer's queue does not take is dropped.
#pragma once

#include "os/FileDescriptor.h"
#include "os/SystemRoot.h"
#include "platform/Errno.h"
#include "platform/Service.h"
#include "service/ListenerSocket.h"

#include <map>
#include <memory>
#include <sys/socket.h>

namespace zor::platform {

class SeqpacketUpcallPort final : public UpcallPort {
public:
    static constexpr std::size_t packetBytesMax = 64 * 1024;
    static constexpr std::size_t connectionsMax = 64;

    /// `passed` is a listening socket from the service manager; invalid: the port makes its own.
    SeqpacketUpcallPort(const SystemRoot& root, PeerIdentity& identity, FileDescriptor passed = {});
    ~SeqpacketUpcallPort() override;
    SeqpacketUpcallPort(const SeqpacketUpcallPort&) = delete;
    SeqpacketUpcallPort& operator=(const SeqpacketUpcallPort&) = delete;

    Errno checkIn() override;
    [[nodiscard]] const char* checkInCallName() const override { return checkInCallName_; }
    /// The loop has to outlive the port.
    bool serve(RunLoop& loop, std::function<std::vector<std::uint8_t>(const UpcallPacket&)> handler) override;
    [[nodiscard]] const char* sourceCallName() const override { return "epoll_ctl"; }
    [[nodiscard]] std::size_t replyBytesMax() const override { return replyBytesMax_; }

private:
    struct Connection {
        PeerSocket socket;
        std::unique_ptr<Peer> peer;
    };
    enum class Received { packet, nothing, dropped, ended };

    void acceptConnections();
    void serveConnection(int fd);
    void close(int fd);
    [[nodiscard]] Received receive(const Connection& connection, UpcallPacket& packet);
    /// The sender that the packet names, as the handler is to see it.
    void setSender(const Connection& connection, const ucred& credentials, UpcallPacket& packet) const;

    const SystemRoot& root_;
    PeerIdentity& identity_;
    const char* checkInCallName_ = "bind";
    FileDescriptor passed_;
    PeerSocket listening_;
    ListenerAcceptor acceptor_;
    std::size_t replyBytesMax_ = 0;
    RunLoop* loop_ = nullptr;
    std::function<std::vector<std::uint8_t>(const UpcallPacket&)> handler_;
    std::map<int, Connection> connections_;
    std::vector<std::uint8_t> buffer_;
};

} // namespace zor::platform
