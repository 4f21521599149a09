// SPDX-License-Identifier: Apache-2.0
#include "service/SeqpacketUpcallPort.h"

#include "os/RunLoop.h"
#include "os/SystemRoot.h"
#include "platform/Errno.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <ctime>
#include <sys/socket.h>
#include <unistd.h>

namespace zor::platform {

namespace {

constexpr mode_t socketMode = 0600;
constexpr std::size_t replyBytesWanted = std::size_t{1} << 20;
/// The bytes that the kernel takes off a send buffer before it compares a packet with it.
constexpr std::size_t packetOverheadBytes = 32;
/// Packets of one connection in a row, before the loop looks at what else is to be done.
constexpr int packetsPerTurn = 16;

/// Asks for room for the longest reply; only root gets more than the system's limit. The longest packet that fits.
std::size_t raiseSendBuffer(int socket) {
    const int wanted = static_cast<int>(replyBytesWanted);
    if (::setsockopt(socket, SOL_SOCKET, SO_SNDBUFFORCE, &wanted, sizeof wanted) != 0)
        (void)::setsockopt(socket, SOL_SOCKET, SO_SNDBUF, &wanted, sizeof wanted);
    int granted = 0;
    socklen_t length = sizeof granted;
    if (::getsockopt(socket, SOL_SOCKET, SO_SNDBUF, &granted, &length) != 0)
        return 0;
    const auto bytes = static_cast<std::size_t>(std::max(granted, 0));
    return std::min(bytes - std::min(bytes, packetOverheadBytes), replyBytesWanted);
}

} // namespace

SeqpacketUpcallPort::SeqpacketUpcallPort(const SystemRoot& root, PeerIdentity& identity, FileDescriptor passed)
    : root_(root), identity_(identity), passed_(std::move(passed)), buffer_(packetBytesMax) {}

SeqpacketUpcallPort::~SeqpacketUpcallPort() {
    if (!loop_)
        return;
    for (const auto& [fd, connection] : connections_)
        loop_->unwatch(fd);
    loop_->unwatch(listening_.get());
}

Errno SeqpacketUpcallPort::checkIn() {
    if (passed_.valid()) {
        checkInCallName_ = "LISTEN_FDS";
        TRY(adoptListenerSocket(passed_.get(), SOCK_SEQPACKET));
        listening_ = PeerSocket(std::move(passed_));
    } else {
        checkInCallName_ = "bind";
        const ListenerAddress address{.directory = root_.runtimeDirectory(),
                                      .directoryPath = root_.path(names::runtimeDirectory),
                                      .name = names::upcallSocket};
        listening_ = PeerSocket(TRY(makeListenerSocket(address, SOCK_SEQPACKET, socketMode)));
    }
    checkInCallName_ = "setsockopt";
    TRY(enableSenderCredentials(listening_.get()));
    // Every accepted socket will be granted the same.
    replyBytesMax_ = raiseSendBuffer(listening_.get());
    return Errno();
}

bool SeqpacketUpcallPort::serve(RunLoop& loop, std::function<std::vector<std::uint8_t>(const UpcallPacket&)> handler) {
    handler_ = std::move(handler);
    if (!loop.watch(listening_.get(), [this] { acceptConnections(); }))
        return false;
    loop_ = &loop;
    return true;
}

void SeqpacketUpcallPort::acceptConnections() {
    for (;;) {
        ListenerAcceptor::Accepted accepted = acceptor_.accept(listening_.get());
        if (accepted.outcome == ListenerAcceptor::Outcome::none)
            return;
        if (accepted.outcome == ListenerAcceptor::Outcome::exhausted) {
            // The socket stays readable and the loop comes back at once: give whatever took the memory a moment.
            const timespec moment{.tv_sec = 0, .tv_nsec = 10'000'000};
            (void)::nanosleep(&moment, nullptr);
            return;
        }
        if (accepted.outcome == ListenerAcceptor::Outcome::refused || connections_.size() >= connectionsMax)
            continue;
        const int fd = accepted.socket.get();
        (void)raiseSendBuffer(fd);
        (void)enableSenderCredentials(fd);
        auto peer = identity_.peerOfSocket(fd);
        // The kernel's agent would be nobody as long as it is connected. Closed, it connects again.
        if (!peer && isOwnShortage(Errno::last()))
            continue;
        connections_[fd] = {.socket = std::move(accepted.socket), .peer = std::move(peer)};
        if (!loop_->watch(fd, [this, fd] { serveConnection(fd); }))
            connections_.erase(fd);
    }
}

void SeqpacketUpcallPort::close(int fd) {
    loop_->unwatch(fd);
    connections_.erase(fd);
}

void SeqpacketUpcallPort::serveConnection(int fd) {
    const auto found = connections_.find(fd);
    if (found == connections_.end())
        return;
    const Connection& connection = found->second;
    for (int turn = 0; turn < packetsPerTurn; ++turn) {
        UpcallPacket packet;
        const Received received = receive(connection, packet);
        if (received == Received::nothing)
            return;
        if (received == Received::ended)
            return close(fd);
        if (received == Received::dropped)
            continue;
        const std::vector<std::uint8_t> reply = handler_(packet);
        if (!reply.empty())
            (void)!::send(fd, reply.data(), reply.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
    }
}

SeqpacketUpcallPort::Received SeqpacketUpcallPort::receive(const Connection& connection, UpcallPacket& packet) {
    // Room for the credentials alone: descriptors that somebody sends along find none, and the kernel closes them here.
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(ucred))] = {};
    iovec part{.iov_base = buffer_.data(), .iov_len = buffer_.size()};
    msghdr message{};
    message.msg_iov = &part;
    message.msg_iovlen = 1;
    message.msg_control = control;
    message.msg_controllen = sizeof control;
    ssize_t bytes = 0;
    do {
        bytes = ::recvmsg(connection.socket.get(), &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
    } while (bytes < 0 && errno == EINTR);
    if (bytes < 0)
        return errno == EAGAIN || errno == EWOULDBLOCK ? Received::nothing : Received::ended;
    bool hasControl = false;
    for (cmsghdr* header = CMSG_FIRSTHDR(&message); header; header = CMSG_NXTHDR(&message, header)) {
        hasControl = true;
        if (header->cmsg_level != SOL_SOCKET || header->cmsg_type != SCM_CREDENTIALS ||
            header->cmsg_len != CMSG_LEN(sizeof(ucred)))
            continue;
        ucred credentials{};
        std::memcpy(&credentials, CMSG_DATA(header), sizeof credentials);
        setSender(connection, credentials, packet);
    }
    // An empty packet has a sender; the end of the connection has none.
    if (bytes == 0)
        return hasControl ? Received::dropped : Received::ended;
    if ((message.msg_flags & MSG_TRUNC) != 0)
        return Received::dropped;
    packet.bytes = std::span(buffer_).first(static_cast<std::size_t>(bytes));
    return Received::packet;
}

void SeqpacketUpcallPort::setSender(const Connection& connection, const ucred& credentials,
                                    UpcallPacket& packet) const {
    if (credentials.pid <= 0)
        return;
    packet.senderPid = credentials.pid;
    packet.senderUserId = credentials.uid;
    if (!connection.peer || connection.peer->pid() != credentials.pid || credentials.uid != ::geteuid())
        return;
    const Identity identity = connection.peer->identify(Peer::Explain::no);
    if (identity.grant && identity.grant->kernelAgent)
        packet.senderPid = 0;
}

} // namespace zor::platform
