// SPDX-License-Identifier: Apache-2.0
// The commands that a client may send: which entitlement each needs, who handles it, and who sends the reply.
#pragma once

#include "base/ContainerClass.h"
#include "daemon/Operations.h"
#include "daemon/ZORClientConnection.h"
#include "ipc/Protocol.h"
#include "platform/Service.h"

#include <array>
#include <memory>
#include <string_view>

namespace zor {

/// The things that a handler works with. `request` and `reply` live as long as the call; a handler that replies later
/// keeps `channel` and what it needs of the rest.
struct CommandContext {
    const plist::Dictionary& request;
    plist::Dictionary& reply;
    const std::shared_ptr<ZORClientConnection>& client;
    const std::shared_ptr<platform::ReplyChannel>& channel;
    UserIdentity& users;
    Operations& operations;
    const Log& log;
    /// Success when the handler is entered; a handler that fails stores its code here.
    ErrorCode& error;
};

using ZORCommandHandler = void (*)(CommandContext&);

/// Stands for "no entitlement needed": the peer must have an entitlement dictionary all the same.
inline constexpr std::string_view noEntitlementRequired = "com.veltra.private.Zorvane.none";

enum class ReplyFlag : std::int32_t {
    handlerReplies = 0,
    dispatcherReplies = 1,
};

struct ZORCommandTableRow {
    ipc::Command command;
    ZORCommandHandler handler;
    std::string_view requiredEntitlement;
    ReplyFlag replyFlag;
};

/// Row i describes command i.
extern const std::array<ZORCommandTableRow, ipc::commandCount> commandTable;

} // namespace zor
