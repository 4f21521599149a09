// SPDX-License-Identifier: Apache-2.0
// Starting, pinning and ending the processes of a run. None outlives the process that started it: the kernel kills it
// then.
#pragma once

#include <functional>
#include <optional>
#include <sched.h>
#include <stdexcept>
#include <string>
#include <sys/types.h>
#include <vector>

namespace zor::bench {

/// A reason that makes a measurement impossible; ends the run.
struct Failure : std::runtime_error {
    using std::runtime_error::runtime_error;
};
/// A failure with the text of errno.
[[noreturn]] void failWithErrno(const std::string& what);

/// A child process that is killed, and waited for, with this object. To be made on the main thread.
class ChildProcess {
public:
    /// `body` runs in the child; when it returns, the child ends with status 127.
    explicit ChildProcess(const std::function<void()>& body);
    ~ChildProcess();
    ChildProcess(const ChildProcess&) = delete;
    ChildProcess& operator=(const ChildProcess&) = delete;

    [[nodiscard]] pid_t pid() const { return pid_; }
    /// Processor time that all of its threads took so far.
    [[nodiscard]] double processorSeconds() const;
    /// Its exit status once it ended by itself within the limit (128 and the number when by a signal); else nothing.
    std::optional<int> waitFor(int milliseconds);
    /// The same, as long as it takes.
    int wait();

private:
    std::optional<int> take(int options);

    pid_t pid_ = -1;
};

/// Runs a program, its output thrown away, and gives the seconds that it took; a failure when it fails.
double runProgram(const std::vector<std::string>& command);

/// The processor that pinned measurements use: the last one that this process may use.
[[nodiscard]] int measuringProcessor();
void pinThisThread(int processor);

/// Pins the calling thread for as long as it lives.
class Pinned {
public:
    explicit Pinned(int processor);
    ~Pinned();
    Pinned(const Pinned&) = delete;
    Pinned& operator=(const Pinned&) = delete;

private:
    cpu_set_t before_{};
};

} // namespace zor::bench
