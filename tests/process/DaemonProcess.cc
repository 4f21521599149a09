// SPDX-License-Identifier: Apache-2.0
#include "process/DaemonProcess.h"

#include "platform/linux/SemaphoreBootMarker.h"
#include "platform/linux/SystemRoot.h"

#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

namespace zor::whole {

namespace {

void writeFile(const std::string& path, const std::string& text) {
    std::filesystem::create_directories(std::filesystem::path(path).parent_path());
    std::ofstream(path) << text;
    ::chmod(path.c_str(), 0644);
}

std::string ownProgram() {
    char path[4096];
    const ssize_t length = ::readlink("/proc/self/exe", path, sizeof path);
    return {path, static_cast<std::size_t>(std::max<ssize_t>(length, 0))};
}

std::string registryEntry(const std::string& executable) {
    return "<?xml version=\"1.0\"?><plist version=\"1.0\"><dict><key>Identifier</key><string>org.example.tests</string>"
           "<key>Executable</key><string>" +
           executable +
           "</string><key>Entitlements</key><dict><key>com.veltra.private.Zorvane.allowed</key><true/></dict></dict>"
           "</plist>";
}

std::string readAll(int descriptor) {
    std::string text;
    char buffer[4096];
    for (ssize_t count; (count = ::read(descriptor, buffer, sizeof buffer)) > 0;)
        text.append(buffer, static_cast<std::size_t>(count));
    return text;
}

int exitStatusOf(pid_t pid) {
    int status = 0;
    ::waitpid(pid, &status, 0);
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

pid_t execute(const std::vector<std::string>& arguments, int output) {
    std::vector<char*> pointers;
    for (const std::string& argument : arguments)
        pointers.push_back(const_cast<char*>(argument.c_str()));
    pointers.push_back(nullptr);
    const pid_t pid = ::fork();
    if (pid == 0) {
        ::dup2(output, 1);
        ::dup2(output, 2);
        ::execv(pointers[0], pointers.data());
        ::_exit(127);
    }
    return pid;
}

} // namespace

std::string programPath(const std::string& name) {
    return ZORVANE_BINARY_DIR "/bin/" + name;
}

double raceSeconds() {
    return std::getenv("ZORVANE_TEST_LONG") ? 30.0 : 2.0;
}

DaemonProcess::Outcome runProgram(const std::vector<std::string>& arguments) {
    int ends[2];
    if (::pipe2(ends, O_CLOEXEC) != 0)
        return {};
    const pid_t pid = execute(arguments, ends[1]);
    ::close(ends[1]);
    DaemonProcess::Outcome outcome;
    outcome.output = readAll(ends[0]);
    ::close(ends[0]);
    outcome.exitStatus = exitStatusOf(pid);
    return outcome;
}

DaemonProcess::DaemonProcess(Syncs syncs, const std::string& parent) : directory_(parent), syncs_(syncs) {
    ::chmod(root().c_str(), 0755);
    for (const char* directory : {"private/var/mobile", "private/var/second", "private/var/brevad", "tmp"})
        std::filesystem::create_directories(path(directory));
    writeFile(path("etc/passwd"), "root:x:0:0::/private/var/root:/bin/sh\n"
                                  "mobile:x:501:501::/private/var/mobile:/bin/sh\n"
                                  "second:x:502:502::/private/var/second:/bin/sh\n");
    writeFile(path("etc/zorvane/identities.d/10-tests.plist"), registryEntry(ownProgram()));
    writeFile(path("etc/zorvane/identities.d/20-ctl.plist"), registryEntry(programPath("zorvanectl")));
    if (::geteuid() == 0) {
        (void)!::chown(path("private/var/mobile").c_str(), 501, 501);
        (void)!::chown(path("private/var/second").c_str(), 502, 502);
        (void)!::chown(path("private/var/brevad").c_str(), 33, 33);
    }
}

DaemonProcess::~DaemonProcess() {
    if (pid_ > 0)
        kill();
    // The marker of this root is a semaphore that would outlive it.
    if (const auto opened = platform::SystemRoot::open(root()))
        platform::SemaphoreBootMarker(*opened).forget();
}

pid_t DaemonProcess::spawn(const std::vector<std::string>& arguments, int output) const {
    std::vector<std::string> all = {programPath("zorvaned"), "--root", root()};
    all.insert(all.end(), arguments.begin(), arguments.end());
    if (syncs_ == Syncs::off)
        ::setenv("ZORVANE_DURABILITY", "none", 1);
    else
        ::unsetenv("ZORVANE_DURABILITY");
    return execute(all, output);
}

void DaemonProcess::start(std::vector<std::string> moreArguments) {
    const int output = ::open(path("daemon-output").c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
    pid_ = spawn(moreArguments, output);
    ::close(output);
    for (int tries = 0; tries < 3000; ++tries) {
        if (zorvane::Client::connect(connection()))
            return;
        if (!running())
            break;
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    std::fprintf(stderr, "the daemon does not serve:\n%s\n", log().c_str());
    std::abort();
}

void DaemonProcess::kill() {
    ::kill(pid_, SIGKILL);
    (void)exitStatusOf(std::exchange(pid_, -1));
}

int DaemonProcess::terminate() {
    ::kill(pid_, SIGTERM);
    return exitStatusOf(std::exchange(pid_, -1));
}

DaemonProcess::Outcome DaemonProcess::runAnother() const {
    return runProgram({programPath("zorvaned"), "--root", root()});
}

bool DaemonProcess::running() const {
    siginfo_t info{};
    return pid_ > 0 && ::waitid(P_PID, static_cast<id_t>(pid_), &info, WEXITED | WNOHANG | WNOWAIT) == 0 &&
           info.si_pid == 0;
}

zorvane::Client DaemonProcess::client() const {
    auto connected = zorvane::Client::connect(connection());
    if (!connected) {
        std::fprintf(stderr, "no client: %s\n", connected.error().message.c_str());
        std::abort();
    }
    return std::move(*connected);
}

std::int64_t DaemonProcess::counter(const std::string& name) const {
    const auto answer = zorvane::status(connection());
    if (!answer)
        return -1;
    const auto& counters = std::get<zorvane::Map>(std::get<zorvane::Map>(answer->content).at("Counters").content);
    return std::get<std::int64_t>(counters.at(name).content);
}

std::size_t DaemonProcess::descriptors() const {
    std::size_t count = 0;
    for ([[maybe_unused]] const auto& entry :
         std::filesystem::directory_iterator("/proc/" + std::to_string(pid_) + "/fd"))
        ++count;
    return count;
}

std::string DaemonProcess::log() const {
    std::ostringstream text;
    text << std::ifstream(path("private/var/root/Library/Logs/Zorvane/zorvaned.log")).rdbuf()
         << std::ifstream(path("daemon-output")).rdbuf();
    return text.str();
}

} // namespace zor::whole
