// SPDX-License-Identifier: Apache-2.0
// Answers the kernel's upcall: which containers does a process have. A missing one is made.
//
// A request is answered whole or with a status that says no: when one of its containers cannot be had, no path is told,
// though those that were made stay. A container that a reply with status 1 names is on the disk, as for any client. A
// stop in the middle leaves the containers made so far, each whole.
//
// Runs on the main thread, one packet at a time; the lookups take their locks themselves. Keeps nothing between
// packets. No packet can end the daemon: what is thrown ends at this class.
#pragma once

#include "base/ZORError.h"
#include "base/ZORException.h"
#include "fs/ZORFileManager.h"
#include "operations/Creation.h"
#include "platform/Service.h"
#include "store/ZORGlobalConfiguration.h"
#include "upcall/ProcessContainers.h"

#include <optional>
#include <string>
#include <vector>

namespace zor {

class UpcallServer {
public:
    struct Needs {
        const Log& log;
        ExceptionBoundary& boundary;
        ZORFileManager& fileManager;
        ZORGlobalConfiguration& configuration;
        Creation& creation;
    };
    /// Asks in the daemon's own name.
    UpcallServer(const Needs& needs, const platform::UpcallPort& port);
    UpcallServer(const UpcallServer&) = delete;
    UpcallServer& operator=(const UpcallServer&) = delete;

    /// The reply packet; empty for a packet that is too short to be answered.
    [[nodiscard]] std::vector<std::uint8_t> answer(const platform::UpcallPacket& packet);

private:
    void demux_server(const platform::UpcallPacket& request, std::vector<std::uint8_t>& reply);
    [[nodiscard]] upcall::ReturnCode server_get_process_containers(upcall::Bytes request, pid_t senderPid,
                                                                   std::vector<std::uint8_t>& reply);
    [[nodiscard]] upcall::ReturnCode readRequest(upcall::Bytes bytes, ProcessContainersRequest& request) const;
    /// False when one of them cannot be had; the others are made all the same.
    [[nodiscard]] bool lookUp(const ProcessContainersRequest& request, ProcessContainers& found);
    [[nodiscard]] std::optional<std::string> homeDirectoryOf(std::uint32_t personaId);
    void logContainers(const ProcessContainersRequest& request, const ProcessContainers& containers) const;
    void copyReply(const sb_packbuff& packbuff, std::vector<std::uint8_t>& reply) const;

    const Needs needs_;
    const Log& log_;
    const platform::UpcallPort& port_;
};

} // namespace zor
