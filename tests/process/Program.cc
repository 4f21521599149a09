// SPDX-License-Identifier: Apache-2.0
#include "process/Program.h"

#include <csignal>
#include <filesystem>
#include <sys/mman.h>
#include <sys/wait.h>
#include <unistd.h>

namespace zor::whole {

Program::Program(const std::vector<std::string>& words, const std::function<bool()>& prepare)
    : output_(::memfd_create("output", MFD_CLOEXEC)) {
    std::vector<char*> pointers;
    for (const std::string& word : words)
        pointers.push_back(const_cast<char*>(word.c_str()));
    pointers.push_back(nullptr);
    pid_ = ::fork();
    if (pid_ == 0) {
        ::dup2(output_, 1);
        ::dup2(output_, 2);
        // A test that runs in the background may have been told to ignore them.
        for (const int number : {SIGHUP, SIGINT, SIGQUIT})
            (void)::signal(number, SIG_DFL);
        if (!prepare || prepare())
            ::execv(pointers[0], pointers.data());
        ::_exit(127);
    }
}

Program::~Program() {
    if (pid_ > 0) {
        signal(SIGKILL);
        (void)wait();
    }
    ::close(output_);
}

void Program::signal(int number) const {
    if (pid_ > 0)
        ::kill(pid_, number);
}

bool Program::running() const {
    siginfo_t info{};
    return pid_ > 0 && ::waitid(P_PID, static_cast<id_t>(pid_), &info, WEXITED | WNOHANG | WNOWAIT) == 0 &&
           info.si_pid == 0;
}

std::optional<int> Program::nextStop() {
    int status = 0;
    if (pid_ <= 0 || ::waitpid(pid_, &status, 0) != pid_)
        return {};
    if (WIFSTOPPED(status))
        return WSTOPSIG(status);
    exitStatus_ = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    pid_ = -1;
    return {};
}

int Program::wait() {
    while (nextStop()) {
    }
    return exitStatus_;
}

std::string Program::said() const {
    std::string text;
    char buffer[4096];
    for (ssize_t count; (count = ::pread(output_, buffer, sizeof buffer, static_cast<off_t>(text.size()))) > 0;)
        text.append(buffer, static_cast<std::size_t>(count));
    return text;
}

Outcome runProgram(const std::vector<std::string>& words) {
    Program program(words);
    const int exitStatus = program.wait();
    return {exitStatus, program.said()};
}

std::string programPath(const std::string& name) {
    return ZORVANE_BINARY_DIR "/bin/" + name;
}

std::string packagingPath(const std::string& name) {
    return ZORVANE_PACKAGING_DIR "/" + name;
}

std::string ownProgram() {
    return std::filesystem::read_symlink("/proc/self/exe");
}

} // namespace zor::whole
