// SPDX-License-Identifier: Apache-2.0
// The kernel's question for a process, and its answer: whose containers, and which. The question is read from a packed
// buffer, each byte of which is taken for hostile.
#pragma once

#include "base/Log.h"
#include "upcall/packbuff/Packbuff.h"
#include "upcall/packbuff/UpcallMessage.h"

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

namespace zor {

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

} // namespace zor
