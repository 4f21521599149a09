// SPDX-License-Identifier: Apache-2.0
#include "Powerless.h"

#include <cerrno>
#include <csignal>
#include <cstddef>
#include <grp.h>
#include <linux/audit.h>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>
#include <vector>

namespace zorvanectl::content {

namespace {

constexpr uid_t nobody = 65534;
/// What a decoder may allocate: the greatest dictionaries in use take a tenth of it.
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

#if defined(__x86_64__)
constexpr __u32 architecture = AUDIT_ARCH_X86_64;
#elif defined(__aarch64__)
constexpr __u32 architecture = AUDIT_ARCH_AARCH64;
#elif defined(__riscv) && __riscv_xlen == 64
constexpr __u32 architecture = AUDIT_ARCH_RISCV64;
#elif defined(__s390x__)
constexpr __u32 architecture = AUDIT_ARCH_S390X;
#elif defined(__powerpc64__) && defined(__LITTLE_ENDIAN__)
constexpr __u32 architecture = AUDIT_ARCH_PPC64LE;
#else
#error "name this architecture: without it the kernel cannot tell whose calls are counted how"
#endif

/// What memory, time and open descriptors need; the most frequent first. One takes a name, which it only looks at: with
/// it the C library asks about descriptors. AddressSanitizer asks for the signal stack.
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
    // What is open stays so; nothing can be opened any more, not even in the place of what is closed.
    return limit(RLIMIT_NOFILE, 0) && limit(RLIMIT_FSIZE, 0) && limit(RLIMIT_NPROC, 0) && limit(RLIMIT_CORE, 0);
}

/// Other calls fail rather than end the process: libraries try some, such as opening a table, that they can do without.
bool refuseOtherCalls() {
    const auto load = [](std::size_t offset) {
        return sock_filter BPF_STMT(BPF_LD | BPF_W | BPF_ABS, static_cast<__u32>(offset));
    };
    const auto skipUnless = [](__u32 value) { return sock_filter BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, value, 0, 1); };
    const auto answer = [](__u32 action) { return sock_filter BPF_STMT(BPF_RET | BPF_K, action); };
    // Another architecture's calls have other numbers.
    std::vector<sock_filter> filter = {
        load(offsetof(seccomp_data, arch)),
        sock_filter BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, architecture, 1, 0),
        answer(SECCOMP_RET_KILL_PROCESS),
        load(offsetof(seccomp_data, nr)),
    };
    for (const int call : callsLeft) {
        filter.push_back(skipUnless(static_cast<__u32>(call)));
        filter.push_back(answer(SECCOMP_RET_ALLOW));
    }
    filter.push_back(answer(SECCOMP_RET_ERRNO | EPERM));
    const sock_fprog program{.len = static_cast<unsigned short>(filter.size()), .filter = filter.data()};
    return ::prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &program) == 0;
}

} // namespace

bool becomePowerless(pid_t parent) {
    // The parent may have ended before its end was watched.
    return ::setsid() >= 0 && leaveRoot() && ::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) == 0 &&
           ::prctl(PR_SET_PDEATHSIG, SIGKILL) == 0 && ::getppid() == parent && limitResources() && refuseOtherCalls();
}

} // namespace zorvanectl::content
