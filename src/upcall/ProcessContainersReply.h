// SPDX-License-Identifier: Apache-2.0
// The containers of a process, as the kernel is told of them.
#pragma once

#include "base/Log.h"
#include "upcall/packbuff/Packbuff.h"

#include <map>
#include <optional>
#include <string>

namespace zor {

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
