// SPDX-License-Identifier: Apache-2.0
#include "Upcall.h"

#include "ipc/Protocol.h"
#include "os/FileDescriptor.h"
#include "platform/Errno.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>

namespace zorvanerun {

using zor::platform::FileDescriptor;
namespace upcall = zor::upcall;
namespace ipc = zor::ipc;

namespace {

// The daemon reads no longer packets and sends no longer ones.
constexpr std::size_t requestBytesMax = std::size_t{64} * 1024;
constexpr std::size_t replyBytesMax = std::size_t{1} << 20;
/// Containers are made meanwhile.
constexpr time_t answerSeconds = 60;

constexpr const char* seeLog = "the daemon's log says why (private/var/root/Library/Logs/Zorvane/zorvaned.log)";

std::unexpected<Failure> failed(std::string what, std::string advice) {
    return std::unexpected(Failure{.what = std::move(what), .advice = std::move(advice)});
}

Result<FileDescriptor> connectTo(const Root& root) {
    const std::string path =
        root.below("/" + std::string(ipc::runtimeDirectory) + "/" + std::string(ipc::upcallServiceName));
    const std::string advice = "start the daemon (systemctl start zorvaned), or name its root with --root";
    const auto directory = zor::platform::openInRoot(root.descriptor.get(), std::string(ipc::runtimeDirectory).c_str(),
                                                     O_PATH | O_DIRECTORY);
    if (!directory)
        return failed(withReason("cannot reach zorvaned at " + path, directory.error()), advice);
    FileDescriptor socket(::socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
    if (!socket.valid())
        return failed(withReason("cannot make a socket", zor::Errno::last()), "see what limits this process");
    // Through the open directory no path is too long for an address.
    const std::string shortPath =
        "/proc/self/fd/" + std::to_string(directory->get()) + "/" + std::string(ipc::upcallServiceName);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, shortPath.data(), std::min(shortPath.size(), sizeof address.sun_path - 1));
    const timeval patience{.tv_sec = answerSeconds, .tv_usec = 0};
    (void)::setsockopt(socket.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
    (void)::setsockopt(socket.get(), SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience);
    if (::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0)
        return failed(withReason("cannot reach zorvaned at " + path, zor::Errno::last()), advice);
    ucred server{};
    socklen_t length = sizeof server;
    if (::getsockopt(socket.get(), SOL_SOCKET, SO_PEERCRED, &server, &length) != 0 || server.uid != 0)
        return failed("what serves " + path + " does not run as root",
                      "use the root of a daemon that does: only such a one can give containers to users");
    return socket;
}

Result<std::vector<std::uint8_t>> exchange(int socket, const std::vector<std::uint8_t>& request) {
    if (::send(socket, request.data(), request.size(), MSG_NOSIGNAL) != static_cast<ssize_t>(request.size()))
        return failed(withReason("cannot send to zorvaned", zor::Errno::last()), seeLog);
    std::vector<std::uint8_t> reply;
    ssize_t bytes = 0;
    do {
        // How long the packet is, and then the packet: room for the longest would be a megabyte to be cleared.
        bytes = ::recv(socket, nullptr, 0, MSG_PEEK | MSG_TRUNC);
        if (bytes > 0 && static_cast<std::size_t>(bytes) <= replyBytesMax) {
            reply.resize(static_cast<std::size_t>(bytes));
            bytes = ::recv(socket, reply.data(), reply.size(), MSG_TRUNC);
        }
    } while (bytes < 0 && errno == EINTR);
    if (bytes < 0)
        return failed(withReason("zorvaned does not answer the upcall", zor::Errno::last()), seeLog);
    if (bytes == 0)
        return failed("zorvaned ended the upcall's connection", seeLog);
    if (static_cast<std::size_t>(bytes) > reply.size())
        return failed("zorvaned's answer is too large", seeLog);
    return reply;
}

Failure refusal(upcall::ReturnCode code) {
    const std::string number = std::to_string(static_cast<std::int32_t>(code));
    if (code == upcall::ReturnCode::refused)
        return {.what = "zorvaned does not take this program for the kernel's agent (return code " + number + ")",
                .advice = "give its entry in etc/zorvane/identities.d the key KernelAgent, see zorvane-run(8); "
                          "'zorvanectl status' tells how entries match"};
    return {.what = "zorvaned refuses the upcall (return code " + number + ")", .advice = seeLog};
}

} // namespace

Result<ToldContainers> askForContainers(const Root& root, const Options& options, const WantedContainers& wanted) {
    const auto buffer = packRequest(options.identifier, options.user, wanted);
    const auto request = upcall::encodeRequest(buffer);
    if (buffer.empty() || request.size() > requestBytesMax)
        return failed("the request for the containers of " + options.identifier + " is too large",
                      "name fewer groups with --app-group and --system-group");
    const FileDescriptor socket = TRY(connectTo(root));
    const auto packet = TRY(exchange(socket.get(), request));
    const auto reply = upcall::decodeReply(packet);
    if (!reply)
        return failed("what came back from the upcall is no reply", "check that daemon and program are of one version");
    if (reply->returnCode != upcall::ReturnCode::success)
        return std::unexpected(refusal(reply->returnCode));
    auto told = readReply(reply->buffer, wanted, root.path);
    if (!told)
        return failed("no use can be made of zorvaned's answer for " + options.identifier + " and user " +
                          std::to_string(options.user) + ": " + told.error(),
                      seeLog);
    return std::move(*told);
}

} // namespace zorvanerun
