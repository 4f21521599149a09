// SPDX-License-Identifier: Apache-2.0
#include "Connection.h"

#include "Diagnosis.h"
#include "ipc/Frame.h"
#include "ipc/Protocol.h"
#include "platform/Errno.h"
#include "plist/Codec.h"

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <iterator>
#include <limits>
#include <poll.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>

namespace zorvane {

using zor::platform::FileDescriptor;
namespace ipc = zor::ipc;
namespace plist = zor::plist;

namespace {

std::unexpected<Error> fail(Error::Kind kind, std::string message) {
    return std::unexpected(Error{.kind = kind, .code = 0, .message = std::move(message)});
}

/// The same whether a request met the end or the wait for its reply did: why the daemon hung up it cannot say any more.
std::unexpected<Error> ended() {
    return fail(Error::Kind::refused, "zorvaned ended the connection without an answer");
}

std::string withReason(const std::string& what, int number) {
    const char* reason = strerrordesc_np(number);
    return what + ": " + (reason ? reason : "unknown error");
}

/// The address of a socket in `directory`; through the open directory when the path is too long for one.
sockaddr_un addressOf(const std::string& path, const std::string& name, int directory) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::string text = path;
    if (text.size() >= sizeof address.sun_path)
        text = "/proc/self/fd/" + std::to_string(directory) + "/" + name;
    std::memcpy(address.sun_path, text.data(), std::min(text.size(), sizeof address.sun_path - 1));
    return address;
}

/// How long a connect waits at a time where it can be interrupted.
constexpr std::chrono::milliseconds connectTurn{100};

/// A connect waits for room among those who have not been accepted yet: of a daemon that is still starting, other users
/// can take all of it.
void limitConnecting(int socket, std::uint32_t timeoutMilliseconds) {
    const timeval limit{.tv_sec = timeoutMilliseconds / 1000,
                        .tv_usec = static_cast<suseconds_t>(timeoutMilliseconds % 1000) * 1000};
    (void)::setsockopt(socket, SOL_SOCKET, SO_SNDTIMEO, &limit, sizeof limit); // all zero: no limit
}

pid_t processBehind(int socket) {
    ucred credentials{};
    socklen_t length = sizeof credentials;
    return ::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &credentials, &length) == 0 ? credentials.pid : -1;
}

constexpr const char* timeoutVariable = "ZORVANE_TIMEOUT_MILLISECONDS";
/// A daemon that is well answers in milliseconds; one that waits for a disk gets time for that.
constexpr std::uint32_t timeoutMillisecondsDefault = 60'000;

std::optional<std::uint32_t> timeoutOfEnvironment() {
    const char* const text = ::secure_getenv(timeoutVariable);
    std::uint32_t milliseconds = 0;
    if (!text)
        return std::nullopt;
    const char* const end = text + std::strlen(text);
    const auto [last, failure] = std::from_chars(text, end, milliseconds);
    return failure == std::errc() && last == end && end != text ? std::optional(milliseconds) : std::nullopt;
}

/// Commands that walk a tree of a client's, or wait for an unlock: nobody knows how long that takes.
bool mayTakeLong(ipc::Command command) {
    switch (command) {
    case ipc::Command::replaceContainer:
    case ipc::Command::stageContainersForDelete:
    case ipc::Command::deleteContainersOnDeathRow:
    case ipc::Command::recreateDefaultStructure:
    case ipc::Command::recreateDefaultStructure2:
    case ipc::Command::deleteContainer:
    case ipc::Command::wipeEntitledPluginDataContainer:
    case ipc::Command::wipeDataContainerContent:
    case ipc::Command::setDataProtection:
    case ipc::Command::getDiskUsage:
        return true;
    default:
        return false;
    }
}

constexpr std::size_t replyBytesFirst = std::size_t{64} * 1024;
constexpr std::size_t replyBytesMax = std::size_t{1}
                                      << 30; // a list of every container of a large device takes a few MiB

} // namespace

Result<Client::Connection> Client::Connection::open(const ConnectOptions& options, Service service) {
    const std::string name(service == Service::commands ? ipc::serviceName : ipc::statusSocketName);
    std::string directoryPath = options.root;
    if (directoryPath.empty() || directoryPath.back() != '/')
        directoryPath += '/';
    directoryPath += ipc::runtimeDirectory;
    const std::string path = directoryPath + "/" + name;
    const FileDescriptor directory(::open(directoryPath.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!directory.valid())
        return fail(Error::Kind::unreachable, withReason("cannot reach zorvaned at " + path, errno));
    FileDescriptor socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (!socket.valid())
        return fail(Error::Kind::unreachable, withReason("cannot make a socket", errno));
    const sockaddr_un address = addressOf(path, name, directory.get());
    Connection connection(std::move(socket), options);
    connection.startTime(connection.timeoutMilliseconds());
    for (;;) {
        limitConnecting(connection.socket_.get(), connection.connectMilliseconds());
        if (::connect(connection.socket_.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0)
            return connection;
        if (errno != EINTR && errno != EAGAIN)
            return fail(Error::Kind::unreachable, withReason("cannot reach zorvaned at " + path, errno));
        // A socket without a peer is always ready: this asks only whether the time is over.
        if (const auto time = connection.waitFor(0); !time)
            return std::unexpected(connection.explained(time.error()));
    }
}

std::uint32_t Client::Connection::connectMilliseconds() const {
    using std::chrono::milliseconds;
    milliseconds turn = options_.interruptDescriptor >= 0 ? connectTurn : milliseconds(0);
    if (deadline_) {
        const auto left = std::max(std::chrono::ceil<milliseconds>(*deadline_ - Clock::now()), milliseconds(1));
        turn = turn == milliseconds(0) ? left : std::min(turn, left);
    }
    return static_cast<std::uint32_t>(turn.count());
}

std::uint32_t Client::Connection::timeoutMilliseconds() const {
    return options_.timeoutMilliseconds ? *options_.timeoutMilliseconds
                                        : timeoutOfEnvironment().value_or(timeoutMillisecondsDefault);
}

void Client::Connection::startTime(std::uint32_t milliseconds) {
    limitMilliseconds_ = milliseconds;
    deadline_.reset();
    if (milliseconds != 0)
        deadline_ = Clock::now() + std::chrono::milliseconds(milliseconds);
}

Result<void> Client::Connection::waitFor(short events) {
    if (!pollWaits())
        return {}; // the blocking call that follows waits
    for (;;) {
        constexpr std::int64_t pollMillisecondsMax = std::numeric_limits<int>::max();
        const std::int64_t left =
            deadline_ ? std::chrono::ceil<std::chrono::milliseconds>(*deadline_ - Clock::now()).count() : -1;
        if (deadline_ && left <= 0)
            return fail(Error::Kind::timedOut, "zorvaned did not answer in time");
        // poll leaves a negative descriptor out.
        pollfd descriptors[] = {{.fd = socket_.get(), .events = events, .revents = 0},
                                {.fd = options_.interruptDescriptor, .events = POLLIN, .revents = 0}};
        const int ready =
            ::poll(descriptors, std::size(descriptors), static_cast<int>(std::min(left, pollMillisecondsMax)));
        if (ready > 0 && descriptors[1].revents != 0) {
            interrupted_ = true;
            return fail(Error::Kind::timedOut, "the call was given up; the command may still be carried out");
        }
        if (ready > 0)
            return {};
        if (ready < 0 && errno != EINTR)
            return fail(Error::Kind::unreachable, withReason("cannot wait for zorvaned", errno));
    }
}

Result<std::uint64_t> Client::Connection::send(const plist::Dictionary& request) {
    plist::Data frame(ipc::frameHeaderBytes);
    if (const auto appended = plist::appendBinary(request, frame); !appended)
        return fail(Error::Kind::protocol, std::string("the request cannot be sent: ") + appended.error().reason);
    const std::size_t payloadBytes = frame.size() - ipc::frameHeaderBytes;
    if (payloadBytes > ipc::requestPayloadBytesMax)
        return fail(Error::Kind::protocol, "the request is too large");
    const ipc::FrameHeader header{
        .payloadBytes = static_cast<std::uint32_t>(payloadBytes), .flags = ipc::frameExpectsReply, .id = ++lastId_};
    ipc::encodeFrameHeader(header, std::span(frame).first<ipc::frameHeaderBytes>());
    for (std::size_t sent = 0; sent < frame.size();) {
        TRY(waitFor(POLLOUT));
        // A blocking send could wait for the rest of the frame without a limit.
        const int flags = pollWaits() ? MSG_NOSIGNAL | MSG_DONTWAIT : MSG_NOSIGNAL;
        const ssize_t count = ::send(socket_.get(), frame.data() + sent, frame.size() - sent, flags);
        if (count < 0 && (errno == EINTR || errno == EAGAIN))
            continue;
        if (count < 0)
            return ended();
        sent += static_cast<std::size_t>(count);
    }
    return header.id;
}

Result<void> Client::Connection::readAll(std::uint8_t* bytes, std::size_t count) {
    for (std::size_t have = 0; have < count;) {
        TRY(waitFor(POLLIN));
        const ssize_t got = ::recv(socket_.get(), bytes + have, count - have, 0);
        if (got < 0 && errno == EINTR)
            continue;
        if (got <= 0)
            return ended();
        have += static_cast<std::size_t>(got);
    }
    return {};
}

Result<Client::Connection::Reply> Client::Connection::receive() {
    std::array<std::uint8_t, ipc::frameHeaderBytes> headerBytes{};
    TRY(readAll(headerBytes.data(), headerBytes.size()));
    const ipc::FrameHeader header = ipc::decodeFrameHeader(headerBytes);
    if (!header.isValidReply() || header.payloadBytes > replyBytesMax)
        return fail(Error::Kind::protocol, "what came back is no reply");
    // Memory is taken as bytes arrive, not as the header promises.
    plist::Data payload;
    while (payload.size() < header.payloadBytes) {
        const std::size_t have = payload.size();
        payload.resize(std::min<std::size_t>(header.payloadBytes, std::max(2 * have, replyBytesFirst)));
        TRY(readAll(payload.data() + have, payload.size() - have));
    }
    auto value = plist::readBinary(payload);
    plist::Dictionary* content = value ? value->asMutableDictionary() : nullptr;
    if (!content)
        return fail(Error::Kind::protocol, "what came back is no dictionary");
    return Reply{.id = header.id, .content = std::move(*content)};
}

Result<plist::Dictionary> Client::Connection::replyTo(std::uint64_t id) {
    for (;;) {
        if (auto early = early_.extract(id))
            return std::move(early.mapped());
        Reply reply = TRY(receive());
        early_.insert_or_assign(reply.id, std::move(reply.content));
    }
}

Error Client::Connection::explained(const Error& error) const {
    if (error.kind == Error::Kind::refused)
        return whyEnded(options_, std::chrono::duration_cast<std::chrono::milliseconds>(Clock::now() - connected_));
    if (error.kind == Error::Kind::timedOut && !interrupted_)
        return whySilent(processBehind(socket_.get()), limitMilliseconds_);
    return error;
}

Result<plist::Dictionary> Client::Connection::exchange(const plist::Dictionary& request) {
    return replyTo(TRY(send(request)));
}

Result<plist::Dictionary> Client::Connection::call(const plist::Dictionary& request) {
    const auto command = static_cast<ipc::Command>(request.unsignedInteger(ipc::keys::command).value_or(0));
    startTime(!options_.timeoutMilliseconds && mayTakeLong(command) ? timeoutOfEnvironment().value_or(0)
                                                                    : timeoutMilliseconds());
    return judged(exchange(request));
}

std::vector<Result<plist::Dictionary>> Client::Connection::callTogether(std::span<const plist::Dictionary> requests) {
    startTime(timeoutMilliseconds());
    std::vector<Result<std::uint64_t>> sent;
    for (const plist::Dictionary& request : requests)
        sent.push_back(send(request));
    std::vector<Result<plist::Dictionary>> replies;
    for (const Result<std::uint64_t>& id : sent)
        replies.push_back(judged(id ? replyTo(*id) : Result<plist::Dictionary>(std::unexpected(id.error()))));
    return replies;
}

Result<plist::Dictionary> Client::Connection::judged(Result<plist::Dictionary> reply) const {
    if (!reply)
        return std::unexpected(explained(reply.error()));
    const auto code = reply->unsignedInteger(ipc::keys::replyError);
    if (!code)
        return fail(Error::Kind::protocol, "the reply has no \"ReplyError\"");
    if (*code != ipc::replySuccess)
        return std::unexpected(Error{.kind = Error::Kind::daemon, .code = *code, .message = errorText(*code).meaning});
    return reply;
}

} // namespace zorvane
