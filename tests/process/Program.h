// SPDX-License-Identifier: Apache-2.0
// A program in a process of its own.
#pragma once

#include <functional>
#include <optional>
#include <string>
#include <sys/types.h>
#include <vector>

namespace zor::whole {

/// Ends with this object at the latest.
class Program {
public:
    /// `prepare`, in the new process: whether the program may begin.
    explicit Program(const std::vector<std::string>& words, const std::function<bool()>& prepare = {});
    ~Program();
    Program(const Program&) = delete;
    Program& operator=(const Program&) = delete;

    [[nodiscard]] pid_t pid() const { return pid_; }
    void signal(int number) const;
    [[nodiscard]] bool running() const;
    /// The exit status; 128 and the number after a signal.
    int wait();
    /// For one that is traced: the signal that it stopped for, or nothing when it ended.
    std::optional<int> nextStop();
    /// On both outputs until now.
    [[nodiscard]] std::string said() const;

private:
    pid_t pid_ = -1;
    int output_ = -1;
    int exitStatus_ = -1;
};

struct Outcome {
    int exitStatus = -1;
    std::string output;
};
/// Runs a program to its end.
Outcome runProgram(const std::vector<std::string>& words);
/// The path of a built program.
std::string programPath(const std::string& name);
/// The path of a source of what is installed beside the programs.
std::string packagingPath(const std::string& name);
/// The program that asks.
std::string ownProgram();

} // namespace zor::whole
