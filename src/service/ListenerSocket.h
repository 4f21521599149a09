// SPDX-License-Identifier: Apache-2.0
// Making a listening socket in the runtime directory, and accepting from one without ever spinning.
#pragma once

#include "os/FileDescriptor.h"
#include "platform/Errno.h"
#include "service/PassedAlong.h"

#include <string>
#include <sys/types.h>

namespace zor::platform {

/// The place of a socket. The directory belongs to the daemon's user and nobody else can write to it.
struct ListenerAddress {
    /// A descriptor of the directory; its owner keeps it open.
    int directory = -1;
    /// The same directory as a path, for the address that people see. It is not used when it does not fit.
    std::string directoryPath;
    std::string name;
};

/// Binds and listens, in the place of a socket that an earlier daemon left. `type` is SOCK_STREAM or SOCK_SEQPACKET.
/// The mode is right before the first client can connect. No name is left behind after an error.
[[nodiscard]] ErrnoOr<FileDescriptor> makeListenerSocket(const ListenerAddress& address, int type, mode_t mode);

/// Makes a listening socket that was passed in ready for use: non-blocking, closed on exec. EINVAL when it is none.
Errno adoptListenerSocket(int socket, int type);

/// Has the kernel say who sent each piece of what arrives. A peer that connects to a listening socket from then on
/// takes it over.
Errno enableSenderCredentials(int socket);

/// Accepts connections of one listening socket. When the process is out of descriptors, one kept in reserve is spent to
/// take the connection and close it: else the socket would stay readable and its thread would spin. One thread at a
/// time.
class ListenerAcceptor {
public:
    ListenerAcceptor();

    enum class Outcome {
        accepted,
        /// Nobody is waiting.
        none,
        /// A connection was closed at once, because there is no descriptor for it.
        refused,
        /// There is no descriptor, not even the reserve, or no memory: accept again later.
        exhausted,
    };
    struct Accepted {
        Outcome outcome = Outcome::none;
        /// Non-blocking, closed on exec; valid when accepted.
        PeerSocket socket;
    };
    [[nodiscard]] Accepted accept(int listening);

private:
    FileDescriptor reserve_;
};

} // namespace zor::platform
