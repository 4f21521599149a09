// SPDX-License-Identifier: Apache-2.0
#include "SyncCounter.h"

#include "Processes.h"

#include <cstddef>
#include <cstring>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <poll.h>
#include <sys/ioctl.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/syscall.h>

namespace zor::bench {

using platform::FileDescriptor;

namespace {

constexpr int lookMilliseconds = 20;

struct ControlBuffer {
    alignas(cmsghdr) char bytes[CMSG_SPACE(sizeof(int))];
};

int installFilter() {
    constexpr std::uint32_t calls[] = {SYS_fsync, SYS_fdatasync, SYS_syncfs, SYS_sync_file_range, SYS_sync, SYS_msync};
    constexpr std::size_t count = std::size(calls);
    sock_filter program[count + 3] = {
        BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)),
    };
    for (std::size_t i = 0; i < count; ++i)
        program[i + 1] = BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, calls[i], static_cast<std::uint8_t>(count - i), 0);
    program[count + 1] = BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW);
    program[count + 2] = BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_USER_NOTIF);
    const sock_fprog whole = {.len = std::size(program), .filter = program};
    if (::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0)
        return -1;
    return static_cast<int>(::syscall(SYS_seccomp, SECCOMP_SET_MODE_FILTER, SECCOMP_FILTER_FLAG_NEW_LISTENER, &whole));
}

} // namespace

SyncCounter::SyncCounter() {
    int pair[2];
    if (::socketpair(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0, pair) != 0)
        failWithErrno("socketpair");
    ours_.reset(pair[0]);
    theirs_.reset(pair[1]);
}

void SyncCounter::watchThisProcess() const {
    const int filter = installFilter();
    char what = filter < 0 ? 'n' : 'y';
    iovec part = {.iov_base = &what, .iov_len = 1};
    ControlBuffer control{};
    msghdr message{};
    message.msg_iov = &part;
    message.msg_iovlen = 1;
    if (filter >= 0) {
        message.msg_control = control.bytes;
        message.msg_controllen = sizeof control.bytes;
        cmsghdr* header = CMSG_FIRSTHDR(&message);
        header->cmsg_level = SOL_SOCKET;
        header->cmsg_type = SCM_RIGHTS;
        header->cmsg_len = CMSG_LEN(sizeof filter);
        std::memcpy(CMSG_DATA(header), &filter, sizeof filter);
    }
    (void)::sendmsg(theirs_.get(), &message, 0);
}

void SyncCounter::start() {
    theirs_.reset();
    char what = 'n';
    iovec part = {.iov_base = &what, .iov_len = 1};
    ControlBuffer control{};
    msghdr message{};
    message.msg_iov = &part;
    message.msg_iovlen = 1;
    message.msg_control = control.bytes;
    message.msg_controllen = sizeof control.bytes;
    pollfd waiting{.fd = ours_.get(), .events = POLLIN, .revents = 0};
    if (::poll(&waiting, 1, 10'000) != 1 || ::recvmsg(ours_.get(), &message, MSG_CMSG_CLOEXEC) != 1 || what != 'y')
        return;
    if (const cmsghdr* header = CMSG_FIRSTHDR(&message)) {
        int filter = -1;
        std::memcpy(&filter, CMSG_DATA(header), sizeof filter);
        filter_.reset(filter);
        thread_ = std::thread([this] { run(); });
    }
}

void SyncCounter::run() {
    while (!stopping_) {
        pollfd call{.fd = filter_.get(), .events = POLLIN, .revents = 0};
        if (::poll(&call, 1, lookMilliseconds) <= 0)
            continue;
        if ((call.revents & POLLIN) == 0) // nobody is watched any more
            return;
        seccomp_notif notice{};
        if (::ioctl(filter_.get(), SECCOMP_IOCTL_NOTIF_RECV, &notice) != 0)
            continue;
        ++count_;
        seccomp_notif_resp answer = {.id = notice.id, .val = 0, .error = 0, .flags = SECCOMP_USER_NOTIF_FLAG_CONTINUE};
        (void)::ioctl(filter_.get(), SECCOMP_IOCTL_NOTIF_SEND, &answer);
    }
}

SyncCounter::~SyncCounter() {
    stopping_ = true;
    if (thread_.joinable())
        thread_.join();
}

} // namespace zor::bench
