// SPDX-License-Identifier: Apache-2.0
#include "service/StatusSocket.h"

#include "ipc/Frame.h"
#include "platform/Errno.h"
#include "plist/Codec.h"

#include <cerrno>
#include <ctime>
#include <exception>
#include <span>
#include <sys/socket.h>
#include <unistd.h>
#include <utility>

namespace zor::platform {

namespace {

/// Connections answered before the loop looks at other things.
constexpr unsigned answersPerTurn = 16;
/// A socket takes this much without being asked to (net.core.wmem_default counts overhead too).
constexpr std::size_t frameBytesSmall = std::size_t{64} * 1024;
/// A map of ten thousand identifiers, and less than a socket's buffer can be made.
constexpr std::size_t frameBytesMax = std::size_t{16} << 20;

} // namespace

StatusSocket::StatusSocket(PeerIdentity& identity, RunLoop& runLoop, Build build)
    : identity_(identity), runLoop_(runLoop), build_(std::move(build)) {}

StatusSocket::~StatusSocket() {
    close();
}

Errno StatusSocket::open(const ListenerAddress& address) {
    listening_ = PeerSocket(TRY(makeListenerSocket(address, SOCK_STREAM, 0666)));
    made_ = address;
    return serve();
}

Errno StatusSocket::adopt(FileDescriptor listening) {
    TRY(adoptListenerSocket(listening.get(), SOCK_STREAM));
    listening_ = PeerSocket(std::move(listening));
    return serve();
}

Errno StatusSocket::serve() {
    if (runLoop_.watch(listening_.get(), [this] { answerAll(); }))
        return Errno();
    const Errno error = Errno::last();
    close();
    return error ? error : Errno(ENOMEM);
}

void StatusSocket::close() {
    if (!listening_.valid())
        return;
    runLoop_.unwatch(listening_.get());
    listening_.reset();
    if (made_.directory >= 0)
        ::unlinkat(made_.directory, made_.name.c_str(), 0);
    made_ = {};
}

void StatusSocket::answerAll() {
    for (unsigned i = 0; i < answersPerTurn; ++i) {
        const ListenerAcceptor::Accepted accepted = acceptor_.accept(listening_.get());
        switch (accepted.outcome) {
        case ListenerAcceptor::Outcome::accepted:
            answer(accepted.socket.get());
            break;
        case ListenerAcceptor::Outcome::refused:
            break;
        case ListenerAcceptor::Outcome::exhausted: {
            // The socket stays readable, and the loop comes back at once: not at full speed.
            const timespec pause = {.tv_sec = 0, .tv_nsec = 1'000'000};
            ::nanosleep(&pause, nullptr);
            return;
        }
        case ListenerAcceptor::Outcome::none:
            return;
        }
    }
}

bool StatusSocket::makeFrame(Peer& peer, Detail detail) {
    try {
        frame_.resize(ipc::frameHeaderBytes);
        if (!plist::appendBinary(build_(peer, detail), frame_) || frame_.size() > frameBytesMax)
            return false;
    } catch (const std::exception&) {
        return false; // no memory for it; for the brief one there may be
    }
    const ipc::FrameHeader header = {.payloadBytes = static_cast<std::uint32_t>(frame_.size() - ipc::frameHeaderBytes),
                                     .flags = ipc::frameIsReply,
                                     .id = 0};
    ipc::encodeFrameHeader(header, std::span(frame_).first<ipc::frameHeaderBytes>());
    return true;
}

bool StatusSocket::fits(int socket) const {
    if (frame_.size() <= frameBytesSmall)
        return true;
    // Privileged daemons may pass net.core.wmem_max; others get what it allows. The kernel doubles what it is asked
    // for, to pay for its own overhead.
    const int wanted = static_cast<int>(frame_.size());
    if (::setsockopt(socket, SOL_SOCKET, SO_SNDBUFFORCE, &wanted, sizeof wanted) != 0)
        ::setsockopt(socket, SOL_SOCKET, SO_SNDBUF, &wanted, sizeof wanted);
    int granted = 0;
    socklen_t length = sizeof granted;
    return ::getsockopt(socket, SOL_SOCKET, SO_SNDBUF, &granted, &length) == 0 && granted / 2 >= wanted;
}

void StatusSocket::answer(int socket) {
    const std::unique_ptr<Peer> peer = identity_.peerOfSocket(socket);
    if (!peer)
        return;
    const bool whole = makeFrame(*peer, Detail::full) && fits(socket);
    if (whole || makeFrame(*peer, Detail::brief)) {
        [[maybe_unused]] const bool taken = fits(socket); // else the stream ends early
        [[maybe_unused]] const ssize_t sent = ::send(socket, frame_.data(), frame_.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
    }
    // The memory that one answer needed is not kept for the next, which is likely to need less.
    if (frame_.capacity() > frameBytesSmall)
        plist::Data().swap(frame_);
}

} // namespace zor::platform
