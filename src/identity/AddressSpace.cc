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

/// A child that lives in an address space of its own until it is told to execute a program, which it then does while
/// this process goes on.
class AddressSpace::Trial {
public:
    Trial();
    ~Trial();
    Trial(const Trial&) = delete;
    Trial& operator=(const Trial&) = delete;
    /// Waits for the child's end.
    [[nodiscard]] bool outcome() const { return livedBefore_ && ends(end_.get()) && !space_.lives(); }

private:
    pid_t child_ = -1;
    FileDescriptor end_;
    AddressSpace space_;
    bool livedBefore_ = false;
};

AddressSpace::Trial::Trial() {
    const FileDescriptor self(::open("/proc/self", O_PATH | O_DIRECTORY | O_CLOEXEC));
    int begin[2] = {};
    int end[2] = {};
    if (!self.valid() || !opened(self.get()).lives() || ::pipe2(begin, O_CLOEXEC) != 0)
        return;
    const FileDescriptor beginReading(begin[0]);
    FileDescriptor beginWriting(begin[1]);
    if (::pipe2(end, O_CLOEXEC) != 0)
        return;
    end_.reset(end[0]);
    const FileDescriptor endWriting(end[1]);
    // Not vfork: its child would share the address space. The child calls nothing that needs a lock of this process.
    child_ = ::fork();
    if (child_ < 0)
        return;
    if (child_ == 0) {
        char byte = 0;
        beginWriting.reset();
        (void)!::read(beginReading.get(), &byte, sizeof byte);
        execute(endWriting.get());
    }
    const std::string path = "/proc/" + std::to_string(child_);
    const FileDescriptor process(::open(path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    space_ = opened(process.get());
    livedBefore_ = space_.lives();
}

AddressSpace::Trial::~Trial() {
    if (child_ <= 0)
        return;
    ::kill(child_, SIGKILL);
    ::waitpid(child_, nullptr, 0);
}

std::unique_ptr<AddressSpace::Trial>& AddressSpace::trial() {
    static std::unique_ptr<Trial> begun;
    return begun;
}

void AddressSpace::beginTrial() {
    trial() = std::make_unique<Trial>();
}

bool AddressSpace::isTold() {
    static const bool told = [] {
        if (!trial())
            beginTrial();
        const std::unique_ptr<Trial> begun = std::move(trial());
        return begun->outcome();
    }();
    return told;
}

} // namespace zor::platform
