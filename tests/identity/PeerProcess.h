// SPDX-License-Identifier: Apache-2.0
// Real processes that connect to a socket, and the registry that they are judged by.
#pragma once

#include "identity/LinuxPeer.h"
#include "os/SystemRoot.h"
#include "support/FewDescriptors.h"
#include "support/RecordingLog.h"
#include "support/TestRoot.h"
#include "support/Waiting.h"

#include <csignal>
#include <gtest/gtest.h>
#include <linux/sched.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/un.h>
#include <sys/wait.h>

namespace zor::platform {

using support::eventually;
using support::TestRoot;

/// A listening socket with an address that any user can connect to.
class PeerServer {
public:
    PeerServer() : socket_(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
        address_.sun_family = AF_UNIX;
        // The first byte is 0: an address without a file. The kernel picks the rest.
        EXPECT_EQ(::bind(socket_.get(), reinterpret_cast<sockaddr*>(&address_), sizeof(sa_family_t)), 0);
        EXPECT_EQ(::getsockname(socket_.get(), reinterpret_cast<sockaddr*>(&address_), &length_), 0);
        EXPECT_EQ(::listen(socket_.get(), 16), 0);
    }
    [[nodiscard]] FileDescriptor accept() const {
        return FileDescriptor(::accept4(socket_.get(), nullptr, nullptr, SOCK_CLOEXEC));
    }
    [[nodiscard]] int connect(int fd) const {
        return ::connect(fd, reinterpret_cast<const sockaddr*>(&address_), length_);
    }

private:
    FileDescriptor socket_;
    sockaddr_un address_{};
    socklen_t length_ = sizeof address_;
};

struct PeerStart {
    /// As whom it runs, when the test is root.
    uid_t uid = ::geteuid();
    enum class Connects { andIsAccepted, yes, no } connects = Connects::andIsAccepted;
    /// Changes its world before it connects; false ends it.
    std::function<bool()> prepare = {};
    /// The file that it runs in the end, as it is named here, when that is not the shell's.
    std::string runs = {};
    /// The number that it is to have.
    pid_t number = 0;
    /// With one, the program is not the shell but one that takes this.
    const char* argument = nullptr;
};

/// A process that connects and then becomes `shell`, a copy of /bin/sh; the connection stays open in it.
class PeerProcess {
public:
    PeerProcess(const PeerServer& server, const std::string& shell, const PeerStart& start = {}) {
        int ends[2] = {};
        EXPECT_EQ(::pipe2(ends, O_CLOEXEC), 0);
        const FileDescriptor connection(::socket(AF_UNIX, SOCK_STREAM, 0));
        clone_args asNumbered{};
        asNumbered.exit_signal = SIGCHLD;
        asNumbered.set_tid = reinterpret_cast<std::uintptr_t>(&start.number);
        asNumbered.set_tid_size = 1;
        pid_ = start.number == 0 ? ::fork() : static_cast<pid_t>(::syscall(SYS_clone3, &asNumbered, sizeof asNumbered));
        if (pid_ == 0) {
            const bool ready = (start.uid == ::geteuid() || ::setresuid(start.uid, start.uid, start.uid) == 0) &&
                               (!start.prepare || start.prepare()) &&
                               (start.connects == PeerStart::Connects::no || server.connect(connection.get()) == 0);
            if (ready && start.argument)
                ::execl(shell.c_str(), shell.c_str(), start.argument, nullptr);
            if (ready && ::dup3(ends[0], 0, 0) == 0)
                ::execl(shell.c_str(), shell.c_str(), "-c", "read next && exec \"$next\" 1000", nullptr);
            ::_exit(1);
        }
        ::close(ends[0]);
        commands_.reset(ends[1]);
        if (start.connects == PeerStart::Connects::andIsAccepted)
            accepted_ = server.accept();
        EXPECT_TRUE(pid_ < 0 || runs(start.runs.empty() ? shell : start.runs)) << "the process did not start";
    }
    ~PeerProcess() { end(); }

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
        ::waitpid(std::exchange(pid_, -1), nullptr, 0);
    }

private:
    [[nodiscard]] bool runs(const std::string& program) const {
        const std::string link = "/proc/" + std::to_string(pid_) + "/exe";
        std::error_code ignored;
        return eventually([&] { return std::filesystem::equivalent(program, link, ignored); });
    }
    pid_t pid_ = -1;
    FileDescriptor commands_;
    FileDescriptor accepted_;
};

/// A root with a registry and some programs, "agent", "other" and "sleeper".
struct PeerWorld {
    /// Peers of this uid count as the owner of the root. uid 0 always does.
    explicit PeerWorld(uid_t owner = ::geteuid() + 1000) : identity(registry, owner) {
        for (const auto& [name, from] :
             {std::pair("agent", "/bin/sh"), {"other", "/bin/sh"}, {"sleeper", "/bin/sleep"}})
            copyProgram(from, name);
    }
    /// Its inode is the copy's alone.
    void copyProgram(const std::string& from, const std::string& name) const {
        std::filesystem::copy_file(from, program(name));
    }
    /// One of the root's, or of the machine's by its path.
    [[nodiscard]] std::string program(const std::string& name) const {
        return name.starts_with('/') ? name : test.path(name);
    }
    [[nodiscard]] std::string entry(const std::string& name, const std::string& more = "") const {
        return "<plist version=\"1.0\"><dict><key>Executable</key><string>" + program(name) + "</string>" + more +
               "</dict></plist>";
    }
    /// As an entry that gives this identifier.
    [[nodiscard]] std::string named(const std::string& name, const std::string& identifier,
                                    const std::string& more = "") const {
        return entry(name, "<key>Identifier</key><string>" + identifier + "</string>" + more);
    }
    /// Registers a program under an identifier.
    void registerAs(const std::string& file, const std::string& name, const std::string& identifier,
                    const std::string& more = "") const {
        test.replace(pathOf(file), named(name, identifier, more));
    }
    /// The path of a registry file, from the root.
    [[nodiscard]] static std::string pathOf(const std::string& file) {
        return std::string(names::identityDirectory) + "/" + file;
    }
    [[nodiscard]] std::unique_ptr<Peer> peerOf(const PeerProcess& process) {
        return identity.peerOfSocket(process.socket());
    }

    TestRoot test{"/tmp"}; // programs may be executed there
    support::RecordingLog log{7};
    IdentityRegistry registry{test.root(), log, ::geteuid()};
    LinuxPeerIdentity identity;
    PeerServer server;
};

/// The identity of the peer: its identifier, "" for a grant without one, "-" for no grant.
inline std::string who(Peer& peer) {
    const Identity identity = peer.identify(Peer::Explain::no);
    return !identity.grant ? "-" : identity.grant->identifier.value_or("");
}

} // namespace zor::platform
