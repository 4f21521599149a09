// SPDX-License-Identifier: Apache-2.0
// The real daemon as a process of its own, on a root of the test's own, for tests that look at the whole from outside.
#pragma once

#include "support/FileTree.h"
#include "zorvane/Client.h"

#include <string>
#include <sys/types.h>
#include <vector>

namespace zor::whole {

/// Makes the root, with users 501 and 502 and a registry entry that gives this test program every power.
class DaemonProcess {
public:
    enum class Syncs { off, on };
    explicit DaemonProcess(Syncs syncs = Syncs::off, const std::string& parent = "/dev/shm");
    ~DaemonProcess();
    DaemonProcess(const DaemonProcess&) = delete;
    DaemonProcess& operator=(const DaemonProcess&) = delete;

    /// Starts the daemon and waits until clients can connect.
    void start(std::vector<std::string> moreArguments = {});
    /// SIGKILL, and waits for the end.
    void kill();
    /// SIGTERM; the exit status.
    int terminate();
    /// A second run of the program on the same root: its exit status and what it said.
    struct Outcome {
        int exitStatus = -1;
        std::string output;
    };
    [[nodiscard]] Outcome runAnother() const;

    [[nodiscard]] bool running() const;
    [[nodiscard]] pid_t pid() const { return pid_; }
    [[nodiscard]] std::string root() const { return directory_.path(); }
    [[nodiscard]] std::string path(const std::string& relative) const { return root() + "/" + relative; }
    [[nodiscard]] zorvane::ConnectOptions connection() const { return {.root = root(), .timeoutMilliseconds = 20'000}; }
    /// A connected client; ends the test's process when there is none.
    [[nodiscard]] zorvane::Client client() const;
    /// A number of the status's "Counters".
    [[nodiscard]] std::int64_t counter(const std::string& name) const;
    [[nodiscard]] std::size_t descriptors() const;
    [[nodiscard]] std::string log() const;

private:
    [[nodiscard]] pid_t spawn(const std::vector<std::string>& arguments, int output) const;
    support::TemporaryDirectory directory_;
    const Syncs syncs_;
    pid_t pid_ = -1;
};

/// Runs a program and gives its exit status and both outputs.
DaemonProcess::Outcome runProgram(const std::vector<std::string>& arguments);
/// Where the built programs lie.
std::string programPath(const std::string& name);
/// How long a race is to last: long with ZORVANE_TEST_LONG.
double raceSeconds();

} // namespace zor::whole
