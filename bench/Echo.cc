// SPDX-License-Identifier: Apache-2.0
#include "Echo.h"

#include <array>
#include <cstring>
#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <thread>
#include <vector>

namespace zor::bench {

using platform::FileDescriptor;

namespace {

constexpr const char* socketName = "echo";
constexpr int backlog = 256;
constexpr std::size_t requestBytesMax = 4096;

void arm(int epoll, int operation, int fd) {
    epoll_event event = {.events = EPOLLIN | EPOLLONESHOT, .data = {.fd = fd}};
    ::epoll_ctl(epoll, operation, fd, &event);
}

void serve(int epoll, int listening, std::size_t requestBytes, const Frame& reply) {
    std::array<char, requestBytesMax> buffer;
    for (;;) {
        epoll_event event{};
        if (::epoll_wait(epoll, &event, 1, -1) != 1)
            continue;
        const int fd = event.data.fd;
        if (fd == listening) {
            const int accepted = ::accept4(listening, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
            if (accepted >= 0)
                arm(epoll, EPOLL_CTL_ADD, accepted);
            arm(epoll, EPOLL_CTL_MOD, listening);
            continue;
        }
        const ssize_t received = ::recv(fd, buffer.data(), buffer.size(), MSG_DONTWAIT);
        // The client writes a request in one piece; anything else is its end.
        if (received != static_cast<ssize_t>(requestBytes) ||
            ::send(fd, reply.data(), reply.size(), MSG_DONTWAIT | MSG_NOSIGNAL) != static_cast<ssize_t>(reply.size())) {
            ::close(fd);
            continue;
        }
        arm(epoll, EPOLL_CTL_MOD, fd);
    }
}

FileDescriptor listenIn(const std::string& directory) {
    FileDescriptor socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    const FileDescriptor opened(::open(directory.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    const std::string path = "/proc/self/fd/" + std::to_string(opened.get()) + "/" + socketName;
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
    ::unlinkat(opened.get(), socketName, 0);
    if (!socket.valid() || ::bind(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0 ||
        ::listen(socket.get(), backlog) != 0)
        failWithErrno("echo in " + directory);
    return socket;
}

} // namespace

Echo::Echo(const std::string& directory, std::size_t requestBytes, Frame reply, const Options& options)
    : directory_(directory), listening_(listenIn(directory)) {
    if (requestBytes > requestBytesMax)
        throw Failure("a request is too long for the echo");
    process_ = std::make_unique<ChildProcess>([this, requestBytes, reply = std::move(reply), options] {
        if (options.processor)
            pinThisThread(*options.processor);
        const int epoll = ::epoll_create1(EPOLL_CLOEXEC);
        arm(epoll, EPOLL_CTL_ADD, listening_.get());
        std::vector<std::thread> others;
        for (unsigned i = 1; i < options.threads; ++i)
            others.emplace_back([&] { serve(epoll, listening_.get(), requestBytes, reply); });
        serve(epoll, listening_.get(), requestBytes, reply);
    });
}

Client Echo::connect() const {
    return {directory_, socketName};
}

} // namespace zor::bench
