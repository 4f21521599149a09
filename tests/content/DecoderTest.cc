// SPDX-License-Identifier: Apache-2.0
// The process that decodes an archive: what it may send, what it holds, what it can do.
#include "content/Decoder.h"
#include "content/ContentWorld.h"
#include "content/Powerless.h"
#include "content/Unpacker.h"

#include <fcntl.h>
#include <fstream>
#include <sys/ioctl.h>
#include <sys/prctl.h>
#include <sys/ptrace.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/uio.h>
#include <sys/wait.h>

namespace zorvanectl::content::test {
namespace {

// Goal: whatever a decoder that was taken over sends, the writer stays in its directory and ends. Method: records that
// no decoder of ours sends, through a pipe.
TEST(Content, NonsenseRecords) {
    const auto bytes = [](const Record& record, const std::string& after = "") {
        return std::string(reinterpret_cast<const char*>(&record), sizeof record) + after;
    };
    const auto data = [&](const std::string& content, std::int64_t offset = 0) {
        const auto length = static_cast<std::uint32_t>(content.size());
        return bytes({.kind = RecordKind::data, .first = length, .offset = offset}, content);
    };
    const auto entry = [&](const std::string& name, const std::string& target, Record record) {
        record.kind = RecordKind::entry;
        record.first = static_cast<std::uint32_t>(name.size());
        record.second = static_cast<std::uint32_t>(target.size());
        return bytes(record, name + target);
    };
    const std::string withNul("f\0g", 3);
    const std::string end = bytes({.kind = RecordKind::end});
    const std::string file = entry("f", "", {.flags = recordHasSize, .mode = S_IFREG | 0644, .offset = 4});
    const std::vector<std::pair<std::string, const char*>> rows = {
        {"", "too early"},
        {file, "too early"},
        {bytes({.kind = RecordKind{77}}), "nonsense"},
        {bytes({.kind = RecordKind::entry, .first = 0xFFFF'FFFF}), "nonsense"},
        {bytes({.kind = RecordKind::entry, .first = 200'000, .second = 200'000}), "nonsense"},
        {bytes({.kind = RecordKind::data, .first = 1, .second = 1}), "nonsense"},
        {data("x"), "data of no file"},
        {entry("d", "", {.mode = S_IFDIR | 0755}) + data("x"), "data of no file"},
        {file + data("x", -1), "out of order"},
        {file + data("x", INT64_MAX), "out of order"},
        {file + data("x", 1) + data("x"), "out of order"},
        {file + data("12345") + end, "longer than it says"},
        {entry("f", "", {.flags = recordHasSize, .mode = S_IFREG | 0644, .offset = -5}) + end, "longer than it says"},
        {entry(withNul, "", {.mode = S_IFREG | 0644}), "NUL"},
        {entry("l", withNul, {.mode = S_IFLNK | 0777}), "NUL"},
        {entry("l", "", {.mode = S_IFLNK | 0777}), "without a target"},
        {entry("", "", {.mode = S_IFREG}), "no name"},
        {bytes({.kind = RecordKind::failure, .first = 4}, "\x1b[2J"), "\\x1b"},
    };
    for (const auto& [sent, why] : rows) {
        SCOPED_TRACE(why);
        World world;
        int ends[2];
        ASSERT_EQ(::pipe2(ends, O_CLOEXEC), 0);
        const FileDescriptor reading(ends[0]);
        ASSERT_EQ(::write(ends[1], sent.data(), sent.size()), static_cast<ssize_t>(sent.size()));
        ::close(ends[1]);
        const FileDescriptor directory = openDirectory(world.path("/source"));
        zor::platform::LinuxDisk disk(zor::platform::Syncs::off);
        Course course(directory.get(), noSignal, {});
        const auto outcome = Unpacker(disk, directory.get(), {}, course).unpack(reading.get());
        ASSERT_FALSE(outcome);
        EXPECT_NE(outcome.error().what.find(why), std::string::npos) << outcome.error().what;
        EXPECT_FALSE(world.isDamaged());
    }
}

// Goal: the process that decodes has the archive, the pipe, and nothing of its caller's. Method: one that waits for its
// reader, as /proc shows it.
TEST(Content, ADecoderHoldsNothing) {
    World world;
    writeFile(world.path("/archive"), makeArchive(Form::tar, {file("f", std::string(4'000'000, 'f'))}));
    const FileDescriptor archive(::open(world.path("/archive").c_str(), O_RDONLY | O_CLOEXEC));
    const auto decoder = Decoder::start(archive.get());
    ASSERT_TRUE(decoder);
    char record = 0;
    ASSERT_EQ(::read(decoder->records(), &record, 1), 1); // it is ready then
    std::string pid;
    std::getline(std::ifstream("/proc/thread-self/children") >> std::ws, pid, ' ');
    const std::string process = "/proc/" + pid;
    std::set<std::string> descriptors;
    for (const auto& entry : std::filesystem::directory_iterator(process + "/fd"))
        descriptors.insert(entry.path().filename());
    EXPECT_EQ(descriptors, (std::set<std::string>{"3", "4"}));
    EXPECT_EQ(std::to_string(::getsid(std::stoi(pid))), pid) << "its caller's session, and terminal";
    const std::string status = readFile(process + "/status");
    std::vector<std::string> lines = {"NoNewPrivs:\t1\n", "Seccomp:\t2\n"};
    if (::geteuid() == 0)
        lines.insert(lines.end(), {"Uid:\t65534\t65534\t65534\t65534\n", "CapPrm:\t0000000000000000\n"});
    for (const std::string& line : lines)
        EXPECT_NE(status.find(line), std::string::npos) << line;
}

/// A step that is not to succeed.
struct Attempt {
    const char* what;
    std::function<long(pid_t parent)> call;
};

/// In a process with a terminal of its own, as an ordinary user where it can be one: starts a powerless one that makes
/// each attempt. The number of the first that succeeded, from 1; 0 when none did.
int firstThatSucceeds(const std::vector<Attempt>& attempts, const char* terminal) {
    if (::setsid() < 0 || (::geteuid() == 0 && (::setgid(ownerId) != 0 || ::setuid(ownerId) != 0)))
        return 101;
    const int opened = ::open(terminal, O_RDWR);
    if (opened < 0 || ::dup2(opened, 0) != 0 || ::prctl(PR_SET_DUMPABLE, 1) != 0)
        return 102;
    const pid_t self = ::getpid();
    const pid_t powerless = ::fork();
    if (powerless == 0) {
        if (!becomePowerless(self))
            ::_exit(103);
        for (std::size_t i = 0; i < attempts.size(); ++i)
            if (attempts[i].call(self) >= 0)
                ::_exit(static_cast<int>(i) + 1);
        ::_exit(0);
    }
    int status = 0;
    ::waitpid(powerless, &status, 0);
    return WIFEXITED(status) ? WEXITSTATUS(status) : 104;
}

// Goal: a decoder that was taken over has no hold on anything, also where its user could do more. Method: a process
// that gave up its powers, with a terminal and a parent of the same user, tries what could help it.
TEST(Content, ADecoderThatWasTakenOver) {
    const TemporaryDirectory directory;
    ::chmod(directory.path().c_str(), 0777);
    const std::string own = directory.path() + "/own";
    writeFile(own, "x");
    (void)!::chown(own.c_str(), ownerId, ownerId);
    const FileDescriptor master(::posix_openpt(O_RDWR | O_NOCTTY | O_CLOEXEC));
    char terminal[64];
    ASSERT_EQ(::grantpt(master.get()), 0);
    ASSERT_EQ(::unlockpt(master.get()), 0);
    ASSERT_EQ(::ptsname_r(master.get(), terminal, sizeof terminal), 0);
    ::chmod(terminal, 0666);
    char byte = 'x';
    iovec part{.iov_base = &byte, .iov_len = 1};
    const char* const words[] = {"false", nullptr};
    const std::vector<Attempt> attempts = {
        {"types into the terminal", [&](pid_t) { return ::syscall(SYS_ioctl, 0, TIOCSTI, &byte); }},
        {"opens", [&](pid_t) { return ::syscall(SYS_openat, AT_FDCWD, own.c_str(), O_RDONLY); }},
        {"removes", [&](pid_t) { return ::syscall(SYS_unlinkat, AT_FDCWD, own.c_str(), 0); }},
        {"truncates", [&](pid_t) { return ::syscall(SYS_truncate, own.c_str(), 0); }},
        {"connects", [](pid_t) { return ::syscall(SYS_socket, AF_UNIX, SOCK_STREAM, 0); }},
        {"signals its parent", [](pid_t parent) { return ::syscall(SYS_kill, parent, 0); }},
        {"signals everybody", [](pid_t) { return ::syscall(SYS_kill, -1, 0); }},
        {"writes into its parent",
         [&](pid_t parent) { return ::syscall(SYS_process_vm_writev, parent, &part, 1, &part, 1, 0); }},
        {"traces its parent", [](pid_t parent) { return ::syscall(SYS_ptrace, PTRACE_SEIZE, parent, 0, 0); }},
        {"forks", [](pid_t) { return ::syscall(SYS_clone, SIGCHLD, 0, 0, 0, 0); }},
        {"executes", [&](pid_t) { return ::syscall(SYS_execve, "/bin/false", words, words + 1); }},
    };
    const pid_t user = ::fork();
    if (user == 0)
        ::_exit(firstThatSucceeds(attempts, terminal));
    int status = 0;
    ASSERT_EQ(::waitpid(user, &status, 0), user);
    ASSERT_TRUE(WIFEXITED(status));
    const auto number = static_cast<std::size_t>(WEXITSTATUS(status));
    EXPECT_EQ(number, 0U) << (number <= attempts.size() ? attempts[number - 1].what : "the test is not set up");
}

} // namespace
} // namespace zorvanectl::content::test
