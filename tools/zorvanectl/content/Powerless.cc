// SPDX-License-Identifier: Apache-2.0
#include "Powerless.h"

#include "os/SystemCallFilter.h"

#include <csignal>
#include <grp.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace zorvanectl::content {

namespace {

constexpr uid_t nobody = 65534;
/// The memory that a decoder may allocate: the greatest dictionaries in use take a tenth of it.
constexpr rlim_t memoryBytesMax = rlim_t{1} << 30;

#if defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
#define ZORVANECTL_SANITIZED
#endif
#endif
#ifdef ZORVANECTL_SANITIZED
constexpr bool limitsMemory = false; // a sanitizer has taken more address space already
#else
constexpr bool limitsMemory = true;
#endif

/// Calls that memory, time and open descriptors need; the most frequent first. One takes a name, which it only looks
/// at: with it the C library asks about descriptors. AddressSanitizer asks for the signal stack.
constexpr int callsLeft[] = {SYS_read,    SYS_write,        SYS_lseek,       SYS_pread64,   SYS_newfstatat,
                             SYS_fstat,   SYS_mmap,         SYS_munmap,      SYS_mremap,    SYS_mprotect,
                             SYS_madvise, SYS_brk,          SYS_futex,       SYS_getrandom, SYS_clock_gettime,
                             SYS_close,   SYS_rt_sigreturn, SYS_sigaltstack, SYS_exit_group};

bool leaveRoot() {
    return ::geteuid() != 0 || (::setgroups(0, nullptr) == 0 && ::setresgid(nobody, nobody, nobody) == 0 &&
                                ::setresuid(nobody, nobody, nobody) == 0);
}

bool limitResources() {
    const auto limit = [](auto resource, rlim_t value) {
        const rlimit both{.rlim_cur = value, .rlim_max = value};
        return ::setrlimit(resource, &both) == 0;
    };
    if (limitsMemory && !limit(RLIMIT_AS, memoryBytesMax))
        return false;
    // Open descriptors stay open; nothing more can be opened, not even in the place of one that is closed.
    return limit(RLIMIT_NOFILE, 0) && limit(RLIMIT_FSIZE, 0) && limit(RLIMIT_NPROC, 0) && limit(RLIMIT_CORE, 0);
}

/// Other calls fail rather than end the process: libraries try some, such as opening a table, that they can do without.
bool refuseOtherCalls() {
    zor::platform::SystemCallFilter filter;
    for (const int call : callsLeft)
        filter.allow(call);
    return filter.layOn(zor::platform::SystemCallFilter::Rest::refused);
}

} // namespace

bool becomePowerless(pid_t parent) {
    // The parent may have ended before its end was watched.
    return ::setsid() >= 0 && leaveRoot() && ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 &&
           ::prctl(PR_SET_PDEATHSIG, SIGKILL) == 0 && ::getppid() == parent && limitResources() && refuseOtherCalls();
}

} // namespace zorvanectl::content
