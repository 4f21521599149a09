// SPDX-License-Identifier: Apache-2.0
// Why content cannot be put into a container: one sentence for people.
#pragma once

#include <expected>
#include <string>

namespace zorvanectl::content {

struct Failure {
    /// Without a full stop; names in it are printable.
    std::string what;
};

template <typename T>
using Outcome = std::expected<T, Failure>;

/// "WHAT: what the errno means".
[[nodiscard]] std::unexpected<Failure> failed(const std::string& what, int number);
[[nodiscard]] std::unexpected<Failure> failed(std::string what);

} // namespace zorvanectl::content
