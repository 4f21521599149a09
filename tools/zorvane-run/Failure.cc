// SPDX-License-Identifier: Apache-2.0
#include "Failure.h"

namespace zorvanerun {

std::string withReason(const std::string& what, zor::Errno error) {
    return what + ": " + error.text();
}

} // namespace zorvanerun
