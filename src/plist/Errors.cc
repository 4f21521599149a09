// SPDX-License-Identifier: Apache-2.0
#include "plist/Errors.h"

namespace zor::plist {

std::string ReadError::text() const {
    return "byte " + std::to_string(offset) + ": " + reason;
}

} // namespace zor::plist
