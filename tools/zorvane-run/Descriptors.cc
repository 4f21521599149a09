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

/// -1 for what has no such option.
int optionOf(int socket, int name) {
    int value = -1;
    socklen_t length = sizeof value;
    return ::getsockopt(socket, SOL_SOCKET, name, &value, &length) == 0 ? value : -1;
}

/// Whether it keeps the peer that it has. One of the network can be connected anew, and so can datagrams.
bool isUnixStream(int socket) {
    const int type = optionOf(socket, SO_TYPE);
    return optionOf(socket, SO_DOMAIN) == AF_UNIX && (type == SOCK_STREAM || type == SOCK_SEQPACKET);
}

bool isBoundToOnePeer(int socket) {
    sockaddr_storage peer{};
    socklen_t length = sizeof peer;
    return isUnixStream(socket) && ::getpeername(socket, reinterpret_cast<sockaddr*>(&peer), &length) == 0;
}

/// Whether a program without any power could make such a one in the host's network.
bool isUsualSocket(int socket) {
    const int domain = optionOf(socket, SO_DOMAIN);
    const int type = optionOf(socket, SO_TYPE);
    return (domain == AF_UNIX || domain == AF_INET || domain == AF_INET6) &&
           (type == SOCK_STREAM || type == SOCK_DGRAM || type == SOCK_SEQPACKET);
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

const char* whyPassedRefused(int fd, Network network) {
    struct stat status{};
    const int flags = ::fcntl(fd, F_GETFL);
    if (flags < 0 || ::fstat(fd, &status) != 0)
        return "is not open";
    if ((flags & O_PATH) != 0 || !(S_ISFIFO(status.st_mode) || S_ISSOCK(status.st_mode)))
        return "is neither a socket nor a pipe with a name";
    if (S_ISFIFO(status.st_mode) || isBoundToOnePeer(fd) || (isUnixStream(fd) && optionOf(fd, SO_ACCEPTCONN) == 1))
        return nullptr;
    if (!isUsualSocket(fd))
        return "is a socket of a kind that only root can make, or that is not connected";
    return network == Network::host ? nullptr : "is a socket that reaches the host's network";
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
