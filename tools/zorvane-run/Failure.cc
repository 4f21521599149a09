// SPDX-License-Identifier: Apache-2.0
#include "Failure.h"

#include <cstring>

namespace zorvanerun {

std::string withReason(const std::string& what, int number) {
    const char* reason = strerrordesc_np(number);
    return what + ": " + (reason ? reason : "unknown error");
}

} // namespace zorvanerun
