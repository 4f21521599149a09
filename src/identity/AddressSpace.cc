// SPDX-License-Identifier: Apache-2.0
#include "identity/AddressSpace.h"

#include <cerrno>
#include <csignal>
#include <fcntl.h>
#include <poll.h>
#include <string>
#include <sys/wait.h>
#include <unistd.h>

namespace zor::platform {

namespace {

/// A child of the trial needs far less; whoever keeps its pipe open must not hold up the start.
constexpr int trialMilliseconds = 1000;

/// Becomes this very program, and says so by the end of the pipe whose writing end closes when it does. Else something
/// comes through the pipe.
[[noreturn]] void execute(int writingEnd) {
    const int null = ::open("/dev/null", O_RDWR | O_CLOEXEC);
    for (int standard = 0; standard <= 2; ++standard)
        (void)::dup3(null, standard, 0);
    char program[] = "/proc/self/exe";
    char option[] = "--version";
    char* const arguments[] = {program, option, nullptr};
    char* const environment[] = {nullptr};
    ::execve(program, arguments, environment);
    (void)!::write(writingEnd, "x", 1);
    ::_exit(1);
}

bool ends(int readingEnd) {
    pollfd end{.fd = readingEnd, .events = POLLIN, .revents = 0};
    int count = 0;
    do {
        count = ::poll(&end, 1, trialMilliseconds);
    } while (count < 0 && errno == EINTR);
    char byte = 0;
    return count > 0 && ::read(readingEnd, &byte, sizeof byte) == 0;
}

} // namespace

AddressSpace AddressSpace::opened(int process) {
    AddressSpace space;
    space.pageMap_.reset(::openat(process, "pagemap", O_RDONLY | O_CLOEXEC));
    return space;
}

AddressSpace AddressSpace::of(int process) {
    return isTold() ? opened(process) : AddressSpace();
}

bool AddressSpace::lives() const {
    char byte = 0;
    return pageMap_.valid() && ::pread(pageMap_.get(), &byte, sizeof byte, 0) < 0 && errno == EINVAL;
}

bool AddressSpace::isTold() {
    static const bool told = [] {
        const FileDescriptor self(::open("/proc/self", O_PATH | O_DIRECTORY | O_CLOEXEC));
        int begin[2] = {};
        int end[2] = {};
        if (!self.valid() || !opened(self.get()).lives() || ::pipe2(begin, O_CLOEXEC) != 0)
            return false;
        const FileDescriptor beginReading(begin[0]);
        FileDescriptor beginWriting(begin[1]);
        if (::pipe2(end, O_CLOEXEC) != 0)
            return false;
        const FileDescriptor endReading(end[0]);
        FileDescriptor endWriting(end[1]);
        // Not vfork: its child would share the address space.
        const pid_t child = ::fork();
        if (child < 0)
            return false;
        if (child == 0) {
            char byte = 0;
            beginWriting.reset();
            (void)!::read(beginReading.get(), &byte, sizeof byte);
            execute(endWriting.get());
        }
        const std::string path = "/proc/" + std::to_string(child);
        const FileDescriptor process(::open(path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
        const AddressSpace space = opened(process.get());
        const bool livedBefore = space.lives();
        endWriting.reset();
        beginWriting.reset();
        const bool left = ends(endReading.get()) && !space.lives();
        ::kill(child, SIGKILL);
        ::waitpid(child, nullptr, 0);
        return livedBefore && left;
    }();
    return told;
}

} // namespace zor::platform
