// SPDX-License-Identifier: Apache-2.0
#include "Daemon.h"

#include "ipc/Protocol.h"
#include "os/SystemRoot.h"
#include "platform/Service.h"
#include "plist/Codec.h"

#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <fstream>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

namespace zor::bench {

using platform::FileDescriptor;

namespace {

/// A first launch on a large root looks at all of it.
constexpr int readyMilliseconds = 120'000;
constexpr int endMilliseconds = 20'000;
constexpr const char* home = "private/var/mobile";

void writeFile(const std::string& path, std::span<const std::uint8_t> bytes) {
    std::ofstream file(path, std::ios::binary | std::ios::trunc);
    file.write(reinterpret_cast<const char*>(bytes.data()), static_cast<std::streamsize>(bytes.size()));
    file.close();
    if (!file)
        throw Failure("cannot write " + path);
}

/// The socket on which the daemon says that it is ready, and the address that it gets in its environment.
FileDescriptor noticeSocket(std::string& address) {
    FileDescriptor socket(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    address = "@zorvane-bench-" + std::to_string(::getpid());
    sockaddr_un bound{};
    bound.sun_family = AF_UNIX;
    std::memcpy(bound.sun_path + 1, address.data() + 1, address.size() - 1);
    const auto length = static_cast<socklen_t>(offsetof(sockaddr_un, sun_path) + address.size());
    if (!socket.valid() || ::bind(socket.get(), reinterpret_cast<const sockaddr*>(&bound), length) != 0)
        failWithErrno("notice socket");
    return socket;
}

} // namespace

void prepareRoot(const Settings& settings, const std::string& root) {
    for (const char* directory : {platform::names::identityDirectory, home, "private/var/brevad", "tmp"})
        std::filesystem::create_directories(root + "/" + directory);
    const std::string passwords =
        "root:x:0:0:root:/private/var/root:/bin/sh\nmobile:x:501:501:User:/" + std::string(home) + ":/bin/sh\n";
    writeFile(root + "/" + platform::names::passwordFile,
              {reinterpret_cast<const std::uint8_t*>(passwords.data()), passwords.size()});
    admitProgram(root, "bench",
                 {{"Identifier", benchIdentifier},
                  {"Executable", settings.ownProgram},
                  {"Entitlements", plist::Dictionary{{std::string(platform::entitlementKeys::allowed), true}}}});
}

void admitProgram(const std::string& root, const std::string& name, const plist::Dictionary& entry) {
    const auto bytes = plist::writeBinary(entry);
    if (!bytes)
        throw Failure("a registry entry cannot be written");
    writeFile(root + "/" + platform::names::identityDirectory + "/" + name + platform::names::identityFileSuffix,
              *bytes);
}

std::string makeClassDirectory(const std::string& root, ContainerClass containerClass) {
    std::string path = root + "/" + home + "/Containers";
    std::string rest = "/" + std::string(className(containerClass));
    for (;;) {
        std::filesystem::create_directory(path);
        if (::geteuid() == 0 && ::chown(path.c_str(), userId, userId) != 0)
            failWithErrno(path);
        if (rest.empty())
            return path;
        const auto end = rest.find('/', 1);
        path += rest.substr(0, end);
        rest = end == std::string::npos ? "" : rest.substr(end);
    }
}

Daemon::Daemon(const Settings& settings, const std::string& root, const Options& options)
    : socketDirectory_(root + "/" + std::string(ipc::runtimeDirectory)) {
    std::string address;
    const FileDescriptor notices = noticeSocket(address);
    ::fflush(nullptr);
    startedAt_ = Clock::now();
    process_ = std::make_unique<ChildProcess>([&] {
        if (options.processor)
            pinThisThread(*options.processor);
        ::setenv("NOTIFY_SOCKET", address.c_str(), 1);
        if (options.syncs == Syncs::off)
            ::setenv("ZORVANE_DURABILITY", "none", 1);
        else
            ::unsetenv("ZORVANE_DURABILITY");
        if (options.syncCounter)
            options.syncCounter->watchThisProcess();
        ::execl(settings.daemonProgram.c_str(), "zorvaned", "--root", root.c_str(),
                options.forgetBoot ? "--forget-boot" : nullptr, static_cast<char*>(nullptr));
    });
    if (options.syncCounter)
        options.syncCounter->start();
    waitUntilReady(notices.get());
    readySeconds_ = secondsSince(startedAt_);
}

void Daemon::waitUntilReady(int notices) {
    for (;;) {
        const auto begin = Clock::now();
        pollfd notice{.fd = notices, .events = POLLIN, .revents = 0};
        while (::poll(&notice, 1, 50) == 0) {
            if (const auto status = process_->waitFor(0))
                throw Failure("the daemon ended with status " + std::to_string(*status));
            if (secondsSince(begin) * 1000 > readyMilliseconds)
                throw Failure("the daemon does not get ready");
        }
        char said[256];
        const ssize_t length = ::recv(notices, said, sizeof said, 0);
        if (length > 0 && std::string_view(said, static_cast<std::size_t>(length)).find("READY=1") != std::string::npos)
            return;
    }
}

Daemon::~Daemon() {
    if (process_->pid() < 0)
        return;
    ::kill(process_->pid(), SIGTERM);
    const auto status = process_->waitFor(endMilliseconds);
    if (status != 0)
        std::fprintf(stderr, "zorvane-bench: the daemon did not end as it should (%d)\n", status.value_or(-1));
}

Client Daemon::connect() const {
    return {socketDirectory_, ipc::serviceName};
}

plist::Dictionary Daemon::counters() const {
    const plist::Dictionary status = replyOf(Client(socketDirectory_, ipc::statusSocketName).receive());
    const plist::Dictionary* counters = status.dictionary(ipc::keys::statusCounters);
    if (!counters)
        throw Failure("the daemon's status has no counters");
    return *counters;
}

double Daemon::residentKiB() const {
    std::ifstream status("/proc/" + std::to_string(process_->pid()) + "/status");
    for (std::string line; std::getline(status, line);)
        if (line.starts_with("VmRSS:"))
            return std::strtod(line.c_str() + 6, nullptr);
    throw Failure("the daemon's memory cannot be read");
}

int Daemon::descriptorCount() const {
    int count = 0;
    for ([[maybe_unused]] const auto& entry :
         std::filesystem::directory_iterator("/proc/" + std::to_string(process_->pid()) + "/fd"))
        ++count;
    return count;
}

} // namespace zor::bench
