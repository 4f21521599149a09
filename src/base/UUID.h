// SPDX-License-Identifier: Apache-2.0
// A UUID as the daemon uses it. Its canonical string names directories and locks.
#pragma once

#include "ipc/Uuid.h"

#include <compare>
#include <optional>
#include <string>
#include <string_view>

namespace zor {

class UUID {
public:
    static constexpr std::size_t byteCount = 16;
    using Bytes = ipc::UuidBytes;

    UUID() = default;
    explicit UUID(const Bytes& bytes) : bytes_(bytes) {}
    /// A random (version 4) UUID from the kernel's generator.
    static UUID random();
    /// The 8-4-4-4-12 form in either case; nothing else.
    static std::optional<UUID> parse(std::string_view text);

    /// Upper-case, 36 characters.
    [[nodiscard]] std::string string() const;
    [[nodiscard]] const Bytes& bytes() const { return bytes_; }
    auto operator<=>(const UUID&) const = default;

private:
    Bytes bytes_{};
};

} // namespace zor
