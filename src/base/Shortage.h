// SPDX-License-Identifier: Apache-2.0
// Errors that say nothing of what was looked at: this process, or the system, had no descriptor or no memory for the
// look. A thing that such a look did not find is not taken for absent.
#pragma once

#include <cerrno>

namespace zor::platform {

[[nodiscard]] inline bool isOwnShortage(int errorNumber) {
    return errorNumber == EMFILE || errorNumber == ENFILE || errorNumber == ENOMEM;
}

} // namespace zor::platform
