// SPDX-License-Identifier: Apache-2.0
#include "os/SystemCallFilter.h"

#include <bit>
#include <cerrno>
#include <cstddef>
#include <linux/audit.h>
#include <linux/seccomp.h>
#include <sys/prctl.h>

namespace zor::platform {

namespace {

#if defined(__x86_64__)
constexpr std::uint32_t architecture = AUDIT_ARCH_X86_64;
/// Calls with 32-bit pointers share the architecture and have numbers from here on.
constexpr std::uint32_t otherNumbersFrom = 0x4000'0000;
#else
constexpr std::uint32_t otherNumbersFrom = 0;
#if defined(__aarch64__)
constexpr std::uint32_t architecture = AUDIT_ARCH_AARCH64;
#elif defined(__riscv) && __riscv_xlen == 64
constexpr std::uint32_t architecture = AUDIT_ARCH_RISCV64;
#elif defined(__s390x__)
constexpr std::uint32_t architecture = AUDIT_ARCH_S390X;
#elif defined(__powerpc64__) && defined(__LITTLE_ENDIAN__)
constexpr std::uint32_t architecture = AUDIT_ARCH_PPC64LE;
#else
#error "name this architecture: without it the kernel cannot tell whose calls are counted how"
#endif
#endif

constexpr std::uint32_t lowHalf = std::endian::native == std::endian::little ? 0 : 4;

} // namespace

SystemCallFilter::SystemCallFilter() {
    add(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, arch));
    add(BPF_JMP | BPF_JEQ | BPF_K, architecture, 1, 0);
    answer(SECCOMP_RET_KILL_PROCESS);
    add(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr));
    if (otherNumbersFrom != 0) {
        add(BPF_JMP | BPF_JGE | BPF_K, otherNumbersFrom, 0, 1);
        answer(SECCOMP_RET_ERRNO | ENOSYS);
    }
}

void SystemCallFilter::allow(int call) {
    beginRule(call, 1);
    answer(SECCOMP_RET_ALLOW);
}

void SystemCallFilter::refuse(int call, int error) {
    beginRule(call, 1);
    answer(SECCOMP_RET_ERRNO | static_cast<std::uint32_t>(error));
}

void SystemCallFilter::refuseBits(int call, unsigned argument, std::uint32_t bits, int error) {
    beginRule(call, 5);
    loadArgument(argument);
    add(BPF_ALU | BPF_AND | BPF_K, bits);
    add(BPF_JMP | BPF_JEQ | BPF_K, bits, 0, 1);
    answer(SECCOMP_RET_ERRNO | static_cast<std::uint32_t>(error));
    add(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr));
}

void SystemCallFilter::refuseValue(int call, unsigned argument, std::uint32_t value, int error) {
    beginRule(call, 4);
    loadArgument(argument);
    add(BPF_JMP | BPF_JEQ | BPF_K, value, 0, 1);
    answer(SECCOMP_RET_ERRNO | static_cast<std::uint32_t>(error));
    add(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr));
}

void SystemCallFilter::refuseUnless(int call, unsigned argument, std::initializer_list<std::uint32_t> values,
                                    int error) {
    const auto count = static_cast<unsigned>(values.size());
    beginRule(call, count + 3);
    loadArgument(argument);
    std::uint8_t toTheEnd = static_cast<std::uint8_t>(count);
    for (const std::uint32_t value : values)
        add(BPF_JMP | BPF_JEQ | BPF_K, value, toTheEnd--, 0);
    answer(SECCOMP_RET_ERRNO | static_cast<std::uint32_t>(error));
    add(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr));
}

bool SystemCallFilter::layOn(Rest rest) {
    answer(rest == Rest::allowed ? SECCOMP_RET_ALLOW : SECCOMP_RET_ERRNO | static_cast<std::uint32_t>(EPERM));
    const sock_fprog program{.len = static_cast<unsigned short>(program_.size()), .filter = program_.data()};
    return ::prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &program) == 0;
}

void SystemCallFilter::beginRule(int call, unsigned count) {
    add(BPF_JMP | BPF_JEQ | BPF_K, static_cast<std::uint32_t>(call), 0, static_cast<std::uint8_t>(count));
}

void SystemCallFilter::add(std::uint16_t code, std::uint32_t value, std::uint8_t ifTrue, std::uint8_t ifFalse) {
    program_.push_back({.code = code, .jt = ifTrue, .jf = ifFalse, .k = value});
}

void SystemCallFilter::answer(std::uint32_t action) {
    add(BPF_RET | BPF_K, action);
}

void SystemCallFilter::loadArgument(unsigned argument) {
    add(BPF_LD | BPF_W | BPF_ABS, static_cast<std::uint32_t>(offsetof(seccomp_data, args)) + 8 * argument + lowHalf);
}

} // namespace zor::platform
