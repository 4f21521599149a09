// SPDX-License-Identifier: Apache-2.0
// The service manager's own forms: the datagrams that tell it how the daemon is, the listening sockets that it passes,
// and the journal's lines with fields.
#pragma once

#include "os/FileDescriptor.h"
#include "platform/Errno.h"

#include <chrono>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace zor::platform {

/// Tells the service manager how the daemon is, over the datagram socket that NOTIFY_SOCKET names. Any thread.
class NotifySocket {
public:
    /// `address` is the variable's value: a path, or "@" and an abstract name. Empty: nobody wants to know.
    explicit NotifySocket(std::string address) : address_(std::move(address)) {}
    /// The one of this process's environment.
    [[nodiscard]] static NotifySocket ofEnvironment();

    /// How long the manager waits for each "WATCHDOG=1" of this process, as its environment says; absent: it does not.
    [[nodiscard]] static std::optional<std::chrono::microseconds> watchdogOfEnvironment();

    /// "READY=1", "STOPPING=1", "STATUS=..." or several of them, a line each. No error when nobody wants to know. Waits
    /// a few seconds at most.
    Errno send(std::string_view state) const;

private:
    std::string address_;
};

// The system journal in its own form: a line with fields, and a priority that says whether somebody has to act.
//
// It is used where the service manager has connected standard error to the journal. A journal that does not read loses
// lines rather than holding up who writes them; the log file has them all. Any thread.

/// One log line. Its error and the request that it belongs to are the thread's own (LogSubject).
struct JournalLine {
    int level = 0;
    std::string_view function;
    std::string_view message;
};

class Journal {
public:
    /// Not connected where `standardError` does not lead to the journal.
    [[nodiscard]] static Journal ofEnvironment(int standardError);
    /// One that listens at `path`.
    [[nodiscard]] static Journal at(const std::string& path);
    Journal() = default;

    [[nodiscard]] bool isConnected() const { return socket_.valid(); }
    /// Whether the journal took it.
    bool write(const JournalLine& line) const;

private:
    explicit Journal(FileDescriptor socket) : socket_(std::move(socket)) {}
    FileDescriptor socket_;
};

/// The listening sockets that the service manager passed to this process (LISTEN_FDS), by their names. Taken once, by
/// main, before any thread.
class PassedSockets {
public:
    PassedSockets() = default;
    /// The values of LISTEN_PID, LISTEN_FDS and LISTEN_FDNAMES.
    struct Variables {
        std::string pid;
        std::string count;
        std::string names;
    };
    /// The sockets that the variables name; none when they are meant for another process or make no sense. The
    /// descriptors are this object's from then on, those that nobody takes are closed with it, and no child inherits
    /// them.
    [[nodiscard]] static PassedSockets of(const Variables& variables, int firstDescriptor = 3);
    /// Those of this process's environment, which is cleared of them.
    [[nodiscard]] static PassedSockets ofEnvironment();

    /// The first one of the name that was not taken yet; invalid when there is none.
    [[nodiscard]] FileDescriptor take(std::string_view name);

private:
    struct Passed {
        std::string name;
        FileDescriptor socket;
    };
    std::vector<Passed> sockets_;
};

} // namespace zor::platform
