// SPDX-License-Identifier: Apache-2.0
#include "zorvane-run/Fence.h"

#include <asm/ioctls.h>
#include <csignal>
#include <functional>
#include <gtest/gtest.h>
#include <linux/keyctl.h>
#include <linux/sched.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

namespace zorvanerun {
namespace {

/// The words of a process that does this in the place of the test.
std::string saidBy(const std::function<std::string()>& act) {
    int ends[2] = {};
    EXPECT_EQ(::pipe(ends), 0);
    const pid_t child = ::fork();
    if (child == 0) {
        const std::string said = act();
        ::_exit(::write(ends[1], said.data(), said.size()) == static_cast<ssize_t>(said.size()) ? 0 : 1);
    }
    ::close(ends[1]);
    std::string said;
    char byte = 0;
    while (::read(ends[0], &byte, 1) == 1)
        said += byte;
    ::close(ends[0]);
    int status = 0;
    EXPECT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_EQ(status, 0);
    return said;
}

long endingChild(long result) {
    if (result == 0)
        ::_exit(0);
    return result;
}

// Goal: the calls that lead out of a sandbox are refused as programs expect, and those beside them are not. Method: a
// table of calls, made by a process behind the fence; 0 stands for any answer of the kernel itself.
TEST(Fence, RefusesWhatLeadsOut) {
    const struct {
        const char* what;
        std::function<long()> call;
        int error;
        bool also = true; // with the host's network
    } rows[] = {
        {"add_key", [] { return ::syscall(SYS_add_key, "user", "a", "b", 1, KEY_SPEC_PROCESS_KEYRING); }, EPERM},
        {"request_key", [] { return ::syscall(SYS_request_key, "user", "a", nullptr, 0); }, EPERM},
        {"keyctl", [] { return ::syscall(SYS_keyctl, KEYCTL_GET_KEYRING_ID, KEY_SPEC_USER_KEYRING, 1); }, EPERM},
        {"unshare", [] { return ::syscall(SYS_unshare, CLONE_NEWUSER | CLONE_NEWNET); }, EPERM},
        {"unshare of files", [] { return ::syscall(SYS_unshare, CLONE_FILES); }, 0},
        {"clone", [] { return endingChild(::syscall(SYS_clone, CLONE_NEWUSER | SIGCHLD, 0, 0, 0, 0)); }, EPERM},
        {"clone of a process", [] { return endingChild(::syscall(SYS_clone, SIGCHLD, 0, 0, 0, 0)); }, 0},
        {"clone3", [] { return ::syscall(SYS_clone3, nullptr, 0); }, ENOSYS},
        {"setns", [] { return ::syscall(SYS_setns, -1, 0); }, EPERM},
        {"the kernel's log", [] { return ::syscall(SYS_syslog, 10, nullptr, 0); }, EPERM},
        {"io_uring", [] { return ::syscall(SYS_io_uring_setup, 1, nullptr); }, ENOSYS},
        {"bpf", [] { return ::syscall(SYS_bpf, 0, nullptr, 0); }, EPERM},
        {"userfaultfd", [] { return ::syscall(SYS_userfaultfd, 1); }, EPERM},
        {"TIOCSTI", [] { return ::syscall(SYS_ioctl, -1, TIOCSTI, "x"); }, EPERM},
        {"TIOCSTI, high half", [] { return ::syscall(SYS_ioctl, -1, TIOCSTI | 1UL << 40, "x"); }, EPERM},
        {"TIOCLINUX", [] { return ::syscall(SYS_ioctl, -1, TIOCLINUX, "x"); }, EPERM},
        {"another ioctl", [] { return ::syscall(SYS_ioctl, -1, TCGETS, nullptr); }, EBADF},
        {"AF_VSOCK", [] { return ::syscall(SYS_socket, AF_VSOCK, SOCK_STREAM, 0); }, EAFNOSUPPORT, false},
        {"AF_ALG", [] { return ::syscall(SYS_socket, AF_ALG, SOCK_SEQPACKET, 0); }, EAFNOSUPPORT, false},
        {"AF_UNIX", [] { return ::syscall(SYS_socket, AF_UNIX, SOCK_STREAM, 0); }, 0},
        {"AF_NETLINK", [] { return ::syscall(SYS_socket, AF_NETLINK, SOCK_RAW, 0); }, 0},
    };
    for (const Network network : {Network::none, Network::host}) {
        const std::string said = saidBy([&]() -> std::string {
            if (::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0 || !fence(network))
                return "no fence";
            std::string wrong;
            for (const auto& row : rows) {
                if (network == Network::host && !row.also)
                    continue;
                const bool refused = row.call() < 0;
                if (refused ? errno != row.error : row.error != 0)
                    wrong += row.what + (" " + std::to_string(refused ? errno : 0)) + "; ";
            }
            return wrong;
        });
        EXPECT_EQ(said, "") << networkName(network);
    }
}

// Goal: the caller's keys stay behind. Method: a key in a session keyring, looked for before and after.
TEST(Fence, LeavesTheCallersKeys) {
    const std::string said = saidBy([]() -> std::string {
        const auto search = [] {
            return ::syscall(SYS_keyctl, KEYCTL_SEARCH, KEY_SPEC_SESSION_KEYRING, "user", "zorvane-test", 0);
        };
        if (::syscall(SYS_keyctl, KEYCTL_JOIN_SESSION_KEYRING, nullptr) < 0)
            return "skip";
        if (::syscall(SYS_add_key, "user", "zorvane-test", "secret", 6, KEY_SPEC_SESSION_KEYRING) < 0 || search() < 0)
            return "no key";
        return leaveKeys() && search() < 0 && errno == ENOKEY ? "left" : "still there";
    });
    if (said == "skip")
        GTEST_SKIP() << "the kernel gives no keyrings here";
    EXPECT_EQ(said, "left");
}

} // namespace
} // namespace zorvanerun
