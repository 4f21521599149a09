// SPDX-License-Identifier: Apache-2.0
#include "process/Relay.h"

#include "ipc/Names.h"
#include "support/Frames.h"

#include <sys/socket.h>

namespace zor::whole {

namespace {

using support::Frame;
using support::receiveFrame;

void pass(int from, const std::string& daemon, const Relay::Judge& judge) {
    const platform::FileDescriptor to(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (!support::connectTo(to.get(), daemon))
        return;
    const auto put = [](int socket, const Frame& frame) {
        support::sendAll(
            socket, support::frameOf(frame.header.payloadBytes, frame.header.flags, frame.header.id, frame.payload));
    };
    while (const auto request = receiveFrame(from)) {
        const auto command = request->message().unsignedInteger(ipc::keys::command).value_or(0);
        const Relay::Fate fate = judge(static_cast<ipc::Command>(command));
        if (fate == Relay::Fate::unanswered) {
            support::limitWaiting(from);
            (void)receiveFrame(from);
        }
        if (fate != Relay::Fate::passedOn)
            return;
        put(to.get(), *request);
        if (const auto reply = receiveFrame(to.get()))
            put(from, *reply);
    }
}

std::string socketOf(const DaemonProcess& daemon) {
    std::string path = daemon.path(std::string(ipc::runtimeDirectory));
    return path.append("/").append(ipc::serviceName);
}

} // namespace

Relay::Relay(const DaemonProcess& daemon, Judge judge)
    : FakeServer([path = socketOf(daemon), judge = std::move(judge)](int from) { pass(from, path, judge); }) {}

} // namespace zor::whole
