// SPDX-License-Identifier: Apache-2.0
#include "Descriptors.h"

#include <cerrno>
#include <climits>
#include <cstring>
#include <fcntl.h>
#include <linux/close_range.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace zorvanerun {

using zor::platform::FileDescriptor;

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
