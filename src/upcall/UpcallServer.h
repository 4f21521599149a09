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

#include "base/Log.h"
#include "base/ZORError.h"
#include "fs/ZORFileManager.h"
#include "operations/Creation.h"
#include "platform/Service.h"
#include "store/Configuration.h"
#include "upcall/packbuff/Packbuff.h"
#include "upcall/packbuff/UpcallMessage.h"

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

namespace zor {

// The kernel's question for a process, and its answer: whose containers, and which. The question is read from a packed
// buffer, each byte of which is taken for hostile.

struct ProcessContainersRequest {
    std::optional<std::string> codeSignatureIdentifier;
    std::optional<std::string> containerIdentifier;
    /// Owner of the data and group containers.
    std::uint32_t personaId = 0;
    /// In the order of the request; an identifier may stand here twice.
    std::vector<std::string> appGroupIdentifiers;
    std::optional<std::string> systemContainerIdentifier;
    std::vector<std::string> systemGroupIdentifiers;

    /// The identifier of the data container; nullptr when none is wanted.
    [[nodiscard]] const std::string* dataContainerIdentifier() const {
        if (containerIdentifier)
            return &*containerIdentifier;
        return codeSignatureIdentifier ? &*codeSignatureIdentifier : nullptr;
    }
};

/// Reads from the cursor to the end item. Anything but success has been logged, and leaves `request` half filled.
[[nodiscard]] upcall::ReturnCode readProcessContainersRequest(const Log& log, sb_packbuff& packbuff,
                                                              ProcessContainersRequest& request);

/// Absolute paths, each there or not. Groups by identifier.
struct ProcessContainers {
    std::optional<std::string> homeDirectory;
    std::optional<std::string> dataContainer;
    std::optional<std::string> temporaryDirectory;
    std::optional<std::map<std::string, std::string>> appGroups;
    std::optional<std::string> systemContainer;
    std::optional<std::map<std::string, std::string>> systemGroups;
};

/// Packs what there is in its fixed order, and the status behind it: whether `success` holds and all could be packed.
/// An answer that does not fit is logged, and nothing but the status is packed after it.
void packProcessContainersReply(const Log& log, sb_packbuff& packbuff, const ProcessContainers& containers,
                                bool success);

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
