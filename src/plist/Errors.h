// SPDX-License-Identifier: Apache-2.0
// Why a property list could not be read or written. The reasons are literals: an error costs nothing to make and drop,
// which matters because clients can provoke them at will.
#pragma once

#include <cstddef>
#include <string>

namespace zor::plist {

struct ReadError {
    /// Where in the input, in bytes.
    std::size_t offset = 0;
    /// What is wrong there, in words. Never null, lives for ever.
    const char* reason = "";

    /// "byte 12: not a property list"
    [[nodiscard]] std::string text() const;
};

struct WriteError {
    const char* reason = "";
};

} // namespace zor::plist
