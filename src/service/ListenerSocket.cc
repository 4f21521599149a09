// SPDX-License-Identifier: Apache-2.0
#include "service/ListenerSocket.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>

namespace zor::platform {

namespace {

// Clients that connect at once wait here until they are accepted; the kernel cuts it to net.core.somaxconn.
constexpr int backlog = 4096;

/// sun_path is short (108 bytes). A longer address goes through the open directory.
bool fillAddress(const ListenerAddress& address, sockaddr_un& out) {
    std::string path = address.directoryPath + "/" + address.name;
    if (address.directoryPath.empty() || path.size() >= sizeof out.sun_path)
        path = "/proc/self/fd/" + std::to_string(address.directory) + "/" + address.name;
    if (path.size() >= sizeof out.sun_path)
        return false;
    out.sun_family = AF_UNIX;
    std::memcpy(out.sun_path, path.c_str(), path.size() + 1);
    return true;
}

} // namespace

ErrnoOr<FileDescriptor> makeListenerSocket(const ListenerAddress& address, int type, mode_t mode) {
    sockaddr_un socketAddress = {};
    if (!fillAddress(address, socketAddress))
        return Errno(ENAMETOOLONG);
    FileDescriptor socket(::socket(AF_UNIX, type | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    if (!socket.valid())
        return Errno::last();
    refuseDescriptors(socket.get());
    if (::unlinkat(address.directory, address.name.c_str(), 0) != 0 && errno != ENOENT)
        return Errno::last();
    if (::bind(socket.get(), reinterpret_cast<const sockaddr*>(&socketAddress), sizeof socketAddress) != 0)
        return Errno::last();
    // Until listen, a connect is refused: nobody gets in under the mode that the umask left.
    if (::fchmodat(address.directory, address.name.c_str(), mode, 0) != 0 || ::listen(socket.get(), backlog) != 0) {
        const Errno error = Errno::last();
        ::unlinkat(address.directory, address.name.c_str(), 0);
        return error;
    }
    return socket;
}

Errno adoptListenerSocket(int socket, int type) {
    int value = 0;
    socklen_t length = sizeof value;
    if (::getsockopt(socket, SOL_SOCKET, SO_ACCEPTCONN, &value, &length) != 0)
        return Errno::last();
    if (value == 0)
        return Errno(EINVAL);
    if (::getsockopt(socket, SOL_SOCKET, SO_DOMAIN, &value, &length) != 0 || value != AF_UNIX)
        return Errno(EINVAL);
    if (::getsockopt(socket, SOL_SOCKET, SO_TYPE, &value, &length) != 0 || value != type)
        return Errno(EINVAL);
    const int flags = ::fcntl(socket, F_GETFL);
    if (flags < 0 || ::fcntl(socket, F_SETFL, flags | O_NONBLOCK) != 0 || ::fcntl(socket, F_SETFD, FD_CLOEXEC) != 0)
        return Errno::last();
    refuseDescriptors(socket);
    // Clients are told by the kernel who listens: this process, not the one that made the socket.
    return ::listen(socket, backlog) == 0 ? Errno() : Errno::last();
}

Errno enableSenderCredentials(int socket) {
    const int on = 1;
    return ::setsockopt(socket, SOL_SOCKET, SO_PASSCRED, &on, sizeof on) == 0 ? Errno() : Errno::last();
}

ListenerAcceptor::ListenerAcceptor() : reserve_(::eventfd(0, EFD_CLOEXEC)) {}

ListenerAcceptor::Accepted ListenerAcceptor::accept(int listening) {
    for (;;) {
        PeerSocket socket(FileDescriptor(::accept4(listening, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC)));
        if (socket.valid()) {
            if (!reserve_.valid()) {
                // The first descriptor to be had again goes to the reserve.
                reserve_.reset(::eventfd(0, EFD_CLOEXEC));
                if (!reserve_.valid())
                    return {.outcome = Outcome::refused, .socket = {}};
            }
            return {.outcome = Outcome::accepted, .socket = std::move(socket)};
        }
        switch (errno) {
        case EINTR:
        case ECONNABORTED:
        case EPROTO:
            continue;
        case EMFILE:
        case ENFILE:
            break;
        case ENOBUFS:
        case ENOMEM:
            return {.outcome = Outcome::exhausted, .socket = {}};
        default:
            return {};
        }
        if (!reserve_.valid())
            return {.outcome = Outcome::exhausted, .socket = {}};
        reserve_.reset();
        socket = PeerSocket(FileDescriptor(::accept4(listening, nullptr, nullptr, SOCK_CLOEXEC)));
        // The kernel looks for a descriptor before it looks whether anybody waits.
        const bool nobody = !socket.valid() && (errno == EAGAIN || errno == EWOULDBLOCK);
        const bool taken = socket.valid();
        socket.reset();
        reserve_.reset(::eventfd(0, EFD_CLOEXEC));
        if (nobody)
            return {};
        return {.outcome = taken ? Outcome::refused : Outcome::exhausted, .socket = {}};
    }
}

} // namespace zor::platform
