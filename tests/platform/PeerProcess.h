// SPDX-License-Identifier: Apache-2.0
// Real processes that connect to a socket: what peer identity is judged by. A process begins as a copy of the shell
// under a name of the test's choice, connects before that, and executes whatever path it is sent next.
#pragma once

#include "platform/FileDescriptor.h"
#include "platform/TestRoot.h"

#include <csignal>
#include <cstring>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

namespace zor::platform {

/// A listening socket with an address that any user can connect to.
class PeerServer {
public:
    explicit PeerServer(int type = SOCK_STREAM) : type_(type), socket_(::socket(AF_UNIX, type | SOCK_CLOEXEC, 0)) {
        address_.sun_family = AF_UNIX;
        // The first byte is 0: an address without a file. The kernel picks the rest.
        socklen_t length = sizeof(sa_family_t);
        EXPECT_EQ(::bind(socket_.get(), reinterpret_cast<sockaddr*>(&address_), length), 0);
        length = sizeof address_;
        EXPECT_EQ(::getsockname(socket_.get(), reinterpret_cast<sockaddr*>(&address_), &length), 0);
        length_ = length;
        EXPECT_EQ(::listen(socket_.get(), 16), 0);
    }
    [[nodiscard]] int type() const { return type_; }
    [[nodiscard]] FileDescriptor accept() const {
        return FileDescriptor(::accept4(socket_.get(), nullptr, nullptr, SOCK_CLOEXEC));
    }
    [[nodiscard]] int connect(int fd) const {
        return ::connect(fd, reinterpret_cast<const sockaddr*>(&address_), length_);
    }

private:
    int type_;
    FileDescriptor socket_;
    sockaddr_un address_{};
    socklen_t length_ = 0;
};

/// Copies a program, so that its inode is the copy's alone.
inline void copyProgram(const std::string& from, const std::string& to) {
    std::ifstream in(from, std::ios::binary);
    std::ofstream(to, std::ios::binary | std::ios::trunc) << in.rdbuf();
    ::chmod(to.c_str(), 0755);
}

class PeerProcess {
public:
    /// Connects as `uid` (when the test is root), then becomes `shell`, a copy of /bin/sh. The connection stays open in
    /// it.
    PeerProcess(const PeerServer& server, const std::string& shell, uid_t uid = ::geteuid()) {
        int ends[2] = {};
        EXPECT_EQ(::pipe2(ends, O_CLOEXEC), 0);
        const int connection = ::socket(AF_UNIX, server.type(), 0);
        pid_ = ::fork();
        if (pid_ == 0) {
            const bool changed = uid == ::geteuid() || ::setresuid(uid, uid, uid) == 0;
            if (!changed || server.connect(connection) != 0 || ::dup3(ends[0], 0, 0) != 0)
                ::_exit(1);
            ::execl(shell.c_str(), shell.c_str(), "-c", "read next && exec \"$next\" 1000", nullptr);
            ::_exit(1);
        }
        ::close(connection);
        ::close(ends[0]);
        commands_.reset(ends[1]);
        accepted_ = server.accept();
        EXPECT_TRUE(runs(shell)) << "the process did not start";
    }
    ~PeerProcess() { end(); }
    PeerProcess(const PeerProcess&) = delete;
    PeerProcess& operator=(const PeerProcess&) = delete;

    [[nodiscard]] pid_t pid() const { return pid_; }
    /// This side of its connection.
    [[nodiscard]] int socket() const { return accepted_.get(); }
    /// Has the process execute another program, and waits until it does.
    void execute(const std::string& program) const {
        const std::string line = program + "\n";
        EXPECT_EQ(::write(commands_.get(), line.data(), line.size()), static_cast<ssize_t>(line.size()));
        EXPECT_TRUE(runs(program)) << program;
    }
    void kill() const { ::kill(pid_, SIGKILL); }
    void end() {
        if (pid_ <= 0)
            return;
        kill();
        ::waitpid(pid_, nullptr, 0);
        pid_ = -1;
    }

private:
    [[nodiscard]] bool runs(const std::string& program) const {
        const std::string link = "/proc/" + std::to_string(pid_) + "/exe";
        return eventually([&] {
            struct stat wanted{};
            struct stat actual{};
            return ::stat(program.c_str(), &wanted) == 0 && ::stat(link.c_str(), &actual) == 0 &&
                   wanted.st_ino == actual.st_ino && wanted.st_dev == actual.st_dev;
        });
    }

    pid_t pid_ = -1;
    FileDescriptor commands_;
    FileDescriptor accepted_;
};

} // namespace zor::platform
