// SPDX-License-Identifier: Apache-2.0
// The kernel's question for a process: whose containers, and which. Read from a packed buffer, each byte of which is
// taken for hostile.
#pragma once

#include "base/Log.h"
#include "upcall/packbuff/Packbuff.h"
#include "upcall/packbuff/UpcallMessage.h"

#include <cstdint>
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

} // namespace zor
