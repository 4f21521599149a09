// SPDX-License-Identifier: Apache-2.0
// Why content cannot be put into a container: one sentence for people.
#pragma once

#include "platform/Errno.h"

#include <expected>
#include <string>

namespace zorvanectl::content {

struct Failure {
    /// Without a full stop; names in it are printable.
    std::string what;
    /// The advice, where trying again does not help. Lives for ever.
    const char* advice = "";
};

template <typename T>
using Outcome = std::expected<T, Failure>;

/// "WHAT: what the error means".
[[nodiscard]] std::unexpected<Failure> failed(const std::string& what, zor::Errno error);
[[nodiscard]] std::unexpected<Failure> failed(std::string what);
/// The source of an installation is not taken as it is.
[[nodiscard]] std::unexpected<Failure> refused(std::string what);
/// The file system is too full for it.
[[nodiscard]] std::unexpected<Failure> lacksRoom(std::string what);

} // namespace zorvanectl::content
