// SPDX-License-Identifier: Apache-2.0
#include "Fence.h"

#include "os/SystemCallFilter.h"

#include <asm/ioctls.h>
#include <cerrno>
#include <linux/keyctl.h>
#include <linux/sched.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace zorvanerun {

namespace {

/// The position of clone's flags.
#ifdef __s390x__
constexpr unsigned cloneFlags = 1;
#else
constexpr unsigned cloneFlags = 0;
#endif
constexpr unsigned unshareFlags = 0;
constexpr unsigned ioctlRequest = 1;
constexpr unsigned socketFamily = 0;

} // namespace

bool leaveKeys() {
    return ::syscall(SYS_keyctl, KEYCTL_JOIN_SESSION_KEYRING, nullptr) >= 0 || errno == ENOSYS; // a kernel without keys
}

bool fence(Network network) {
    zor::platform::SystemCallFilter filter;
    for (const int call :
         {SYS_add_key, SYS_request_key, SYS_keyctl, SYS_setns, SYS_syslog,
          // The rest is root's, or of use to who looks for faults of the kernel.
          SYS_bpf, SYS_perf_event_open, SYS_userfaultfd, SYS_fanotify_init, SYS_open_by_handle_at, SYS_mount,
          SYS_umount2, SYS_pivot_root, SYS_open_tree, SYS_move_mount, SYS_fsopen, SYS_fspick, SYS_mount_setattr,
          SYS_init_module, SYS_finit_module, SYS_delete_module, SYS_kexec_load, SYS_swapon, SYS_swapoff, SYS_reboot,
          SYS_acct, SYS_quotactl, SYS_settimeofday, SYS_clock_settime})
        filter.refuse(call, EPERM);
    filter.refuseBits(SYS_unshare, unshareFlags, CLONE_NEWUSER, EPERM);
    filter.refuseBits(SYS_clone, cloneFlags, CLONE_NEWUSER, EPERM);
    // Its flags lie in memory, where no filter can look. The C library uses clone where there is no clone3.
    filter.refuse(SYS_clone3, ENOSYS);
    filter.refuse(SYS_io_uring_setup, ENOSYS);
    for (const std::uint32_t request : {TIOCSTI, TIOCLINUX})
        filter.refuseValue(SYS_ioctl, ioctlRequest, request, EPERM);
    if (network == Network::none) {
        filter.refuseUnless(SYS_socket, socketFamily, {AF_UNIX, AF_INET, AF_INET6, AF_NETLINK}, EAFNOSUPPORT);
#ifdef SYS_socketcall
        // Some architectures have it beside the calls that it stands for. Its family lies in memory, too.
        filter.refuse(SYS_socketcall, ENOSYS);
#endif
    }
    return filter.layOn(zor::platform::SystemCallFilter::Rest::allowed);
}

} // namespace zorvanerun
