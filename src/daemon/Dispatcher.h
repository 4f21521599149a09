// SPDX-License-Identifier: Apache-2.0
// The table of the commands, and the way of every message: whether there is such a command, who sends it, whether that
// client may, then the handler and the reply.
//
// A message that is refused ends its connection without a reply. The dispatcher holds no lock and keeps nothing of a
// peer between messages. Messages of one connection come one at a time, those of different ones in parallel.
#pragma once

#include "base/ContainerClass.h"
#include "daemon/Operations.h"
#include "daemon/ZORClientConnection.h"
#include "ipc/Protocol.h"
#include "platform/Service.h"

#include <array>
#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string_view>

namespace zor {

// The commands that a client may send: which entitlement each needs, who handles it, and who sends the reply.

struct CommandContext;
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

class Dispatcher {
public:
    Dispatcher(const Log& log, UserIdentity& users, Operations& operations)
        : log_(log), users_(users), operations_(operations) {}
    Dispatcher(const Dispatcher&) = delete;
    Dispatcher& operator=(const Dispatcher&) = delete;

    /// The per-message handler.
    void ZORProcessIpsiEvent(platform::PeerConnection& connection, platform::ServiceEvent& event);

    /// Since the start, for the status.
    struct Counts {
        std::uint64_t served = 0;
        std::uint64_t refused = 0;
    };
    [[nodiscard]] Counts counts() const { return {served_.load(), refused_.load()}; }

private:
    bool serve(platform::PeerConnection& connection, platform::ServiceEvent& event);
    /// The client of an admitted message; nullptr (said, where it is to be said) when the message is refused.
    std::shared_ptr<ZORClientConnection> checkEntitlementsAndInitClientObject(const ZORCommandTableRow& row,
                                                                              const platform::Identity& identity);
    /// Keeps what is stored for the peer's identifier up to date, unless somebody registered it on the peer's behalf.
    /// The grant has entitlements; those of the identifier are meant, whichever of its executables the message comes
    /// from. Two atomic reads while neither the grant nor what is stored has changed.
    void registerEntitlements(const std::string* identifier, const platform::IdentityGrant& grant) const;
    void sayMissingEntitlement(const ZORCommandTableRow& row, const platform::Identity& identity) const;

    const Log& log_;
    UserIdentity& users_;
    Operations& operations_;
    std::atomic<std::uint64_t> served_{0};
    std::atomic<std::uint64_t> refused_{0};
};

} // namespace zor
