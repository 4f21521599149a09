// SPDX-License-Identifier: Apache-2.0
#include "Descriptors.h"

#include <cerrno>
#include <climits>
#include <cstring>
#include <fcntl.h>
#include <linux/close_range.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace zorvanerun {

using zor::platform::FileDescriptor;

namespace {

/// Whether it can reach one peer and no other. One of the network can be connected anew, and so can datagrams.
bool isBoundToOnePeer(int socket) {
    const auto option = [&](int name) {
        int value = -1;
        socklen_t length = sizeof value;
        return ::getsockopt(socket, SOL_SOCKET, name, &value, &length) == 0 ? value : -1;
    };
    sockaddr_storage peer{};
    socklen_t length = sizeof peer;
    const int type = option(SO_TYPE);
    return option(SO_DOMAIN) == AF_UNIX && (type == SOCK_STREAM || type == SOCK_SEQPACKET) &&
           ::getpeername(socket, reinterpret_cast<sockaddr*>(&peer), &length) == 0;
}

/// nullptr when it leads nowhere.
const char* whyRefused(int fd, Network network) {
    struct stat status{};
    const int flags = ::fcntl(fd, F_GETFL);
    if (flags < 0 || ::fstat(fd, &status) != 0)
        return "cannot be examined";
    if ((flags & O_PATH) != 0)
        return "is a place and not open for reading or writing";
    switch (status.st_mode & S_IFMT) {
    case S_IFREG:
    case S_IFIFO:
    case S_IFCHR:
    case S_IFBLK:
        return nullptr;
    case S_IFSOCK:
        return network == Network::host || isBoundToOnePeer(fd) ? nullptr
                                                                : "is a socket that reaches the host's network";
    case S_IFDIR:
        return "is a directory";
    default:
        return "is neither file, pipe, terminal nor socket";
    }
}

} // namespace

std::string whyStandardDescriptorRefused(Network network) {
    constexpr const char* names[] = {"input", "output", "error"};
    for (int fd = STDIN_FILENO; fd <= STDERR_FILENO; ++fd)
        if (const char* why = whyRefused(fd, network))
            return std::string("standard ") + names[fd] + " " + why;
    return {};
}

bool closeOnExecFrom(int first) {
    return ::syscall(SYS_close_range, static_cast<unsigned>(first), UINT_MAX, CLOSE_RANGE_CLOEXEC) == 0;
}

bool keepOnExec(int fd) {
    return ::fcntl(fd, F_SETFD, 0) == 0;
}

bool sendDescriptor(int socket, int fd) {
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof fd)] = {};
    char byte = 0;
    iovec part{.iov_base = &byte, .iov_len = 1};
    msghdr message{};
    message.msg_iov = &part;
    message.msg_iovlen = 1;
    message.msg_control = control;
    message.msg_controllen = sizeof control;
    cmsghdr* const header = CMSG_FIRSTHDR(&message);
    header->cmsg_level = SOL_SOCKET;
    header->cmsg_type = SCM_RIGHTS;
    header->cmsg_len = CMSG_LEN(sizeof fd);
    std::memcpy(CMSG_DATA(header), &fd, sizeof fd);
    return ::sendmsg(socket, &message, MSG_NOSIGNAL) == 1;
}

FileDescriptor receiveDescriptor(int socket) {
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int))] = {};
    char byte = 0;
    iovec part{.iov_base = &byte, .iov_len = 1};
    msghdr message{};
    message.msg_iov = &part;
    message.msg_iovlen = 1;
    message.msg_control = control;
    message.msg_controllen = sizeof control;
    ssize_t bytes = 0;
    do {
        bytes = ::recvmsg(socket, &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
    } while (bytes < 0 && errno == EINTR);
    const cmsghdr* const header = bytes == 1 ? CMSG_FIRSTHDR(&message) : nullptr;
    if (!header || header->cmsg_level != SOL_SOCKET || header->cmsg_type != SCM_RIGHTS ||
        header->cmsg_len != CMSG_LEN(sizeof(int)))
        return FileDescriptor();
    int fd = -1;
    std::memcpy(&fd, CMSG_DATA(header), sizeof fd);
    return FileDescriptor(fd);
}

} // namespace zorvanerun
