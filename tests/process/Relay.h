// SPDX-License-Identifier: Apache-2.0
// A root whose sockets lead to a real daemon: requests and replies can be lost or changed on the way. That is a slow or
// dying daemon to its clients, and one of another version.
#pragma once

#include "ipc/Protocol.h"
#include "process/DaemonProcess.h"
#include "support/FakeServer.h"

#include <gtest/gtest.h>

namespace zor::whole {

/// The fate of a request: it reaches the daemon; nothing comes for ten seconds, or until the client goes, and then
/// the connection ends; it ends at once.
enum class Fate { passedOn, unanswered, hungUp };

class Relay : public support::FakeServer {
public:
    using Judge = std::function<Fate(ipc::Command)>;
    enum class Message { request, reply };
    using Edit = std::function<void(Message, plist::Dictionary&)>;
    /// Both are called by a thread for each connection.
    explicit Relay(
        const DaemonProcess& daemon, Judge judge = [](ipc::Command) { return Fate::passedOn; },
        Edit edit = [](Message, plist::Dictionary&) {})
        : FakeServer([path = daemon.path("run/zorvane/com.veltra.zorvaned"), judge = std::move(judge),
                      edit = std::move(edit)](int from) {
              const platform::FileDescriptor to(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
              EXPECT_TRUE(support::connectTo(to.get(), path));
              while (const auto request = support::receiveFrame(from)) {
                  plist::Dictionary message = request->message();
                  const auto command = message.unsignedInteger(ipc::keys::command).value_or(0);
                  const Fate fate = judge(static_cast<ipc::Command>(command));
                  if (fate == Fate::unanswered) {
                      support::limitWaiting(from);
                      (void)support::receiveFrame(from);
                  }
                  if (fate != Fate::passedOn)
                      return;
                  edit(Message::request, message);
                  support::sendAll(to.get(), support::frameOf(message, request->header.id));
                  const auto reply = support::receiveFrame(to.get());
                  if (!reply)
                      return;
                  message = reply->message();
                  edit(Message::reply, message);
                  support::sendAll(from, support::frameOf(message, request->header.id, ipc::frameIsReply));
              }
          }) {
        std::filesystem::create_symlink(daemon.path("run/zorvane/zorvaned.status"),
                                        root() + "/run/zorvane/zorvaned.status");
    }
};

} // namespace zor::whole
