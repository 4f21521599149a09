// SPDX-License-Identifier: Apache-2.0
#include "Diagnosis.h"

#include "Connection.h"
#include "ipc/Protocol.h"

#include <fcntl.h>
#include <thread>
#include <unistd.h>

namespace zorvane {

namespace plist = zor::plist;
namespace keys = zor::ipc::keys;

namespace {

/// A caller that asks has been waiting already.
constexpr std::uint32_t askMillisecondsMax = 1000;
/// A daemon that listens, and accepts nobody now, is there.
constexpr std::uint32_t connectMillisecondsMax = 50;

Error error(Error::Kind kind, std::string message, std::string advice) {
    return {.kind = kind, .code = 0, .message = std::move(message), .advice = std::move(advice)};
}

/// Appends: at -O2 gcc 12 takes a sum of such texts for an overflow.
std::string endedWithoutAnswer(std::string_view more) {
    std::string text = "zorvaned ended the connection without an answer, ";
    text += more;
    return text;
}

/// Whether the file that this process runs has been taken from its place, as an upgrade does.
bool ownExecutableIsGone() {
    char path[4096];
    const ssize_t bytes = ::readlink("/proc/self/exe", path, sizeof path);
    return bytes > 0 && std::string_view(path, static_cast<std::size_t>(bytes)).ends_with(" (deleted)");
}

Error whyNotKnown(const plist::Dictionary& peer) {
    if (ownExecutableIsGone())
        return error(Error::Kind::refused,
                     "zorvaned does not know this program any more: its executable was replaced while it ran",
                     "start this program again");
    const std::string* explanation = peer.string(keys::peerExplanation);
    return error(Error::Kind::refused,
                 "zorvaned does not know this program: " +
                     (explanation ? *explanation : std::string("it does not say why")),
                 "put an entry for its executable into etc/zorvane/identities.d below the daemon's root; 'zorvanectl "
                 "registry list' shows those that count");
}

Error whyKnownButRefused(const plist::Dictionary& status, const plist::Dictionary& peer,
                         std::chrono::milliseconds age) {
    const plist::Dictionary* daemon = status.dictionary(keys::statusDaemon);
    const auto uptime = daemon ? daemon->unsignedInteger(keys::daemonUptimeMilliseconds) : std::nullopt;
    const std::string* identifier = peer.string(keys::peerIdentifier);
    const std::string name = identifier ? " as " + *identifier : "";
    if (!peer.isTrue(keys::peerMaySendEveryCommand))
        return error(
            Error::Kind::refused, "zorvaned knows this program" + name + ", but not as one that may do this",
            "grant it more in its entry of etc/zorvane/identities.d; 'zorvanectl status' shows what it may do");
    if (uptime && *uptime < static_cast<std::uint64_t>(age.count()))
        return error(Error::Kind::unreachable, "zorvaned ended while the call waited, and has been started again",
                     "ask again; what the call was to change may have been done or not");
    return error(Error::Kind::refused,
                 endedWithoutAnswer("though it knows this program" + name + " and lets it send every command"),
                 "look into the daemon's log (zorvaned.log): a request that is no valid one, or too many connections, "
                 "are said there");
}

/// Nor for commands: a daemon may be without its status socket.
bool nobodyListens(ConnectOptions options) {
    options.timeoutMilliseconds = connectMillisecondsMax;
    const auto connection = Client::Connection::open(options, Client::Connection::Service::commands);
    return !connection && connection.error().kind == Error::Kind::unreachable;
}

} // namespace

Error whyEnded(const ConnectOptions& options, std::chrono::milliseconds age) {
    ConnectOptions quick = options;
    quick.timeoutMilliseconds = askMillisecondsMax;
    const auto giveUp = Clock::now() + std::chrono::milliseconds(askMillisecondsMax / 4);
    for (;;) {
        auto connection = Client::Connection::open(quick, Client::Connection::Service::status);
        if (!connection && connection.error().kind == Error::Kind::unreachable && nobodyListens(options))
            return error(Error::Kind::unreachable, "zorvaned ended while the call waited, and is not there any more",
                         "start the daemon (systemctl start zorvaned) and look into its log; what the call was to "
                         "change may have been done or not");
        if (connection) {
            connection->startTime(askMillisecondsMax);
            if (const auto reply = connection->receive())
                if (const plist::Dictionary* peer = reply->content.dictionary(keys::statusPeer))
                    return peer->isTrue(keys::peerKnown) ? whyKnownButRefused(reply->content, *peer, age)
                                                         : whyNotKnown(*peer);
        }
        // The kernel closes a dying daemon's descriptors one after another: the sockets may still listen.
        if (Clock::now() >= giveUp)
            break;
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return error(Error::Kind::refused, endedWithoutAnswer("and does not tell whom it takes this program for"),
                 "see 'zorvanectl status', and the daemon's log (zorvaned.log)");
}

Error whySilent(pid_t daemon, std::uint32_t milliseconds) {
    const std::string time = " within " + std::to_string(milliseconds) + " ms";
    const std::string process = std::to_string(daemon);
    char text[512];
    const zor::platform::FileDescriptor file(
        daemon > 0 ? ::open(("/proc/" + process + "/stat").c_str(), O_RDONLY | O_CLOEXEC) : -1);
    const ssize_t bytes = file.valid() ? ::read(file.get(), text, sizeof text) : -1;
    // "123 (name) T 1 …"; the name may hold anything.
    const std::string_view stat(text, bytes > 0 ? static_cast<std::size_t>(bytes) : 0);
    const std::size_t name = stat.rfind(')');
    const char state = name != std::string_view::npos && name + 2 < stat.size() ? stat[name + 2] : '?';
    if (state == 'T' || state == 't')
        return error(Error::Kind::timedOut, "zorvaned (process " + process + ") is stopped, and did not answer" + time,
                     "have it go on with 'kill -CONT " + process + "', or end the debugger that holds it");
    return error(Error::Kind::timedOut, "zorvaned did not answer" + time,
                 "look at the daemon's log, or wait longer with --timeout or ZORVANE_TIMEOUT_MILLISECONDS; the command "
                 "may still be carried out");
}

} // namespace zorvane
